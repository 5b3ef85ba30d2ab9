// The file backend's store, seen from outside: a folder on a small file system of its own.
#include <fcntl.h>
#include <linux/capability.h>
#include <sched.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/syscall.h>
#include <unistd.h>

#include "conformance.h"

using namespace harness;

namespace {

constexpr uid_t kSomebodyElse = 65534;

/**
 * Before any thread runs: mounts of our own, and no privilege that opens every folder, so that a
 * store can be closed to us. Threads inherit both.
 */
bool prepare_process() {
  if (unshare(CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
    return false;
  }
  __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct data[2];
  if (syscall(SYS_capget, &header, data) != 0) return false;
  for (auto &set : {&data[0].effective, &data[0].permitted}) {
    *set &= ~((1U << CAP_DAC_OVERRIDE) | (1U << CAP_DAC_READ_SEARCH));
  }
  return syscall(SYS_capset, &header, data) == 0;
}
const bool prepared = prepare_process();

class FileStore : public TestStore {
 public:
  FileStore() {
    EXPECT_TRUE(prepared);
    EXPECT_EQ(mount("none", base_.path().c_str(), "tmpfs", 0, "size=256m,mode=0700"), 0);
    EXPECT_EQ(mkdir(root().c_str(), 0700), 0);
  }
  ~FileStore() override { umount2(base_.path().c_str(), MNT_DETACH); }

  std::string config() const override { return "[cloud]\nurl=file://" + root() + "\n"; }
  std::string other_config() override { return "[cloud]\nurl=file://" + (base_ / "other") + "\n"; }
  std::map<std::string, std::string> content() const override { return tree(root()); }
  void put(const std::string &path, const std::string &content) override {
    for (auto slash = path.find('/', 1); slash != std::string::npos;
         slash = path.find('/', slash + 1)) {
      mkdir((root() + path.substr(0, slash)).c_str(), 0700);
    }
    write_file(root() + path, content);
  }

  void hold() override {
    lock_ = open(root().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    EXPECT_EQ(flock(lock_, LOCK_EX), 0);
  }
  void release() override {
    close(lock_);
    lock_ = -1;
  }

  void fill(std::size_t bytes) override {
    struct statvfs status {};
    ASSERT_EQ(statvfs(base_.path().c_str(), &status), 0);
    const int ballast = open((base_ / "ballast").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    ASSERT_EQ(
        posix_fallocate(ballast, 0, static_cast<off_t>(status.f_bfree * status.f_bsize - bytes)),
        0);
    close(ballast);
  }
  void unfill() override { EXPECT_EQ(unlink((base_ / "ballast").c_str()), 0); }

  void lock_out() override { EXPECT_EQ(chown(root().c_str(), kSomebodyElse, kSomebodyElse), 0); }
  void let_in() override { EXPECT_EQ(chown(root().c_str(), 0, 0), 0); }

  bool lists_timestamps() const override { return true; }

 private:
  std::string root() const { return base_ / "store"; }

  TempDir base_;
  int lock_ = -1;
};

std::unique_ptr<TestStore> make_file_store() { return std::make_unique<FileStore>(); }

const StoreKind kFileStore{"File", make_file_store};

INSTANTIATE_TEST_SUITE_P(Store, Conformance, ::testing::Values(kFileStore),
                         [](const auto &info) { return std::string(info.param.name); });

}  // namespace
