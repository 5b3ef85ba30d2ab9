"""scripts/check-floors: this repository passes, and each kind of breach is told."""

import os
import shutil
import subprocess
import tempfile
import unittest

ROOT = os.path.dirname(os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__)))))
SCRIPT = os.path.join(ROOT, "scripts", "check-floors")
TABLE = os.path.join(ROOT, "scripts", "floors.toml")


def check(*arguments):
    return subprocess.run([SCRIPT, *arguments], capture_output=True, text=True, check=False)


class Repository(unittest.TestCase):
    def test_keeps_its_floors(self):
        checked = check()
        self.assertEqual((checked.stdout, checked.returncode), ("", 0))


class Breaches(unittest.TestCase):
    """In a tree of a few files at this repository's places, under its own table."""

    def setUp(self):
        self.root = tempfile.mkdtemp()
        self.addCleanup(shutil.rmtree, self.root)
        os.mkdir(os.path.join(self.root, "scripts"))
        with open(TABLE, encoding="utf-8") as file:
            # The exceptions are of files that are not here.
            lines = [line for line in file if not line.startswith("  { file = ")]
        self.write("scripts/floors.toml", "".join(lines))
        self.write("transport/src/core/ticket.h", "")
        self.write("transport/src/http/http.h", '#include "core/ticket.h"\n')
        self.write("transport/src/webdav/dav_client.h", '#include "http/http.h"\n')
        self.write("daemon/quarn_d_loop.h", "#include <string>\n")
        self.write("daemon/quarn_d_backup/pipeline.h", '#include "quarn_d_loop.h"\n')

    def write(self, path, text):
        path = os.path.join(self.root, path)
        os.makedirs(os.path.dirname(path), exist_ok=True)
        with open(path, "w", encoding="utf-8") as file:
            file.write(text)

    def assert_told(self, *lines):
        checked = check(self.root)
        self.assertEqual(checked.stdout.splitlines(), list(lines))
        self.assertEqual(checked.returncode, 1 if lines else 0)

    def test_are_not_seen_where_there_are_none(self):
        self.assert_told()

    def test_upwards(self):
        self.write("transport/src/core/retry.cpp", '#include "http/http.h"\n')
        self.assert_told('transport/src/core/retry.cpp: includes transport/src/http/http.h '
                         '("transport core" does not see "transport http")')

    def test_to_another_kind_of_store(self):
        self.write("transport/src/s3/backend_s3.cpp", '  #  include "webdav/dav_client.h"\n')
        self.assert_told('transport/src/s3/backend_s3.cpp: includes '
                         'transport/src/webdav/dav_client.h '
                         '("transport s3" does not see "transport webdav")')

    def test_into_the_transport_from_outside(self):
        self.write("daemon/quarn_d_utils/cloud.cpp",
                   '#include "../../transport/src/core/ticket.h"\n')
        self.assert_told('daemon/quarn_d_utils/cloud.cpp: includes transport/src/core/ticket.h '
                         '("daemon utils" does not see "transport core")')

    def test_upwards_in_the_daemon(self):
        self.write("daemon/quarn_d_utils/files.cpp", '#include "quarn_d_backup/pipeline.h"\n')
        self.assert_told('daemon/quarn_d_utils/files.cpp: includes daemon/quarn_d_backup/pipeline.h '
                         '("daemon utils" does not see "daemon backup")')

    def test_by_a_name_of_the_embedded_platform(self):
        self.write("daemon/quarn_d_utils/label.cpp",
                   "namespace embedded {\nint write_label(const char *path);\n}\n"
                   "int label() { return embedded::write_label(\"/\"); }\n")
        told = '("daemon utils" does not see "platform embedded")'
        self.assert_told(f"daemon/quarn_d_utils/label.cpp:1: names embedded {told}",
                         f"daemon/quarn_d_utils/label.cpp:4: names embedded {told}")

    def test_by_a_name_of_a_kind_of_store(self):
        self.write("transport/src/session/session.cpp",
                   "class S3Client;\nstd::shared_ptr<Backend> made = make_webdav_backend();\n")
        self.assert_told('transport/src/session/session.cpp:2: names make_webdav_backend '
                         '("transport session" does not see "transport webdav")',
                         'transport/src/session/session.cpp:1: names S3Client '
                         '("transport session" does not see "transport s3")')

    def test_by_a_kind_of_store_in_a_text(self):
        self.write("daemon/quarn_d_backup/cloud.cpp",
                   '/* One\n   comment. */ const char kind[] = "s3+https://";  // "\n')
        self.assert_told('daemon/quarn_d_backup/cloud.cpp:2: names s3 '
                         '("daemon backup" does not see "transport s3")')

    def test_by_what_the_transport_is_made_of(self):
        self.write("daemon/quarn_d_backup/cloud.cpp", "transport::Ticket ticket;\n")
        self.write("transport/src/core/retry.cpp", "void *made = curl_easy_init();\n")
        self.assert_told('daemon/quarn_d_backup/cloud.cpp:1: names transport::Ticket '
                         '("daemon backup" does not see "transport core")',
                         'transport/src/core/retry.cpp:1: names curl_easy_init '
                         '("transport core" does not see "transport http")')

    def test_are_no_names_in_comments_nor_where_the_floor_is_seen(self):
        self.write("daemon/quarn_d_backup/cloud.cpp",
                   "// As embedded::write_label() does, on WebDAV and S3.\n/* s3\n webdav */\n")
        self.write("device/cloud.cpp", 'const char kind[] = "s3+https://";\n'
                   "int labelled = embedded::write_label();\n")
        self.write("transport/src/stores/make_backend.cpp", "auto made = make_s3_backend();\n")
        self.assert_told()

    def test_by_two_files_that_include_each_other(self):
        self.write("transport/src/core/ticket.h", '#include "outcome.h"\n')
        self.write("transport/src/core/outcome.h", '#include "core/ticket.h"\n')
        self.assert_told("transport/src/core/outcome.h includes transport/src/core/ticket.h "
                         "includes transport/src/core/outcome.h")

    def test_by_a_longer_circle(self):
        for name, other in (("a", "b"), ("b", "c"), ("c", "a")):
            self.write(f"transport/src/core/{name}.h", f'#include "core/{other}.h"\n')
        self.assert_told("transport/src/core/a.h includes transport/src/core/b.h includes "
                         "transport/src/core/c.h includes transport/src/core/a.h")

    def test_by_a_file_on_no_floor(self):
        self.write("transport/src/retry.cpp", "")
        self.assert_told("transport/src/retry.cpp: stands on no floor")

    def test_that_are_known_and_mended(self):
        with open(os.path.join(self.root, "scripts", "floors.toml"), encoding="utf-8") as file:
            table = file.read()
        known = ('exceptions = [\n  { file = "transport/src/core/retry.cpp", '
                 'includes = "transport/src/http/http.h" },\n')
        self.write("scripts/floors.toml", table.replace("exceptions = [\n", known))
        self.write("transport/src/core/retry.cpp", '#include "http/http.h"\n')
        self.assert_told()
        self.write("transport/src/core/retry.cpp", "")
        self.assert_told("floors.toml: the exception of transport/src/core/retry.cpp for "
                         "transport/src/http/http.h is not needed any more")


if __name__ == "__main__":
    unittest.main()
