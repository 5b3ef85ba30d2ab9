#include "quarn_d_utils/disk_sync.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "files/safe_path.h"
#include "quarn_d_utils/tree_place.h"

namespace {

/** Waiting files share the disk's flushes, so a few at once cost little more than one. */
constexpr std::size_t kThreads = 4;
/**
 * More files are brought to the disk all at once. Each by itself waits for a flush of the disk's
 * cache, of which two thousand took longer than everything else that a restore does.
 */
constexpr std::size_t kFew = 64;

/** Sync a few objects in threads. @return true when everything is on the disk */
bool sync_each(const std::vector<UniqueFd> &objects) {
  std::atomic<std::size_t> next{0};
  std::atomic<bool> synced{true};
  const auto work = [&] {
    for (std::size_t at = next++; at < objects.size(); at = next++) {
      if (fsync(objects[at].get()) != 0) synced = false;
    }
  };
  std::vector<std::thread> threads;
  try {
    while (threads.size() + 1 < std::min(kThreads, objects.size())) threads.emplace_back(work);
  } catch (const std::system_error &) {  // with fewer of them, or none, it only takes longer
  }
  work();
  for (auto &thread : threads) thread.join();
  return synced;
}

bool sync_file_system(const std::string &dir) {
  const UniqueFd handle = safe_open(dir.c_str(), O_RDONLY | O_DIRECTORY);
  return handle && syncfs(handle.get()) == 0;
}

/** What is done with each file and directory of a walk. */
class SyncWalk {
 public:
  SyncWalk(std::string path, std::function<bool(const std::string &)> skipped)
      : path_(std::move(path)), skipped_(std::move(skipped)) {}

  /**
   * Visit everything; @p visit takes each descriptor, and ends the walk when it answers false.
   * @return true when every place was reached
   */
  bool run(const std::function<bool(UniqueFd)> &visit) {
    TreePlace place(safe_open(path_.c_str(), O_RDONLY | O_DIRECTORY | O_NONBLOCK));
    if (!place) return false;
    std::string path = path_;
    bool whole = true;
    std::vector<std::vector<std::string>> pending;
    pending.push_back(scan(place.fd(), path, visit, &whole));
    while (!stopped_) {
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
    return false;
  }

 private:
  std::vector<std::string> stopped() {
    stopped_ = true;
    return {};
  }

  /** One directory: its files and then itself. @return the directories in it */
  std::vector<std::string> scan(int dir, const std::string &path,
                                const std::function<bool(UniqueFd)> &visit, bool *whole) {
    std::vector<TreeEntry> entries;
    std::vector<std::string> folders;
    if (!list_tree_entries(dir, &entries)) *whole = false;
    for (TreeEntry &entry : entries) {
      if (skipped_ && skipped_(path + "/" + entry.name)) continue;
      struct stat status = {};
      if (entry.type != DT_DIR) {
        UniqueFd file = safe_open_file_at(dir, entry.name.c_str(), &status);
        if (file) {
          if (!visit(std::move(file))) return stopped();
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
      if (!visit(std::move(itself))) return stopped();
    } else {
      *whole = false;
    }
    return folders;
  }

  const std::string path_;
  const std::function<bool(const std::string &)> skipped_;
  bool stopped_ = false;
};

}  // namespace

bool sync_tree(const std::string &dir, const std::function<bool(const std::string &)> &skipped) {
  SyncWalk walk(dir, skipped);
  std::vector<UniqueFd> few;
  const bool reached = walk.run([&](UniqueFd object) {
    few.push_back(std::move(object));
    return few.size() <= kFew;
  });
  if (few.size() > kFew) return sync_file_system(dir);
  // Everything is on its way before the first wait: one commit then serves many files.
  for (const UniqueFd &object : few) {
    sync_file_range(object.get(), 0, 0, SYNC_FILE_RANGE_WRITE);  // only files; it is a hint
  }
  return sync_each(few) && reached;
}

bool sync_directory(const std::string &dir) {
  const UniqueFd handle = safe_open(dir.c_str(), O_RDONLY | O_DIRECTORY);
  return handle && fsync(handle.get()) == 0;
}
