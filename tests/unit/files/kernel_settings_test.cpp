#include "quarn_d_utils/kernel_settings.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "log_capture.h"
#include "temp_dir.h"

namespace {

using testing::ElementsAre;
using testing::IsEmpty;

class KernelSettings : public testing::Test {
 protected:
  KernelSettings() {
    for (const char *name : {"hardlinks", "symlinks", "fifos", "regular"}) set(name, "1\n");
    clear_captured_log();
  }
  void set(const std::string &name, const std::string &value) const {
    root_.file("fs/protected_" + name, value);
  }
  int tell() const { return tell_kernel_settings(root_.path().c_str()); }

  TempDir root_;
};

TEST_F(KernelSettings, ThatProtectAreNotTold) {
  set("fifos", "2\n");
  EXPECT_EQ(tell(), 0);
  EXPECT_THAT(captured_texts(), IsEmpty());
}

TEST_F(KernelSettings, ThatDoNotProtectAreToldWithALineEach) {
  for (const char *name : {"hardlinks", "symlinks", "fifos", "regular"}) set(name, "0\n");
  EXPECT_EQ(tell(), 4);
  EXPECT_THAT(
      captured_texts(),
      ElementsAre("kernel setting fs.protected_hardlinks is 0: it should be at least 1, against "
                  "second names of files of others",
                  "kernel setting fs.protected_symlinks is 0: it should be at least 1, against "
                  "links of others in /tmp",
                  "kernel setting fs.protected_fifos is 0: it should be at least 1, against pipes "
                  "of others in /tmp",
                  "kernel setting fs.protected_regular is 0: it should be at least 1, against "
                  "files of others in /tmp"));
  for (const LogLine &line : captured_log()) EXPECT_EQ(line.level, DLOG_WARN);
}

TEST_F(KernelSettings, ThatAKernelDoesNotHaveAreToldAndTheRestIsStillLookedAt) {
  unlink((root_ / "fs/protected_hardlinks").c_str());
  set("regular", "0\n");
  EXPECT_EQ(tell(), 2);
  EXPECT_THAT(captured_texts(),
              ElementsAre("kernel setting fs.protected_hardlinks cannot be read (No such file or "
                          "directory): it should be at least 1, against second names of files of "
                          "others",
                          "kernel setting fs.protected_regular is 0: it should be at least 1, "
                          "against files of others in /tmp"));
}

TEST_F(KernelSettings, WithoutANumberAreTold) {
  for (const char *text : {"", "\n", "yes\n", "1x\n", "-1\n", "99999999999999999999\n"}) {
    clear_captured_log();
    set("symlinks", text);
    EXPECT_EQ(tell(), 1) << text;
    EXPECT_THAT(captured_texts(),
                ElementsAre("kernel setting fs.protected_symlinks cannot be read (Invalid "
                            "argument): it should be at least 1, against links of others in /tmp"));
  }
}

}  // namespace
