// An application wins the moment between the opening of a file and the look at it: the file had a
// second name, by the application's doing, and has it no longer.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <unzip.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>

#include "mock_platform.h"
#include "quarn_common.h"
#include "quarn_d_utils/quarn_d_utils.h"

namespace {

using ::testing::NiceMock;

constexpr char kPackage[] = "org.example.hostile";
constexpr char kSecret[] = "what only root may read";
constexpr int kNames = 8;

/** How long it runs; with files opened by root it took well below a second. */
std::chrono::milliseconds race() {
  const char *seconds = std::getenv("QUARN_RACE_SECONDS");
  return std::chrono::milliseconds(seconds == nullptr ? 30000 : 1000 * std::atoi(seconds));
}

class PackingRace : public ::testing::Test {
 protected:
  PackingRace() {
    ON_CALL(platform_, smack_getlabel)
        .WillByDefault([](const char *, char **label, smack_label_type) {
          *label = strdup("_");
          return 0;
        });
    EXPECT_EQ(chmod(base_.c_str(), 0755), 0);
    for (const char *name : {"", "/data", "/shared", "/shared/data", "/shared/trusted"}) {
      const std::string path = root_ + name;
      EXPECT_EQ(mkdir(path.c_str(), 0755), 0);
      EXPECT_EQ(chown(path.c_str(), kAppUid, kAppGid), 0);
    }
    std::ofstream(secret_) << kSecret;
    EXPECT_EQ(chmod(secret_.c_str(), 0600), 0);
    attacker_ = fork();
    if (attacker_ == 0) attack();
  }
  ~PackingRace() override {
    kill(attacker_, SIGKILL);
    waitpid(attacker_, nullptr, 0);
    std::filesystem::remove_all(base_);
  }
  [[noreturn]] void attack() const {
    if (setgid(kAppGid) != 0 || setuid(kAppUid) != 0) _exit(1);
    std::string names[kNames];
    for (int i = 0; i < kNames; ++i) names[i] = root_ + "/data/file" + std::to_string(i);
    for (;;) {
      for (const std::string &name : names) {
        static_cast<void>(!link(secret_.c_str(), name.c_str()));
        unlink(name.c_str());
      }
    }
  }
  /** Everything that an archive holds. */
  static std::string content_of(const std::string &archive) {
    std::string all;
    unzFile zip = unzOpen64(archive.c_str());
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

  NiceMock<MockPlatform> platform_;
  std::string base_ = "/tmp/quarn-packing-race-XXXXXX";
  const std::string root_ = std::string(mkdtemp(base_.data())) + "/package";
  const std::string secret_ = base_ + "/secret";
  pid_t attacker_ = 0;
};

TEST_F(PackingRace, NoByteOfAnothersFileIsPacked) {
  const std::string archive = base_ + "/archive.zip";
  const auto begin = std::chrono::steady_clock::now();
  int rounds = 0;
  int met = 0;
  for (; std::chrono::steady_clock::now() - begin < race(); ++rounds) {
    int error = 0;
    make_zip_data(kPackage, root_.c_str(), archive.c_str(), &error);
    met += error != 0;
    ASSERT_EQ(content_of(archive).find(kSecret), std::string::npos)
        << "after " << rounds << " rounds, "
        << std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() -
                                                                 begin)
               .count()
        << " ms";
  }
  EXPECT_GT(met, 0) << "a link was there when it was looked for";
  RecordProperty("rounds", rounds);
}

}  // namespace
