"""quarnctl against the real daemon on an embedded device."""
import json
import os
import pty
import shutil
import signal
import subprocess
import sys
import unittest

sys.path.insert(0, os.path.join(os.path.dirname(os.path.abspath(__file__)), ".."))
from quarn_test import (  # noqa: E402
    BIN_DIR, TestCase, label_of, make_source, read_bytes, wait_until)

SERIAL = "350000000000017"
OTHER = "350000000000025"
NOTES = "org.example.notes"
BANK = "org.example.bank"


class QuarnctlTest(TestCase):

    def setUp(self):
        self.device = self.new_device(model="Orvane One", serial=SERIAL, account="ada")
        self.device.start()

    def install(self, device, package, data=True, metadata=None, **files):
        content = {"data/file": os.urandom(3000)} if data else {}
        device.install(make_source(self.path("src-%s-%d" % (package, data)), package, "1.0",
                                   content, metadata=metadata))

    def quarnctl(self, *arguments, device=None, status=0):
        result = (device or self.device).quarnctl(*arguments, check=False)
        self.assertEqual(result.returncode, status, result.stdout + result.stderr)
        return result

    def document(self, *arguments, **keywords):
        return json.loads(self.quarnctl(*arguments, "--json", **keywords).stdout)

    def test_a_backup_tells_what_became_of_each_package(self):
        self.install(self.device, NOTES)
        self.install(self.device, BANK, metadata={"backup": "disable"})
        first = {entry["package"]: entry for entry in self.document("backup")["packages"]}
        self.assertEqual(first[NOTES]["outcome"], "uploaded")
        archive = os.path.join(self.device.cloud, SERIAL, NOTES, "1.0", NOTES + ".zip")
        self.assertEqual(first[NOTES]["size"], os.path.getsize(archive))
        self.assertEqual((first[BANK]["outcome"], first[BANK]["reason"]), ("skipped", "disabled"))
        second = self.quarnctl("backup").stdout
        self.assertIn("%s: unchanged (the cloud holds it already)\n" % NOTES, second)
        self.assertIn("\nbackup finished\n", second)
        self.assertTrue(second.endswith("backup succeeded\n"), second)

    def test_list_and_sets_show_what_stands_in_the_cloud(self):
        self.install(self.device, NOTES)
        empty = self.quarnctl("list", status=1)
        self.assertIn("holds no application list yet", empty.stderr)
        self.quarnctl("backup")
        entry = self.device.app_list()["model_list"][0]
        device = self.document("list")["devices"][0]
        self.assertEqual(device["serial"], SERIAL)
        self.assertEqual(device["model"], "Orvane One")
        self.assertEqual(device["time_ms"], entry["backup_info"]["timestamp"])
        self.assertEqual(device["packages"], [{"package": NOTES, "version": "1.0",
                                               "crc": entry["pkg_list"][0]["crc"]}])
        self.assertIn(SERIAL, self.quarnctl("sets").stdout)

    def test_rules_of_an_installed_package_and_of_its_source_are_checked_alike(self):
        source = make_source(self.path("source"), NOTES, "1.0", {
            "data/keep": b"keep", "data/cache/tile": b"tile",
            "res/backup.path.xml": b'<backup><exclude path="data/cache/"/></backup>'})
        self.device.install(source)
        installed = self.quarnctl("rules", "check", NOTES)
        self.assertEqual(installed.stderr, "")
        self.assertIn("1 of 2 in", installed.stdout)
        of_source = subprocess.run([os.path.join(BIN_DIR, "quarnctl"), "rules", "check", source],
                                   stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
        self.assertEqual((of_source.returncode, of_source.stdout, of_source.stderr),
                         (0, installed.stdout, ""))
        self.assertEqual(self.quarnctl("rules", "explain", NOTES, "data/cache/tile").stdout,
                         'data/cache/tile: out (exclude "data/cache/", line 1)\n')
        self.quarnctl("rules", "explain", NOTES, "data/none", status=66)
        self.quarnctl("rules", "check", "org.example.none", status=66)
        self.assertIsNone(self.device.daemon_pid())

    def test_status_follows_the_device(self):
        self.install(self.device, NOTES)
        before = self.document("status")
        self.assertEqual((before["serial"], before["model"]), (SERIAL, "Orvane One"))
        self.assertEqual((before["auto_backup"], before["last_backup_ms"], before["packages"]),
                         (False, None, None))
        self.quarnctl("backup")
        self.quarnctl("auto", "on")
        self.device.set("charger", "on")
        self.device.set("display", "off")
        wait_until(lambda: self.document("status")["condition_alarm_ms"], "the alarm is armed")
        status = self.document("status")
        for member in ("auto_backup", "charger_connected", "wifi_connected", "screen_off"):
            self.assertIs(status[member], True, member)
        # The daemon and the alarm service each take the time themselves.
        self.assertTrue(any(abs(alarm["due_ms"] - status["condition_alarm_ms"]) < 1000
                            for alarm in self.device.alarms()))
        self.assertEqual([entry["package"] for entry in status["packages"]], [NOTES])
        self.assertLess(status["last_backup_age_ms"], 600000)
        self.assertIs(status["backup_running"], False)
        self.device.set("network", "none")
        wait_until(lambda: self.document("status")["wifi_connected"] is False, "Wi-Fi is gone")
        self.assertIn("not known without Wi-Fi", self.quarnctl("status").stdout)

    def test_a_package_goes_from_device_to_device_without_a_cloud(self):
        companion = "com.velmor.pellix-efl"
        second = self.new_device(model="Orvane Two", serial=OTHER, account="ada")
        second.start()
        for index, device in enumerate((self.device, second)):
            device.install(make_source(self.path("companion%d" % index), companion, "1.0",
                                       {"shared/data/phone": b"-"}))
        self.install(self.device, NOTES)
        listed = self.document("transfer", "list")
        self.assertEqual(listed["message"], "success")
        self.assertNotIn("left_out", listed)
        self.assertEqual(self.quarnctl("transfer", "list").stderr, "")
        archives = listed["archives"]
        name = "%s_1.0.zip" % NOTES
        self.assertIn("/opt/usr/apps/%s/shared/data/%s" % (companion, name), archives)
        source = self.device.app_path(companion, "shared/data/" + name)
        self.assertEqual(os.stat(source).st_mode & 0o777, 0o777)
        self.assertEqual(label_of(source), companion)
        shutil.copy2(source, second.app_path(companion, "shared/data/" + name))
        self.quarnctl("restore", "on", "--transfer", NOTES, device=second)
        self.install(second, NOTES, data=False)

        def same():
            try:
                return (read_bytes(self.device.app_path(NOTES, "data/file")) ==
                        read_bytes(second.app_path(NOTES, "data/file")))
            except FileNotFoundError:
                return False
        wait_until(same, "the second device has the first one's data")
        self.assertEqual(os.listdir(self.device.cloud), [])

    def test_without_wifi_the_result_is_told_in_words(self):
        self.install(self.device, NOTES)
        self.device.set("network", "none")
        result = self.quarnctl("backup", status=33)
        self.assertIn("no Wi-Fi, or no session with the cloud (33)", result.stderr)

    def test_without_an_account_the_daemon_is_said_to_end_at_once(self):
        device = self.new_device(serial=OTHER, account=None)
        device.start()
        result = self.quarnctl("activate", device=device, status=69)
        self.assertIn("no cloud account is signed in", result.stderr)

    def test_requests_for_one_package_exit_with_their_results(self):
        self.install(self.device, NOTES)
        self.install(self.device, BANK, metadata={"backup": "disable"})
        self.quarnctl("app", "backup", NOTES)
        path = self.device.app_path(NOTES, "data/file")
        before = read_bytes(path)
        with open(path, "wb") as file:
            file.write(b"spoiled")
        self.quarnctl("app", "restore", NOTES)
        self.assertEqual(read_bytes(path), before)
        self.quarnctl("app", "backup", BANK, status=41)
        self.quarnctl("app", "restore", BANK, status=41)
        self.quarnctl("app", "backup", "org.example.none", status=1)
        self.quarnctl("app", "export", "org.example.none", status=36)
        exported = self.quarnctl("app", "export", NOTES).stdout.strip()
        self.assertEqual(exported, "/tmp/%s_tmp.zip" % NOTES)
        self.device.exec("unzip", "-tqq", exported)

    def test_watching_follows_a_restore_to_its_end(self):
        self.install(self.device, NOTES)
        self.install(self.device, BANK, metadata={"backup": "disable"})
        self.quarnctl("backup")
        second = self.new_device(model="Orvane Two", serial=OTHER, account="ada",
                                 cloud="file://" + self.device.cloud)
        second.start()
        self.quarnctl("restore", "on", "--from", "nobody", device=second, status=1)
        watcher = second.begin("quarnctl", "restore", "on", "--from", SERIAL, "--watch",
                               stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
        try:
            self.assertIn("restore mode is on for 2 packages", watcher.stdout.readline())
            self.install(second, BANK, data=False, metadata={"backup": "disable"})
            self.install(second, NOTES, data=False)
            out, err = watcher.communicate(timeout=60)
        finally:
            watcher.kill()
        self.assertEqual(watcher.returncode, 0, out + err)
        self.assertIn("%s: restored\n" % NOTES, out)
        self.assertTrue(out.endswith("restore finished\n"), out)
        self.assertEqual(read_bytes(self.device.app_path(NOTES, "data/file")),
                         read_bytes(second.app_path(NOTES, "data/file")))
        second.wait_for_daemon_end()
        self.assertNotIn("g_dbus_connection_call_sync() Fail", second.log())

    def test_watching_ends_when_another_client_ends_the_mode(self):
        self.install(self.device, NOTES)
        self.quarnctl("backup")
        watcher = self.device.begin("quarnctl", "restore", "on", "--from", SERIAL, "--watch",
                                    stdout=subprocess.PIPE, stderr=subprocess.PIPE, text=True)
        try:
            self.assertIn("restore mode is on", watcher.stdout.readline())
            self.quarnctl("restore", "off")
            out, err = watcher.communicate(timeout=60)
        finally:
            watcher.kill()
        self.assertEqual(watcher.returncode, 17, out + err)
        self.assertIn("restore mode ended before it was installed", out)

    def test_an_interrupt_cancels_the_backup(self):
        for number in range(40):
            self.install(self.device, "org.example.app%02d" % number)
        source = make_source(self.path("large"), "org.example.large", "1.0",
                             {"data/%d" % i: os.urandom(4000000) for i in range(6)})
        self.device.install(source)
        backup = self.device.begin("quarnctl", "backup", stdout=subprocess.PIPE,
                                   stderr=subprocess.PIPE, text=True, start_new_session=True)
        try:
            self.assertEqual(backup.stdout.readline(), "backup started\n")
            os.killpg(backup.pid, signal.SIGINT)
            out, err = backup.communicate(timeout=60)
        finally:
            backup.kill()
        self.assertEqual(backup.returncode, 17, out + err)
        self.assertEqual(err, "quarnctl: backup cancelled (17)\n")

    def test_a_terminal_gets_a_bar_and_a_table(self):
        self.install(self.device, NOTES)
        master, slave = pty.openpty()
        environment = dict(os.environ, TERM="xterm")
        try:
            result = subprocess.run(
                [self.device.tool, "exec", self.device.path, "--", "quarnctl", "backup"],
                stdout=slave, stderr=subprocess.PIPE, env=environment, timeout=60)
            os.close(slave)
            shown = b""
            while True:
                try:
                    part = os.read(master, 65536)
                except OSError:
                    break
                if not part:
                    break
                shown += part
        finally:
            os.close(master)
        self.assertEqual(result.returncode, 0, result.stderr)
        self.assertIn(b"\r\x1b[K", shown)
        self.assertIn(b"PACKAGE", shown)
        self.assertTrue(shown.endswith(b"backup succeeded\r\n"), shown)


if __name__ == "__main__":
    unittest.main()
