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
#include "files/tree_walk.h"
#include "quarn_d_utils/tree_place.h"

namespace {

/** Waiting files share the disk's flushes, so a few at once cost little more than one. */
constexpr std::size_t kThreads = 4;
/**
 * More files are brought to the disk all at once. Each by itself waits for a flush of the disk's
 * cache, of which two thousand took longer than everything else that a restore does.
 */
constexpr std::size_t kFew = 64;
static_assert(kFew < kMaxDirDepth, "the folders on the way are too many before they are too deep");

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

/** Shows each file, and then each directory that holds some, to @p visit, which takes it. */
template <typename Visit>
class SyncWalk : public TreeVisitor {
 public:
  using Skipped = std::function<bool(const std::string &)>;
  SyncWalk(std::string path, const Skipped &skipped, Visit visit)
      : path_(std::move(path)), skipped_(skipped), visit_(std::move(visit)) {}

  /** Until it answers false. @return true when every place was reached */
  bool run() {
    TreePlace place(safe_open(path_.c_str(), O_RDONLY | O_DIRECTORY | O_NONBLOCK));
    return place && walk_tree(&place, &path_, this) && whole_;
  }

  /** One directory: its files and then itself. */
  bool scan(const TreePlace &place, std::vector<std::string> *folders) {
    const int dir = place.fd();
    std::vector<TreeEntry> entries;
    if (!list_tree_entries(dir, &entries)) whole_ = false;
    for (TreeEntry &entry : entries) {
      if (skipped_ && skipped_(path_ + "/" + entry.name)) continue;
      struct stat status = {};
      if (entry.type != DT_DIR) {
        UniqueFd file = safe_open_file_at(dir, entry.name.c_str(), &status);
        if (file) {
          if (!visit_(std::move(file))) return false;
          continue;
        }
        if (fstatat(dir, entry.name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) continue;
        if (S_ISREG(status.st_mode)) whole_ = false;
        if (!S_ISDIR(status.st_mode)) continue;
      }
      folders->push_back(std::move(entry.name));
    }
    UniqueFd itself(openat(dir, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (itself) return visit_(std::move(itself));
    whole_ = false;
    return true;
  }

  TreeStep enter(TreePlace *place, const std::string &name) {
    if (place->down(name.c_str())) return TreeStep::entered;
    whole_ = false;
    return TreeStep::passed;
  }

 private:
  std::string path_;
  const Skipped &skipped_;
  Visit visit_;
  bool whole_ = true;
};

}  // namespace

bool sync_tree(const std::string &dir, const std::function<bool(const std::string &)> &skipped) {
  std::vector<UniqueFd> few;
  SyncWalk walk(dir, skipped, [&](UniqueFd object) {
    few.push_back(std::move(object));
    return few.size() <= kFew;
  });
  const bool reached = walk.run();
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
