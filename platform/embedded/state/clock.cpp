#include "state/clock.h"

#include <sys/stat.h>

#include "state/state_file.h"
#include "thread_annotations.h"

namespace embedded {
namespace {

constexpr char kClockGroup[] = "clock";
constexpr char kOffset[] = "offset_ms";
constexpr std::int64_t kMicrosInMilli = 1000;

/** What a file that is only ever replaced whole is known by. */
struct Version {
  dev_t device = 0;
  ino_t inode = 0;
  timespec made{};

  bool operator==(const Version &other) const {
    return device == other.device && inode == other.inode && made.tv_sec == other.made.tv_sec &&
           made.tv_nsec == other.made.tv_nsec;
  }
};

/** The offset is asked for with every line of the log: the file is read when it was replaced. */
class Offset {
 public:
  std::int64_t get(const std::string &device) {
    struct stat status {};
    if (device.empty() || stat(state_path(device, kClockFile).c_str(), &status) != 0) return 0;
    const Version version{status.st_dev, status.st_ino, status.st_ctim};
    const MutexLock lock(mutex_);
    if (version == version_) return offset_;
    const KeyFilePtr file = read_state(device, kClockFile);
    if (file == nullptr) return 0;
    version_ = version;
    offset_ = number_of(file.get(), kClockGroup, kOffset, 0);
    return offset_;
  }

 private:
  Mutex mutex_;
  Version version_ QUARN_GUARDED_BY(mutex_);
  std::int64_t offset_ QUARN_GUARDED_BY(mutex_) = 0;
};

}  // namespace

std::int64_t clock_offset_ms(const std::string &device) {
  // Never destroyed: threads may ask until the process is gone.
  static auto *const offset = new Offset;
  return offset->get(device);
}

bool set_clock_offset_ms(const std::string &device, std::int64_t offset) {
  return edit_state(device, kClockFile, [offset](GKeyFile *file) {
    g_key_file_set_int64(file, kClockGroup, kOffset, offset);
    return true;
  });
}

std::int64_t machine_now_ms() { return g_get_real_time() / kMicrosInMilli; }

std::int64_t device_now_ms(const std::string &device) {
  return machine_now_ms() + clock_offset_ms(device);
}

}  // namespace embedded
