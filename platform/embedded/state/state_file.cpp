#include "state/state_file.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <system_error>
#include <thread>

#include "state/clock.h"
#include "thread_annotations.h"

namespace embedded {
namespace {

constexpr mode_t kStateMode = 0644;
// Whoever can open it can hold it.
constexpr mode_t kLockMode = 0600;
// Temporary files have a folder of their own: the one that is watched sees whole files only.
constexpr char kTemporaryFolder[] = ".tmp";
constexpr char kLockFile[] = ".lock";

bool write_all(int fd, const char *data, size_t length) {
  while (length > 0) {
    const ssize_t written = TEMP_FAILURE_RETRY(write(fd, data, length));
    if (written < 0) return false;
    data += written;
    length -= static_cast<size_t>(written);
  }
  return true;
}

bool sync_folder(const std::string &folder) {
  const int fd = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return false;
  const bool synced = fsync(fd) == 0;
  close(fd);
  return synced;
}

/** The thread that waits for the disk in somebody's stead. */
class Writer {
 public:
  // Never destroyed: a process may end while the disk is waited for.
  static Writer &get() {
    static auto *const writer = new Writer;
    return *writer;
  }

  void start(const std::string &device, const std::string &file, KeyFilePtr content,
             StateLock lock) {
    const MutexLock guard(mutex_);
    join();
    const auto job = std::make_shared<Job>(Job{device, file, std::move(content), std::move(lock)});
    try {
      thread_ = std::thread([job] { job->run(); });
    } catch (const std::system_error &) {
      job->run();  // no thread is to be had, so the caller waits
    }
  }
  void wait() {
    const MutexLock guard(mutex_);
    join();
  }

 private:
  struct Job {
    std::string device;
    std::string file;
    KeyFilePtr content;
    StateLock lock;

    void run() const {
      if (write_state(device, file, content.get())) return;
      const int reason = errno;
      g_warning("%s: %s", state_path(device, file).c_str(), g_strerror(reason));
    }
  };

  void join() QUARN_REQUIRES(mutex_) {
    if (thread_.joinable()) thread_.join();
  }

  Mutex mutex_;
  std::thread thread_ QUARN_GUARDED_BY(mutex_);
};

}  // namespace

std::string current_device() {
  const char *device = std::getenv(kDeviceVariable);
  return device == nullptr ? std::string() : std::string(device);
}

std::string state_path(const std::string &device, const std::string &file) {
  return device + "/state/" + file;
}

KeyFilePtr read_state(const std::string &device, const std::string &file) {
  if (device.empty()) return nullptr;
  KeyFilePtr content(g_key_file_new());
  GError *error = nullptr;
  if (!g_key_file_load_from_file(content.get(), state_path(device, file).c_str(), G_KEY_FILE_NONE,
                                 &error)) {
    const bool missing = g_error_matches(error, G_FILE_ERROR, G_FILE_ERROR_NOENT);
    g_error_free(error);
    if (!missing) return nullptr;
  }
  return content;
}

bool write_state_text(const std::string &device, const std::string &file, const std::string &text,
                      unsigned int mode) {
  const std::string target = state_path(device, file);
  std::string temporary = state_path(device, std::string(kTemporaryFolder) + "/XXXXXX");
  const int fd = mkostemp(temporary.data(), O_CLOEXEC);
  if (fd < 0) return false;
  bool done = fchmod(fd, mode) == 0 && write_all(fd, text.data(), text.size()) && fsync(fd) == 0;
  done = close(fd) == 0 && done;
  done = done && rename(temporary.c_str(), target.c_str()) == 0;
  if (!done) {
    const int reason = errno;
    unlink(temporary.c_str());
    errno = reason;
    return false;
  }
  return sync_folder(target.substr(0, target.rfind('/')));
}

bool write_state(const std::string &device, const std::string &file, GKeyFile *content) {
  gsize length = 0;
  const GText text(g_key_file_to_data(content, &length, nullptr));
  return write_state_text(device, file, std::string(text.get(), length), kStateMode);
}

StateLock::StateLock(const std::string &device)
    : fd_(device.empty() ? -1
                         : open(state_path(device, kLockFile).c_str(),
                                O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, kLockMode)) {
  if (fd_ >= 0 && TEMP_FAILURE_RETRY(flock(fd_, LOCK_EX)) != 0) {
    close(fd_);
    fd_ = -1;
  }
}

StateLock::~StateLock() {
  if (fd_ >= 0) close(fd_);
}

bool edit_state(const std::string &device, const std::string &file,
                const std::function<bool(GKeyFile *)> &change) {
  const StateLock lock(device);
  if (!lock) return false;
  const KeyFilePtr content = read_state(device, file);
  return content != nullptr && change(content.get()) && write_state(device, file, content.get());
}

bool edit_state_behind(const std::string &device, const std::string &file,
                       const std::function<bool(GKeyFile *)> &change) {
  wait_for_state();
  StateLock lock(device);
  if (!lock) return false;
  KeyFilePtr content = read_state(device, file);
  if (content == nullptr || !change(content.get())) return false;
  Writer::get().start(device, file, std::move(content), std::move(lock));
  return true;
}

void wait_for_state() { Writer::get().wait(); }

void sweep_state(const std::string &device) {
  // Whoever is writing holds the lock.
  const StateLock lock(device);
  if (!lock) return;
  std::error_code ignored;
  for (const auto &entry :
       std::filesystem::directory_iterator(state_path(device, kTemporaryFolder), ignored)) {
    std::filesystem::remove(entry.path(), ignored);
  }
}

std::string text_of(GKeyFile *file, const char *group, const char *key) {
  const GText text(g_key_file_get_string(file, group, key, nullptr));
  return text == nullptr ? std::string() : std::string(text.get());
}

gint64 number_of(GKeyFile *file, const char *group, const char *key, gint64 otherwise) {
  GError *error = nullptr;
  const gint64 number = g_key_file_get_int64(file, group, key, &error);
  if (error == nullptr) return number;
  g_error_free(error);
  return otherwise;
}

gint64 now_ms() { return device_now_ms(current_device()); }

}  // namespace embedded
