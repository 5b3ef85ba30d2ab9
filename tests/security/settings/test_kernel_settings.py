"""The suite leaves the machine's settings as it found them, however a test ends."""
import os
import signal
import subprocess
import sys
import threading
import unittest

HERE = os.path.dirname(os.path.abspath(__file__))
PROGRAM = os.path.join(HERE, "../kernel_settings.py")
sys.path.insert(0, os.path.join(HERE, ".."))
from kernel_settings import kernel_settings, read_setting  # noqa: E402
sys.path.insert(0, os.path.join(HERE, "../../integration"))
from quarn_test import enter_own_names, wait_until  # noqa: E402

#: One that a process can have for itself: what it was before and after is compared, while other
#: suites may be at work on those of the whole machine.
SETTING = "kernel.domainname"


class KernelSettings(unittest.TestCase):
    @classmethod
    def setUpClass(cls):
        enter_own_names()
        cls.before = read_setting(SETTING)
        cls.other = "elsewhere.example"

    def test_are_there_inside_and_put_back_behind(self):
        with kernel_settings({SETTING: self.other}):
            self.assertEqual(self.other, read_setting(SETTING))
        self.assertEqual(self.before, read_setting(SETTING))

    def test_are_put_back_behind_an_error(self):
        with self.assertRaises(ZeroDivisionError):
            with kernel_settings({SETTING: self.other}):
                1 / 0
        self.assertEqual(self.before, read_setting(SETTING))

    def killed_program(self, number, whole_group):
        program = subprocess.Popen(
            [PROGRAM, "%s=%s" % (SETTING, self.other), "--", "sh", "-c", "echo begun; exec sleep 600"],
            stdout=subprocess.PIPE, start_new_session=True)
        self.assertEqual(b"begun\n", program.stdout.readline())
        self.assertEqual(self.other, read_setting(SETTING))
        if whole_group:
            os.killpg(program.pid, number)
        else:
            os.kill(program.pid, number)
        program.wait()
        wait_until(lambda: read_setting(SETTING) == self.before, "the setting is put back")
        if not whole_group:
            os.killpg(program.pid, signal.SIGKILL)
        program.stdout.close()

    def test_are_put_back_behind_a_kill(self):
        for number in (signal.SIGKILL, signal.SIGTERM):
            for whole_group in (False, True):
                with self.subTest(signal=number, whole_group=whole_group):
                    self.killed_program(number, whole_group)

    def test_are_one_users_at_a_time(self):
        order = []
        started = threading.Event()

        def second():
            started.set()
            with subprocess.Popen([PROGRAM, "%s=%s" % (SETTING, self.before), "--", "true"]) as one:
                one.wait()
            order.append("second")

        thread = threading.Thread(target=second)
        with kernel_settings({SETTING: self.other}):
            thread.start()
            started.wait()
            # Another one's value would be seen here, had it not to wait.
            for _ in range(50):
                self.assertEqual(self.other, read_setting(SETTING))
                subprocess.check_call(["true"])
            order.append("first")
        thread.join()
        self.assertEqual(["first", "second"], order)
        self.assertEqual(self.before, read_setting(SETTING))

    def test_what_cannot_be_set_is_told(self):
        with self.assertRaisesRegex(OSError, "the kernel's settings cannot be changed here: .*nowhere"):
            with kernel_settings({SETTING: self.other, "fs.nowhere": "1"}):
                self.fail("it was entered")
        self.assertEqual(self.before, read_setting(SETTING))


if __name__ == "__main__":
    unittest.main()
