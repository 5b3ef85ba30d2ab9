#include "quarn_d_utils/disk_sync.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <condition_variable>
#include <deque>
#include <mutex>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "quarn_d_utils/safe_path.h"
#include "quarn_d_utils/tree_place.h"

namespace {

/** Waiting files share the disk's flushes, so a few at once cost little more than one. */
constexpr std::size_t kThreads = 4;
/** Descriptors that may wait; with the first of them writing begins already. */
constexpr std::size_t kMaxWaiting = 64;

/** Syncs what it is given in threads of its own. */
class SyncPool {
 public:
  SyncPool() {
    try {
      for (std::size_t i = 0; i < kThreads; ++i) threads_.emplace_back([this] { work(); });
    } catch (const std::system_error &) {  // with fewer of them, or none, it only takes longer
    }
  }
  ~SyncPool() { finish(); }
  SyncPool(const SyncPool &) = delete;
  SyncPool &operator=(const SyncPool &) = delete;

  void add(UniqueFd object) {
    if (threads_.empty()) {
      if (fsync(object.get()) != 0) fail();
      return;
    }
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait(lock, [this] { return waiting_.size() < kMaxWaiting; });
    waiting_.push_back(std::move(object));
    changed_.notify_all();
  }
  void fail() {
    const std::lock_guard<std::mutex> lock(mutex_);
    failed_ = true;
  }
  /** @return true when everything is on the disk */
  bool finish() {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      ended_ = true;
      changed_.notify_all();
    }
    for (auto &thread : threads_) {
      if (thread.joinable()) thread.join();
    }
    return !failed_;
  }

 private:
  void work() {
    while (true) {
      UniqueFd object;
      {
        std::unique_lock<std::mutex> lock(mutex_);
        changed_.wait(lock, [this] { return ended_ || !waiting_.empty(); });
        if (waiting_.empty()) return;
        object = std::move(waiting_.front());
        waiting_.pop_front();
        changed_.notify_all();
      }
      if (fsync(object.get()) != 0) fail();
    }
  }

  std::mutex mutex_;
  std::condition_variable changed_;
  std::deque<UniqueFd> waiting_;
  bool ended_ = false;
  bool failed_ = false;
  std::vector<std::thread> threads_;
};

/** What is done with each file and directory of a walk. */
class SyncWalk {
 public:
  SyncWalk(std::string path, std::function<bool(const std::string &)> skipped)
      : path_(std::move(path)), skipped_(std::move(skipped)) {}

  /** Visit everything; @p visit takes each descriptor. @return false when a place was not reached
   */
  bool run(const std::function<void(UniqueFd)> &visit) {
    TreePlace place(safe_open(path_.c_str(), O_RDONLY | O_DIRECTORY | O_NONBLOCK));
    if (!place) return false;
    std::string path = path_;
    bool whole = true;
    std::vector<std::vector<std::string>> pending;
    pending.push_back(scan(place.fd(), path, visit, &whole));
    while (true) {
      if (pending.back().empty()) {
        pending.pop_back();
        if (pending.empty()) return whole;
        if (!place.up()) return false;
        path.resize(path.rfind('/'));
        continue;
      }
      const std::string name = std::move(pending.back().back());
      pending.back().pop_back();
      if (!place.down(name.c_str())) {
        whole = false;
        continue;
      }
      path += "/" + name;
      pending.push_back(scan(place.fd(), path, visit, &whole));
    }
  }

 private:
  /** One directory: its files and then itself. @return the directories in it */
  std::vector<std::string> scan(int dir, const std::string &path,
                                const std::function<void(UniqueFd)> &visit, bool *whole) const {
    std::vector<TreeEntry> entries;
    std::vector<std::string> folders;
    if (!list_tree_entries(dir, &entries)) *whole = false;
    for (TreeEntry &entry : entries) {
      if (skipped_ && skipped_(path + "/" + entry.name)) continue;
      struct stat status = {};
      if (entry.type != DT_DIR) {
        UniqueFd file = safe_open_file_at(dir, entry.name.c_str(), &status);
        if (file) {
          visit(std::move(file));
          continue;
        }
        if (fstatat(dir, entry.name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) continue;
        if (S_ISREG(status.st_mode)) *whole = false;
        if (!S_ISDIR(status.st_mode)) continue;
      }
      folders.push_back(std::move(entry.name));
    }
    UniqueFd itself(openat(dir, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (itself) {
      visit(std::move(itself));
    } else {
      *whole = false;
    }
    return folders;
  }

  const std::string path_;
  const std::function<bool(const std::string &)> skipped_;
};

}  // namespace

bool sync_tree(const std::string &dir, const std::function<bool(const std::string &)> &skipped) {
  SyncWalk walk(dir, skipped);
  // Everything is on its way before the first wait: one commit then serves many files.
  bool whole = walk.run([](const UniqueFd &object) {
    sync_file_range(object.get(), 0, 0, SYNC_FILE_RANGE_WRITE);  // only files; it is a hint
  });
  SyncPool pool;
  if (!walk.run([&](UniqueFd object) { pool.add(std::move(object)); })) whole = false;
  return pool.finish() && whole;
}

bool sync_directory(const std::string &dir) {
  const UniqueFd handle = safe_open(dir.c_str(), O_RDONLY | O_DIRECTORY);
  return handle && fsync(handle.get()) == 0;
}
