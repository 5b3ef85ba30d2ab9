// An application that changes its data at the very moment: between any two steps of the packing it
// puts another's file in the place of its own, and takes it away again a step or two later.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <unzip.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>

#include "each_moment.h"
#include "mock_platform.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "temp_dir.h"

namespace {

using ::testing::NiceMock;

constexpr char kPackage[] = "org.example.hostile";
constexpr char kSecret[] = "what only root may read";
/** How many steps what was put there stays at most, but for what lies there from the beginning. */
constexpr int kLongest = 4;

/**
 * How long it runs. One pass over all moments takes about 0.1 seconds. With files opened as root
 * the first finds another's after 0.02 seconds, with links followed as well after 0.07: so this is
 * a hundred times over for either.
 */
std::chrono::milliseconds race() {
  const char *seconds = std::getenv("QUARN_RACE_SECONDS");
  return std::chrono::milliseconds(seconds == nullptr ? 10000 : 1000 * std::atoi(seconds));
}

class PackingRace : public ::testing::Test {
 protected:
  PackingRace() {
    ON_CALL(platform_, smack_getlabel)
        .WillByDefault([](const char *, char **label, smack_label_type) {
          *label = strdup("_");
          return 0;
        });
    for (const char *name :
         {"", "/data", "/data/dir", "/shared", "/shared/data", "/shared/trusted"}) {
      const std::string path = root_ + name;
      EXPECT_EQ(mkdir(path.c_str(), 0755), 0);
      EXPECT_EQ(chown(path.c_str(), kAppUid, kAppGid), 0);
    }
    EXPECT_EQ(mkdir(vault_.c_str(), 0755), 0);
    std::ofstream(vault_ + "/file") << kSecret;
    EXPECT_EQ(chmod((vault_ + "/file").c_str(), 0600), 0);
    const AsApplication application;
    EXPECT_EQ(symlink(vault_.c_str(), (root_ + "/shared/link").c_str()), 0);
    EXPECT_EQ(link((vault_ + "/file").c_str(), (root_ + "/shared/other").c_str()), 0);
    std::ofstream(root_ + "/data/dir/file") << "its own";
    unlink((root_ + "/shared/other").c_str());
  }

  /** The application's file is another's, or its folder a link to another's; or its own again. */
  void put(bool others) const {
    const AsApplication application;
    const std::string spare = root_ + "/shared/spare";
    const std::string place = root_ + "/data/dir";
    if (folder_) {
      renameat2(AT_FDCWD, (root_ + "/shared/link").c_str(), AT_FDCWD, place.c_str(),
                RENAME_EXCHANGE);
      return;
    }
    unlink(spare.c_str());
    if (others) {
      EXPECT_EQ(link((vault_ + "/file").c_str(), spare.c_str()), 0) << "the kernel defends it";
    } else {
      close(static_cast<int>(
          syscall(SYS_openat, AT_FDCWD, spare.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0600)));
    }
    EXPECT_EQ(rename(spare.c_str(), (place + "/file").c_str()), 0);
  }
  /** Pack while another's is there from the step @p from on, to the step @p until. @return steps */
  int pack(int from, int until) {
    int steps = 0;
    std::function<void()> at_step = [&] {
      if (steps == from) put(true);
      if (steps == until) put(false);
      ++steps;
    };
    at_each_moment = &at_step;
    int error = 0;
    make_zip_data(kPackage, root_.c_str(), archive_.c_str(), &error);
    at_each_moment = nullptr;
    if (steps > from && steps <= until) put(false);
    met_ += error != 0;
    ++rounds_;
    return steps;
  }
  /** Everything that an archive holds. */
  std::string content() const {
    std::string all;
    unzFile zip = unzOpen64(archive_.c_str());
    for (int more = unzGoToFirstFile(zip); more == UNZ_OK; more = unzGoToNextFile(zip)) {
      unzOpenCurrentFile(zip);
      char text[4096];
      for (int count = 0; (count = unzReadCurrentFile(zip, text, sizeof text)) > 0;) {
        all.append(text, static_cast<std::size_t>(count));
      }
      unzCloseCurrentFile(zip);
    }
    unzClose(zip);
    return all;
  }
  void expect_no_secret(int from, int until) const {
    const auto passed = std::chrono::steady_clock::now() - begin_;
    ASSERT_EQ(content().find(kSecret), std::string::npos)
        << "there from step " << from << " to " << until << ", after " << rounds_ << " rounds, "
        << std::chrono::duration_cast<std::chrono::milliseconds>(passed).count() << " ms";
  }
  /** Every moment to begin, with every time to stay. */
  void race_once() {
    const int steps = pack(-1, -1);
    ASSERT_GT(steps, 40) << "the packing is seen";
    for (int from = 0; from < steps; ++from) {
      const int longest = from == 0 ? steps : kLongest;
      for (int stay = 1; stay <= longest; ++stay) {
        pack(from, from + stay);
        ASSERT_NO_FATAL_FAILURE(expect_no_secret(from, from + stay));
      }
    }
  }
  void race_all(bool folder) {
    folder_ = folder;
    int passes = 0;
    while (!HasFatalFailure() && std::chrono::steady_clock::now() - begin_ < race() / 2) {
      race_once();
      ++passes;
    }
    EXPECT_GT(met_, 0) << "what is another's was there when it was looked for";
    RecordProperty("passes", passes);
    RecordProperty("rounds", rounds_);
  }

  NiceMock<MockPlatform> platform_;
  const TempDir base_;
  const std::string root_ = base_ / "package";
  const std::string vault_ = base_ / "vault";
  const std::string archive_ = base_ / "archive.zip";
  const std::chrono::steady_clock::time_point begin_ = std::chrono::steady_clock::now();
  bool folder_ = false;
  int met_ = 0;
  int rounds_ = 0;
};

TEST_F(PackingRace, NoByteOfAnothersFileIsPackedThatIsThereForAMoment) { race_all(false); }

TEST_F(PackingRace, NorThroughAFolderThatIsALinkForAMoment) { race_all(true); }

}  // namespace
