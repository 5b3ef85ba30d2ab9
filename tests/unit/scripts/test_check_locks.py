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


if __name__ == "__main__":
    unittest.main()
