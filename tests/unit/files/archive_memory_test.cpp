#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <fstream>
#include <functional>
#include <string>

#include "mock_platform.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/bounds.h"
#include "temp_dir.h"
#include "this_process.h"

// A sanitizer's own memory is many times what it watches.
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)

namespace {

using ::testing::NiceMock;

constexpr char kPackage[] = "org.example.notes";

long peak_kilobytes() { return static_cast<long>(peak_resident_bytes() / 1024); }

/** By how much the peak grows with @p work, in a process of its own. Kilobytes. */
long growth(const std::function<bool()> &work) {
  int pipe_ends[2];
  EXPECT_EQ(pipe(pipe_ends), 0);
  const pid_t child = fork();
  if (child == 0) {
    std::ofstream("/proc/self/clear_refs") << 5;  // the peak begins here
    const long before = peak_kilobytes();
    const long grown = work() ? peak_kilobytes() - before : -1;
    const bool told = write(pipe_ends[1], &grown, sizeof grown) == sizeof grown;
    _exit(told ? 0 : 1);
  }
  close(pipe_ends[1]);
  long grown = -1;
  EXPECT_EQ(read(pipe_ends[0], &grown, sizeof grown), static_cast<ssize_t>(sizeof grown));
  close(pipe_ends[0]);
  int status = 0;
  waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  return grown;
}

class ArchiveMemory : public ::testing::Test {
 protected:
  ArchiveMemory() {
    ON_CALL(platform_, smack_getlabel)
        .WillByDefault([](const char *, char **label, smack_label_type) {
          *label = strdup("User::Pkg::org.example.notes");
          return 0;
        });
    for (const char *dir : {"data", "shared/data", "shared/trusted"}) root_.dir(dir);
  }
  /** Let there be so many files, with paths of about a hundred bytes. */
  void fill(int from, int to) {
    const std::string folder = root_.dir("data/a-directory-with-a-name/another-one-in-it/and-more");
    for (int i = from; i < to; ++i) {
      const std::string name = folder + "/a-file-with-a-long-name-" + std::to_string(i) + ".json";
      ASSERT_EQ(mknod(name.c_str(), S_IFREG | 0600, 0), 0);
    }
  }
  long packing() {
    return growth([this] {
      int error = 0;
      make_zip_data(kPackage, root_.path().c_str(), archive_.c_str(), &error, kBackupBounds);
      return error == QUARN_OK;
    });
  }
  long unpacking() {
    const TempDir out;
    return growth([&] {
      unzip_report report;
      return unzip_data(kPackage, out.path().c_str(), archive_.c_str(), &report) == QUARN_OK &&
             report.complete();
    });
  }

  NiceMock<MockPlatform> platform_;
  TempDir root_;
  TempDir place_;
  const std::string archive_ = place_ / "archive.zip";
};

TEST_F(ArchiveMemory, GrowsByAtMostOneAndAHalfKilobytesAnEntry) {
  constexpr int kFew = 12000;
  constexpr int kMany = 40000;
  // of the daemon's 20,480 kB, what is left beside its libraries
  constexpr long kRoom = 14000;
  constexpr long kReaderRoom = 3000;
  fill(0, kFew);
  const long few = packing();
  ASSERT_GT(few, 0);
  EXPECT_LT(few, kRoom);
  const long few_back = unpacking();
  EXPECT_LT(few_back, kReaderRoom);
  fill(kFew, kMany);
  EXPECT_LT(packing() - few, (kMany - kFew) * 3L / 2);
  EXPECT_LT(unpacking(), kReaderRoom) << "a reader holds no entries";
}

}  // namespace

#endif
