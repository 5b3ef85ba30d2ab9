"""scripts/check-sizes and .clang-tidy: a file or a function that is too long or too tangled is told."""

import os
import shutil
import subprocess
import tempfile
import unittest

ROOT = os.path.dirname(os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__)))))
SCRIPT = os.path.join(ROOT, "scripts", "check-sizes")


class Sizes(unittest.TestCase):
    def setUp(self):
        self.root = tempfile.mkdtemp()
        self.addCleanup(shutil.rmtree, self.root)

    def write(self, path, text):
        path = os.path.join(self.root, path)
        os.makedirs(os.path.dirname(path), exist_ok=True)
        with open(path, "w", encoding="utf-8") as file:
            file.write(text)
        return path


class Files(Sizes):
    def assert_told(self, *lines):
        checked = subprocess.run([SCRIPT, self.root], capture_output=True, text=True, check=False)
        self.assertEqual(checked.stdout.splitlines(), list(lines))
        self.assertEqual(checked.returncode, 1 if lines else 0)

    def test_may_have_400_lines(self):
        self.write("daemon/quarn_d_backup/queue.cpp", "\n" * 400)
        self.assert_told()

    def test_may_not_have_more(self):
        self.write("daemon/quarn_d_backup/queue.cpp", "\n" * 401)
        self.write("transport/include/store.h", "// a line\n" * 1000)
        self.assert_told("daemon/quarn_d_backup/queue.cpp: 401 lines (at most 400)",
                         "transport/include/store.h: 1000 lines (at most 400)")

    def test_may_be_long_where_they_are_no_sources(self):
        self.write("docs/notes.md", "\n" * 1000)
        self.write("tests/unit/core/loop_test.cpp", "\n" * 1000)
        self.write("bench/fleet.py", "\n" * 1000)
        self.assert_told()


@unittest.skipUnless(shutil.which("clang-tidy"), "clang-tidy is not installed")
class Functions(Sizes):
    """As the lint step looks at a source and at the headers of the product."""

    def lint(self, path):
        return subprocess.run(
            ["clang-tidy", "--quiet", "--config-file=" + os.path.join(ROOT, ".clang-tidy"), path,
             "--", "-std=c++17"], capture_output=True, text=True, check=False)

    def assert_told(self, path, text):
        linted = self.lint(path)
        self.assertIn(text, linted.stdout)
        self.assertNotEqual(linted.returncode, 0)

    def test_may_have_50_lines(self):
        path = self.write("daemon/count.cpp",
                          "int count() {\n  int i = 0;\n" + "  ++i;\n" * 47 + "  return i;\n}\n")
        linted = self.lint(path)
        self.assertEqual((linted.stdout, linted.returncode), ("", 0))

    def test_may_not_have_more(self):
        path = self.write("daemon/count.cpp",
                          "int count() {\n  int i = 0;\n" + "  ++i;\n" * 60 + "  return i;\n}\n")
        self.assert_told(path, "function 'count' exceeds recommended size/complexity thresholds")

    def test_may_not_be_tangled(self):
        tangle = ("  for (int i = 0; i < a; ++i) {\n    if (i == b) {\n      while (b > 0) {\n"
                  "        if (--b == i) return a;\n      }\n    }\n  }\n")
        path = self.write("common/tangle.cpp", "int tangle(int a, int b) {\n" + tangle * 3 +
                          "  return b;\n}\n")
        self.assert_told(path, "function 'tangle' has cognitive complexity of 30 (threshold 25)")

    def test_may_not_be_long_in_a_header(self):
        self.write("common/count.h", "inline int count() {\n  int i = 0;\n" + "  ++i;\n" * 60 +
                   "  return i;\n}\n")
        path = self.write("common/use.cpp",
                          '#include "count.h"\n\nint use() { return count(); }\n')
        self.assert_told(path, "function 'count' exceeds recommended size/complexity thresholds")


if __name__ == "__main__":
    unittest.main()
