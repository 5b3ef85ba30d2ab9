"""scripts/check-locks: what is guarded and touched without its mutex is refused."""

import os
import shutil
import subprocess
import tempfile
import unittest

ROOT = os.path.dirname(os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__)))))
CLASS = """#include <condition_variable>

#include "thread_annotations.h"

class Count {
 public:
  void add() {
    %s
  }
  void wait() {
    MutexLock lock(mutex_);
    changed_.wait(lock.waiting(), [this]() QUARN_REQUIRES(mutex_) { return count_ > 0; });
  }

 private:
  void increase() QUARN_REQUIRES(mutex_) { ++count_; }
  Mutex mutex_;
  std::condition_variable changed_;
  int count_ QUARN_GUARDED_BY(mutex_) = 0;
};

void use(Count *count) {
  count->add();
  count->wait();
}
"""


@unittest.skipUnless(shutil.which("clang++"), "clang is not installed")
class CheckLocks(unittest.TestCase):
    def check(self, statement):
        with tempfile.TemporaryDirectory() as folder:
            path = os.path.join(folder, "count.cpp")
            with open(path, "w", encoding="utf-8") as file:
                file.write(CLASS % statement)
            return subprocess.run([os.path.join(ROOT, "scripts", "check-locks"), path],
                                  capture_output=True, text=True, check=False)

    def test_takes_what_is_done_under_the_mutex(self):
        checked = self.check("const MutexLock lock(mutex_); increase(); ++count_;")
        self.assertEqual((checked.returncode, checked.stderr), (0, ""))

    def test_refuses_a_member_without_its_mutex(self):
        checked = self.check("++count_;")
        self.assertNotEqual(checked.returncode, 0)
        self.assertIn("writing variable 'count_' requires holding mutex 'mutex_' exclusively",
                      checked.stderr)

    def test_refuses_a_function_without_its_mutex(self):
        checked = self.check("increase();")
        self.assertNotEqual(checked.returncode, 0)
        self.assertIn("calling function 'increase' requires holding mutex 'mutex_' exclusively",
                      checked.stderr)

    def test_refuses_a_mutex_that_is_taken_twice(self):
        checked = self.check("const MutexLock one(mutex_); const MutexLock two(mutex_);")
        self.assertNotEqual(checked.returncode, 0)
        self.assertIn("acquiring mutex 'mutex_' that is already held", checked.stderr)

    def test_refuses_a_mutex_that_cannot_say_what_it_guards(self):
        for words in ("std::mutex", "std::lock_guard<std::mutex>", "std::unique_lock<std::mutex>"):
            checked = self.check("static %s *other = nullptr; (void)other;" % words)
            self.assertNotEqual(checked.returncode, 0)
            self.assertIn("Mutex and MutexLock of common/thread_annotations.h", checked.stderr)

    def check_changed(self, source, old, new):
        """A source of the daemon, checked with one thing of it changed."""
        with open(os.path.join(ROOT, source), encoding="utf-8") as file:
            text = file.read()
        self.assertIn(old, text)
        with tempfile.TemporaryDirectory() as folder:
            path = os.path.join(folder, os.path.basename(source))
            with open(path, "w", encoding="utf-8") as file:
                file.write(text.replace(old, new))
            return subprocess.run([os.path.join(ROOT, "scripts", "check-locks"), path],
                                  capture_output=True, text=True, check=False)

    def test_refuses_a_breach_in_the_daemon(self):
        for source, lock, guarded in (
                ("daemon/quarn_dbus_calls.cpp", "const MutexLock lock(standing.mutex);",
                 "requires holding mutex 'standing.mutex'"),
                ("daemon/quarn_dbus_accepted.cpp", "const MutexLock lock(requests_mutex);",
                 "requires holding mutex 'requests_mutex'"),
                ("daemon/quarn_d_utils/power.cpp", "const MutexLock guard(power_mutex);",
                 "requires holding mutex 'power_mutex'")):
            with self.subTest(source):
                self.assertEqual(self.check_changed(source, lock, lock).returncode, 0)
                checked = self.check_changed(source, lock, "")
                self.assertNotEqual(checked.returncode, 0)
                self.assertIn(guarded, checked.stderr)


if __name__ == "__main__":
    unittest.main()
