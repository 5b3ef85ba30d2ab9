"""The threat model names attacks that exist: a row whose test was renamed or removed is a wish."""
import glob
import os
import re
import sys
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
sys.path.insert(0, os.path.join(HERE, "../../integration"))
from quarn_test import read_file  # noqa: E402

TESTS = os.path.join(HERE, "../..")
MODEL = os.path.join(TESTS, "../docs/threat-model.md")
SECTIONS = 4


def boundaries():
    """Cells of each row, by section."""
    text = read_file(MODEL)
    for section in text[text.index("\n## Boundaries"):].split("\n### ")[1:]:
        table = section.split("\n#")[0].split("\n|---|---|---|---|\n")[1]
        yield section.splitlines()[0], [
            [cell.strip() for cell in re.split(r"(?<!\\)\|", line)[1:-1]]
            for line in table.splitlines() if line.startswith("|")]


def programs():
    """Every test's program: the Python file it is, or what is built in the folder that names it."""
    found = {}
    for kind in ("integration", "security"):
        for path in glob.glob(os.path.join(TESTS, kind, "*/test_*.py")):
            name = "%s_%s" % (kind, os.path.basename(path)[:-len(".py")])
            found[name] = set(re.findall(r"^class (\w+)\(", read_file(path), re.MULTILINE))
    for path in glob.glob(os.path.join(TESTS, "*/*/CMakeLists.txt")):
        cases = set()
        for source in glob.glob(os.path.join(os.path.dirname(path), "*.cpp")):
            cases |= {".".join(case) for case in re.findall(
                r"^(?:TEST|TEST_F|TEST_P|TYPED_TEST)\((\w+), (\w+)\)", read_file(source), re.MULTILINE)}
        for name in re.findall(r"_test\(\s*(\w+)|add_executable\((test_\w+)", read_file(path)):
            program = name[0] or name[1]
            found[program] = cases
    return found


class Model(unittest.TestCase):
    def test_each_section_has_boundaries_that_are_attacked(self):
        sections = list(boundaries())
        self.assertEqual(SECTIONS, len(sections))
        for title, rows in sections:
            with self.subTest(title):
                self.assertTrue(rows)
            for row in rows:
                with self.subTest(row[0]):
                    self.assertEqual(4, len(row))
                    self.assertRegex(row[3], r"`(security_|integration_)?\w*`")

    def test_each_attack_exists(self):
        known = programs()
        for _, rows in boundaries():
            for row in rows:
                program = None
                for word in re.findall(r"`([^`]+)`", row[3]):
                    with self.subTest(word, boundary=row[0]):
                        if re.match(r"(test|security|integration)_", word):
                            program = word
                            self.assertIn(program, known)
                            continue
                        case = re.escape(word).replace(r"\.\.\.", r"\w+").replace(r"\*", r"\w+")
                        self.assertTrue(any(re.fullmatch(case, one) for one in known[program]),
                                        "no such case in " + program)


if __name__ == "__main__":
    unittest.main()
