"""The main job on real input: what stands in the cloud after each kind of run."""
import json
import os
import subprocess
import sys
import unittest
import zipfile

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from quarn_test import AnsweringServer, TestCase, make_source, read_file  # noqa: E402


def objects(device):
    """The cloud's objects, relative to its root."""
    found = set()
    for folder, _, names in os.walk(device.cloud):
        for name in names:
            found.add(os.path.relpath(os.path.join(folder, name), device.cloud))
    return found


def folders(device):
    found = set()
    for folder, names, _ in os.walk(device.cloud):
        for name in names:
            found.add(os.path.relpath(os.path.join(folder, name), device.cloud))
    return found


def entry_of(device, serial):
    for entry in device.app_list()["model_list"]:
        info = entry.get("backup_info") if isinstance(entry, dict) else None
        if isinstance(info, dict) and info.get("serial_number") == serial:
            return entry
    raise AssertionError("no entry of " + serial)


def crcs(device, serial):
    return {package["pkg_id"]: package["crc"] for package in entry_of(device, serial)["pkg_list"]}


class BackupStory(TestCase):
    def setUp(self):
        self.device = self.new_device(serial="350000000000001", model="Orvane One")
        self.device.start()
        for name, files in (("org.example.alpha", {"data/a.txt": b"alpha\n" * 100}),
                            ("org.example.beta", {"shared/data/b.bin": os.urandom(50000),
                                                  "shared/trusted/key": b"k"})):
            self.device.install(make_source(self.path("src-" + name), name, "1.0.0", files))

    def backup(self, device=None, expected=0):
        result = (device or self.device).quarnctl("backup", "--yes", check=False)
        self.assertEqual(result.returncode, expected, result.stdout + result.stderr)
        return result

    def archive(self, package, version="1.0.0", serial="350000000000001"):
        return "%s/%s/%s/%s.zip" % (serial, package, version, package)

    def test_a_first_run_leaves_one_archive_a_package_and_the_list(self):
        self.backup()
        self.assertEqual(objects(self.device),
                         {"app_list/app_list.txt", self.archive("org.example.alpha"),
                          self.archive("org.example.beta")})
        document = self.device.app_list()
        self.assertEqual(list(document), ["format_ver", "model_list"])
        self.assertEqual(document["format_ver"], 1)
        self.assertEqual(len(document["model_list"]), 1)
        info = document["model_list"][0]["backup_info"]
        self.assertEqual(list(info), ["timestamp", "serial_number", "model_name"])
        self.assertEqual(info["serial_number"], "350000000000001")
        self.assertEqual(info["model_name"], "Orvane One")
        for package in document["model_list"][0]["pkg_list"]:
            self.assertEqual(list(package), ["pkg_id", "version", "crc"])
            self.assertEqual(package["version"], "1.0.0")
            self.assertNotEqual(package["crc"], 0)

    def test_archives_are_read_by_unzip_and_zipfile(self):
        self.backup()
        path = os.path.join(self.device.cloud, self.archive("org.example.beta"))
        subprocess.run(["unzip", "-tq", path], check=True, stdout=subprocess.DEVNULL)
        with zipfile.ZipFile(path) as archive:
            self.assertIsNone(archive.testzip())
            names = archive.namelist()
            self.assertEqual(names, ["shared/data/b.bin", "shared/trusted/key",
                                     "shared/data/org.example.beta.perm"])
            self.assertEqual({info.compress_type for info in archive.infolist()}, {8})
            table = json.loads(archive.read("shared/data/org.example.beta.perm"))
        self.assertEqual(next(iter(table)), "quarn_symbolic_info")
        self.assertEqual(table["shared/data/b.bin"]["1"], 5000)
        self.assertEqual(table["shared/data/b.bin"]["3"], "org.example.beta")

    def test_an_unchanged_run_uploads_no_archive_and_keeps_the_crcs(self):
        self.backup()
        before = crcs(self.device, self.device.serial)
        stamp = entry_of(self.device, self.device.serial)["backup_info"]["timestamp"]
        archive = os.path.join(self.device.cloud, self.archive("org.example.alpha"))
        inode = os.stat(archive).st_ino
        self.backup()
        self.assertEqual(crcs(self.device, self.device.serial), before)
        self.assertEqual(os.stat(archive).st_ino, inode)
        self.assertGreater(entry_of(self.device, self.device.serial)["backup_info"]["timestamp"],
                           stamp)
        self.assertIn("no app data to upload", self.device.log())

    def test_only_a_changed_package_is_uploaded_again(self):
        self.backup()
        archives = {name: os.stat(os.path.join(self.device.cloud, self.archive(name))).st_ino
                    for name in ("org.example.alpha", "org.example.beta")}
        with open(self.device.app_path("org.example.alpha", "data/a.txt"), "r+b") as file:
            file.write(b"changed")
        self.backup()
        now = {name: os.stat(os.path.join(self.device.cloud, self.archive(name))).st_ino
               for name in archives}
        self.assertNotEqual(now["org.example.alpha"], archives["org.example.alpha"])
        self.assertEqual(now["org.example.beta"], archives["org.example.beta"])

    def test_an_updated_package_moves_to_its_new_version(self):
        self.backup()
        self.device.install(make_source(self.path("new"), "org.example.alpha", "2.0.0", {}))
        self.backup()
        self.assertEqual(objects(self.device),
                         {"app_list/app_list.txt", self.archive("org.example.alpha", "2.0.0"),
                          self.archive("org.example.beta")})
        self.assertNotIn("350000000000001/org.example.alpha/1.0.0", folders(self.device))

    def test_a_removed_package_leaves_the_cloud(self):
        self.backup()
        self.device.remove("org.example.beta")
        self.backup()
        self.assertEqual(objects(self.device),
                         {"app_list/app_list.txt", self.archive("org.example.alpha")})
        self.assertNotIn("350000000000001/org.example.beta", folders(self.device))
        self.assertEqual(set(crcs(self.device, self.device.serial)), {"org.example.alpha"})

    def test_two_devices_of_one_account_keep_their_entries(self):
        self.backup()
        first = json.dumps(entry_of(self.device, self.device.serial))
        second = self.new_device(serial="350000000000002", model="Orvane Two",
                                 cloud="file://" + self.device.cloud)
        second.start()
        second.install(make_source(self.path("src2"), "org.example.gamma", "1.0.0",
                                   {"data/g": b"gamma"}))
        self.backup(second)
        self.assertEqual(json.dumps(entry_of(self.device, self.device.serial)), first)
        self.assertEqual(set(crcs(self.device, "350000000000002")), {"org.example.gamma"})
        self.assertIn(self.archive("org.example.gamma", serial="350000000000002"),
                      objects(self.device))
        self.assertIn(self.archive("org.example.alpha"), objects(self.device))

    def test_opted_out_preloaded_external_and_too_large_packages_are_skipped(self):
        device = self.device
        device.install(make_source(self.path("s1"), "org.example.optout", "1.0.0",
                                   {"data/x": b"x"}, metadata={"backup": "disable"}))
        device.install(make_source(self.path("s2"), "org.example.preload", "1.0.0",
                                   {"data/x": b"x"}, preload=True))
        device.install(make_source(self.path("s3"), "org.example.external", "1.0.0",
                                   {"data/x": b"x"}, storage="external"))
        device.install(make_source(self.path("s4"), "org.example.large", "1.0.0",
                                   {"data/x": bytes(26214401)}))
        self.backup()
        listed = crcs(device, device.serial)
        self.assertNotIn("org.example.preload", listed)
        for package in ("org.example.optout", "org.example.external", "org.example.large"):
            self.assertEqual(listed[package], 0)
            self.assertNotIn(self.archive(package), objects(device))
        log = device.log()
        self.assertIn("backup disabled for (org.example.optout)", log)
        self.assertIn("current storage of (org.example.external) is external, so will not be "
                      "backed up", log)
        self.assertIn("app backup size exceed 25MB, so will not backup data", log)

    def test_data_of_exactly_the_cap_is_backed_up(self):
        self.device.install(make_source(self.path("s"), "org.example.cap", "1.0.0",
                                        {"data/x": bytes(26214400)}))
        self.backup()
        self.assertIn(self.archive("org.example.cap"), objects(self.device))

    def test_nothing_staged_is_left_behind(self):
        self.backup()
        left = [os.path.join(folder, name)
                for folder, _, names in os.walk(os.path.join(self.device.path, "root"))
                for name in names if name.endswith(("_upload.zip", ".perm", "app_list.txt"))]
        self.assertEqual(left, [])

    def test_without_wifi_a_manual_backup_ends_with_33(self):
        self.device.set("network", "cellular")
        self.backup(expected=33)
        self.assertEqual(objects(self.device), set())

    def test_a_list_of_another_format_is_never_overwritten(self):
        os.makedirs(os.path.join(self.device.cloud, "app_list"))
        text = '{"format_ver": 2, "model_list": [{"future": true}]}'
        with open(os.path.join(self.device.cloud, "app_list/app_list.txt"), "w") as file:
            file.write(text)
        self.backup(expected=12)
        self.assertEqual(read_file(os.path.join(self.device.cloud, "app_list/app_list.txt")), text)
        self.assertIn("format version in json changed", self.device.log())

    def test_hostile_lists_never_crash_the_daemon_nor_lose_an_entry(self):
        other = {"backup_info": {"timestamp": 5, "serial_number": "other", "model_name": "m",
                                 "extra": [1, None]}, "pkg_list": [{"pkg_id": "x"}], "more": {}}
        os.makedirs(os.path.join(self.device.cloud, "app_list"))
        path = os.path.join(self.device.cloud, "app_list/app_list.txt")
        odd = [None, 7, "text", [], {}, {"backup_info": None}, {"backup_info": []},
               {"backup_info": {"serial_number": 5}, "pkg_list": 7},
               {"backup_info": {"serial_number": None}},
               {"backup_info": {"serial_number": "350000000000001"},
                "pkg_list": [None, 1, {"pkg_id": 5}, {"pkg_id": "org.example.alpha",
                             "version": "1.0.0", "crc": 10 ** 30},
                             {"pkg_id": "../..", "version": "/", "crc": "1"}]}]
        with open(path, "w") as file:
            json.dump({"format_ver": 1, "model_list": odd + [other]}, file)
        self.backup()
        models = self.device.app_list()["model_list"]
        self.assertIn(other, models)
        for entry in odd[:-1]:
            self.assertIn(entry, models)
        self.assertEqual(set(crcs(self.device, "350000000000001")),
                         {"org.example.alpha", "org.example.beta"})
        for text in ("", "{", "null", "[]", '"x"', "{}", '{"format_ver":1}',
                     '{"format_ver":1,"model_list":{}}', '{"format_ver":1,"model_list":[]}',
                     "[" * 5000, "\x00\x01"):
            with open(path, "w") as file:
                file.write(text)
            result = self.device.quarnctl("backup", check=False)
            self.assertIn(result.returncode, (0, 12, 13), text[:40])
            self.assertEqual(self.device.quarnctl("activate", check=False).returncode, 0)

    def test_one_unreadable_package_affects_itself_alone_and_keeps_its_last_archive(self):
        self.backup()
        kept = os.stat(os.path.join(self.device.cloud, self.archive("org.example.beta"))).st_ino
        os.mkfifo(self.device.app_path("org.example.beta", "data/pipe"))
        with open(self.device.app_path("org.example.alpha", "data/a.txt"), "r+b") as file:
            file.write(b"changed")
        self.backup()
        self.assertEqual(
            os.stat(os.path.join(self.device.cloud, self.archive("org.example.beta"))).st_ino, kept)
        self.assertIn("fail to make zip data for org.example.beta", self.device.log())

    def test_a_rules_file_that_is_none_backs_everything_up_and_one_that_hides_its_rules_nothing(self):
        bomb = ('<?xml version="1.0"?><!DOCTYPE b [<!ENTITY a "aaaaaaaaaa">'
                + "".join('<!ENTITY a%d "%s">' % (i, ("&a%d;" % (i - 1) if i else "&a;") * 10)
                          for i in range(12))
                + ']><backup><exclude path="&a11;"/></backup>').encode()
        network = (b'<!DOCTYPE backup SYSTEM "http://127.0.0.1:9/x.dtd">'
                   b'<backup><exclude path="data/"/></backup')
        for index, rules in enumerate((bomb, network, b"not xml", b"<other/>", b"",
                                       b"<backup><exclude/><include2/></backup>")):
            name = "org.example.rules%d" % index
            self.device.install(make_source(self.path("r%d" % index), name, "1.0.0",
                                            {"data/x": b"x" * 100, "res/backup.path.xml": rules}))
        self.backup()
        hidden = os.path.join(self.device.cloud, self.archive("org.example.rules0"))
        self.assertFalse(os.path.exists(hidden), "what its entities exclude is not known")
        self.assertIn("rules file of (org.example.rules0) cannot be used: it needs entities",
                      self.device.log())
        for index in range(1, 6):
            path = os.path.join(self.device.cloud, self.archive("org.example.rules%d" % index))
            with zipfile.ZipFile(path) as archive:
                self.assertIn("data/x", archive.namelist())

    def device_without(self, *libraries):
        """Another device, on which these cannot be loaded."""
        self.device.stop()
        folder = self.path("no-libraries")
        os.makedirs(folder)
        for library in libraries:
            open(os.path.join(folder, library), "w").close()
        device = self.new_device(serial="350000000000002")
        device.call("start", env=dict(os.environ, LD_LIBRARY_PATH=folder))
        return device

    def test_without_the_library_that_reads_rules_nothing_of_their_package_is_sent(self):
        device = self.device_without("libxml2.so.2")
        rules = b'<backup><exclude path="data/secret"/></backup>'
        device.install(make_source(self.path("ruled"), "org.example.ruled", "1.0.0",
                                   {"data/secret": b"s", "res/backup.path.xml": rules}))
        device.install(make_source(self.path("plain"), "org.example.plain", "1.0.0",
                                   {"data/a": b"a"}))
        self.backup(device)
        sent = {name for name in objects(device) if name.endswith(".zip")}
        self.assertEqual(sent, {"350000000000002/org.example.plain/1.0.0/org.example.plain.zip"})
        self.assertIn("rules file of (org.example.ruled) cannot be used: libxml2.so.2 cannot be "
                      "loaded", device.log())
        self.assertEqual(device.quarnctl("app", "backup", "org.example.ruled",
                                         check=False).returncode, 36)

    def test_without_the_library_of_the_network_a_run_fails_and_names_it(self):
        device = self.device_without("libcurl.so.4", "libcurl-gnutls.so.4")
        device.install(make_source(self.path("plain"), "org.example.plain", "1.0.0",
                                   {"data/a": b"a"}))
        device.set("cloud", "webdav+http://127.0.0.1:9/store")
        result = device.quarnctl("backup", check=False)
        self.assertNotEqual(result.returncode, 0)
        self.assertIn("libcurl.so.4 cannot be loaded", device.logs())

    def test_without_the_library_that_reads_answers_a_missing_bucket_is_no_missing_list(self):
        server = AnsweringServer(404, "Not Found", content_type="application/xml",
                                 body="<Error><Code>NoSuchBucket</Code></Error>")
        self.enterContext(server)
        device = self.device_without("libxml2.so.2")
        device.install(make_source(self.path("plain"), "org.example.plain", "1.0.0",
                                   {"data/a": b"a"}))
        device.call("set", "cloud", "s3+http://127.0.0.1:%d/bucket" % server.port,
                    "--user", "key", input="secret\n")
        self.assertNotEqual(device.quarnctl("backup", check=False).returncode, 0)
        self.assertIn("GET", server.asked)
        self.assertNotIn("PUT", server.asked)
        self.assertIn("libxml2.so.2 cannot be loaded", device.logs())

    def test_the_applications_files_with_names_of_ours_survive_a_backup_and_a_start(self):
        names = ["org.example.alpha_upload.zip", "org.example.alpha_download.zip",
                 "org.example.alpha.perm", "quarn_tmp_rst_dir"]
        for name in names:
            path = self.device.app_path("org.example.alpha", "shared/data/" + name)
            with open(path, "w") as file:
                file.write("own " + name)
            os.chown(path, 5000, 5000)
        self.backup()
        self.device.stop()
        self.device.start()
        with open(self.device.app_path("org.example.alpha", "data/a.txt"), "r+b") as file:
            file.write(b"changed")
        self.backup()
        folder = self.device.app_path("org.example.alpha", "shared/data")
        self.assertEqual(sorted(os.listdir(folder)), sorted(names))
        for name in names:
            self.assertEqual(read_file(os.path.join(folder, name)), "own " + name)

    def test_symbolic_links_out_of_the_application_are_recorded_but_not_read(self):
        os.symlink("/etc/shadow", self.device.app_path("org.example.alpha", "data/link"))
        os.symlink("/etc", self.device.app_path("org.example.alpha", "data/folder"))
        self.backup()
        path = os.path.join(self.device.cloud, self.archive("org.example.alpha"))
        with zipfile.ZipFile(path) as archive:
            self.assertEqual(set(archive.namelist()),
                             {"data/a.txt", "shared/data/org.example.alpha.perm"})
            table = json.loads(archive.read("shared/data/org.example.alpha.perm"))
        self.assertEqual({(link["real_name"], link["lnk"])
                          for link in table["quarn_symbolic_info"]},
                         {("data/link", "/etc/shadow"), ("data/folder", "/etc")})


if __name__ == "__main__":
    unittest.main()
