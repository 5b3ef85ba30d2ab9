#include "file/backend_file.h"

#include <fcntl.h>
#include <glib.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <vector>

#include "core/checksum.h"
#include "core/file_bytes.h"
#include "core/remote_path.h"
#include "file/store_folder.h"

namespace transport {
namespace {

using std::chrono::milliseconds;

constexpr int kObjectFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
constexpr std::size_t kBufferBytes = 256 * 1024;
constexpr milliseconds kFirstLockPause{1};
constexpr milliseconds kLongestLockPause{20};
constexpr milliseconds kLockPatience{60000};
constexpr int64_t kMillisecondsPerSecond = 1000;
constexpr int64_t kNanosecondsPerMillisecond = 1000000;

Outcome store_failure(const char *what, int error) {
  backup_trans_error_code code = BACKUP_TRANS_ERROR_SERVER;
  switch (error) {
    case ENOSPC:
    case EDQUOT:
    case EFBIG:
      code = BACKUP_TRANS_ERROR_QUOTA;
      break;
    case EACCES:
    case EPERM:
      code = BACKUP_TRANS_ERROR_AUTHENTICATION;
      break;
    default:
      break;
  }
  return failure(code, std::string(what) + ": " + g_strerror(error));
}

Outcome local_failure(const char *what, int error) {
  return failure(BACKUP_TRANS_ERROR_LOCAL_FILE, std::string(what) + ": " + g_strerror(error));
}

Outcome no_such_object() {
  return failure(BACKUP_TRANS_ERROR_NO_SUCH_OBJECT, "no such object in the store");
}

// Not there, or something else than objects and folders, which the store does not have.
bool means_absent(int error) { return error == ENOENT || error == ENOTDIR || error == ELOOP; }

int64_t timestamp_of(const struct stat &status) {
  return static_cast<int64_t>(status.st_mtim.tv_sec) * kMillisecondsPerSecond +
         status.st_mtim.tv_nsec / kNanosecondsPerMillisecond;
}

bool set_timestamp(int fd, int64_t timestamp_ms) {
  struct timespec times[2] = {};
  times[0].tv_nsec = UTIME_OMIT;
  times[1].tv_sec = timestamp_ms / kMillisecondsPerSecond;
  times[1].tv_nsec = (timestamp_ms % kMillisecondsPerSecond) * kNanosecondsPerMillisecond;
  return futimens(fd, times) == 0;
}

class FileBackend : public Backend {
 public:
  explicit FileBackend(std::string root) : root_path_(std::move(root)) {}

  Outcome download(Attempt &attempt, const std::string &path, LocalTarget &target,
                   Version *version) override {
    UniqueFd object;
    uint64_t size = 0;
    Outcome outcome = open_object(attempt.ticket, path, &object, &size);
    if (outcome.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT && version != nullptr) version->reset();
    if (!outcome.ok()) return outcome;
    if (size > target.limit()) return too_large();
    if (!target.begin()) return local_failure("cannot make a local file", errno);
    Checksum checksum(G_CHECKSUM_SHA256);
    uint64_t copied = 0;
    outcome = copy(attempt.ticket, object.get(), target.fd(), &checksum, &copied,
                   Direction::from_store, size);
    if (!outcome.ok()) return outcome;
    if (copied != size)
      return failure(BACKUP_TRANS_ERROR_SERVER, "the object changed while it was read");
    if (!target.sync()) return local_failure("cannot write the local file", errno);
    if (!attempt.ticket.begin_commit()) return cancelled();
    if (!target.publish()) return local_failure("cannot replace the local file", errno);
    if (version != nullptr) *version = checksum.hex();
    return success();
  }

  Outcome upload(Attempt &attempt, const Upload &upload, ObjectInfo *info) override {
    const UniqueFd root = open_root(root_path_, true);
    if (!root) return store_failure("cannot open the store", errno);
    Outcome outcome = sweep(attempt.ticket, root.get());
    if (!outcome.ok()) return outcome;
    StagedFile staged;
    outcome = stage(attempt.ticket, root.get(), upload, &staged);
    if (!outcome.ok()) return outcome;
    outcome = commit(attempt.ticket, root.get(), upload, &staged);
    if (!outcome.ok()) return outcome;
    *info = info_of(upload);
    return outcome;
  }

  Outcome list(Attempt &attempt, const std::string &folder, int start, int count,
               ListPage *page) override {
    const UniqueFd root = open_root(root_path_, false);
    if (!root) return errno == ENOENT ? success() : store_failure("cannot open the store", errno);
    Outcome outcome = lock(attempt.ticket, root.get(), LOCK_SH);
    if (!outcome.ok()) return outcome;
    FolderChain chain(root.get());
    const std::vector<std::string> components = split_path(folder);
    if (!chain.enter(components, components.size(), false)) {
      return means_absent(errno) ? success() : store_failure("cannot open the folder", errno);
    }
    std::vector<std::pair<std::string, EntryKind>> entries;
    const bool read = for_each_entry(chain.innermost(), [&](const char *name, EntryKind kind) {
      if (kind == EntryKind::object || holds_object(chain.innermost(), name))
        entries.emplace_back(name, kind);
      return !attempt.ticket.cancelled();
    });
    if (!read) return store_failure("cannot read the folder", errno);
    std::sort(entries.begin(), entries.end());
    const std::size_t first = std::min(entries.size(), static_cast<std::size_t>(start));
    const std::size_t last = std::min(entries.size(), first + static_cast<std::size_t>(count));
    for (std::size_t i = first; i < last; ++i) {
      ObjectInfo child;
      child.path = folder + "/" + entries[i].first;
      child.is_file = entries[i].second == EntryKind::object;
      struct stat status {};
      if (child.is_file &&
          fstatat(chain.innermost(), entries[i].first.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0) {
        child.size = static_cast<uint64_t>(status.st_size);
        child.timestamp_ms = timestamp_of(status);
      }
      page->children.push_back(std::move(child));
    }
    page->more = last < entries.size();
    return success();
  }

  Outcome remove_folder(Attempt &attempt, const std::string &folder) override {
    const UniqueFd root = open_root(root_path_, false);
    if (!root)
      return errno == ENOENT ? no_such_object() : store_failure("cannot open the store", errno);
    Outcome outcome = sweep(attempt.ticket, root.get());
    if (!outcome.ok()) return outcome;
    const std::string doomed = make_temporary_name();
    UniqueFd removed;
    bool held_object = false;
    {
      outcome = lock(attempt.ticket, root.get(), LOCK_EX);
      if (!outcome.ok()) return outcome;
      const Unlock unlock(root.get());
      FolderChain chain(root.get());
      const std::vector<std::string> components = split_path(folder);
      const std::string &name = components.back();
      if (chain.enter(components, components.size() - 1, false))
        removed.reset(openat(chain.innermost(), name.c_str(), kFolderFlags));
      if (!removed)
        return means_absent(errno) ? no_such_object()
                                   : store_failure("cannot open the folder", errno);
      held_object = holds_object(chain.innermost(), name.c_str());
      if (!attempt.ticket.begin_commit()) return cancelled();
      // Tells other processes that somebody is at work on what they find under this name.
      flock(removed.get(), LOCK_EX | LOCK_NB);
      if (renameat(chain.innermost(), name.c_str(), root.get(), doomed.c_str()) != 0)
        return store_failure("cannot delete the folder", errno);
      fsync(chain.innermost());
      chain.prune();
    }
    remove_tree(root.get(), doomed.c_str());
    fsync(root.get());
    return held_object ? success() : no_such_object();
  }

 private:
  enum class Direction { to_store, from_store };

  class Unlock {
   public:
    explicit Unlock(int fd) : fd_(fd) {}
    Unlock(const Unlock &) = delete;
    Unlock &operator=(const Unlock &) = delete;
    ~Unlock() { flock(fd_, LOCK_UN); }

   private:
    int fd_;
  };

  // A blocking flock could not be cancelled, and whoever holds it may be stopped.
  static Outcome lock(Ticket &ticket, int root, int mode) {
    milliseconds pause = kFirstLockPause;
    for (milliseconds waited{0}; waited < kLockPatience; waited += pause) {
      if (flock(root, mode | LOCK_NB) == 0) return success();
      if (errno != EWOULDBLOCK && errno != EINTR)
        return store_failure("cannot lock the store", errno);
      if (!ticket.pause(pause)) return cancelled();
      pause = std::min(pause * 2, kLongestLockPause);
    }
    return failure(BACKUP_TRANS_ERROR_SERVER, "another process keeps the store locked");
  }

  Outcome open_object(Ticket &ticket, const std::string &path, UniqueFd *object, uint64_t *size) {
    const UniqueFd root = open_root(root_path_, false);
    if (!root)
      return errno == ENOENT ? no_such_object() : store_failure("cannot open the store", errno);
    const Outcome outcome = lock(ticket, root.get(), LOCK_SH);
    if (!outcome.ok()) return outcome;
    FolderChain chain(root.get());
    const std::vector<std::string> components = split_path(path);
    if (chain.enter(components, components.size() - 1, false))
      object->reset(openat(chain.innermost(), components.back().c_str(), kObjectFlags));
    if (!*object)
      return means_absent(errno) ? no_such_object()
                                 : store_failure("cannot open the object", errno);
    struct stat status {};
    if (fstat(object->get(), &status) != 0) return store_failure("cannot open the object", errno);
    if (!S_ISREG(status.st_mode)) return no_such_object();
    *size = static_cast<uint64_t>(status.st_size);
    return success();
  }

  static Outcome too_large() {
    return failure(BACKUP_TRANS_ERROR_TOO_LARGE, "the object is larger than it may be");
  }

  // An object that somebody writes may become longer for as long as it is read: no more than
  // @p most bytes of it are, and one.
  static Outcome copy(Ticket &ticket, int from, int to, Checksum *checksum, uint64_t *copied,
                      Direction direction, uint64_t most = UINT64_MAX) {
    const std::unique_ptr<char[]> buffer(new char[kBufferBytes]);
    const bool upload = direction == Direction::to_store;
    for (off_t offset = 0;;) {
      if (ticket.cancelled()) return cancelled();
      const ssize_t count = read_at(from, buffer.get(), kBufferBytes, offset);
      if (count < 0) {
        return upload ? local_failure("cannot read the local file", errno)
                      : store_failure("cannot read the object", errno);
      }
      if (count == 0 || *copied > most) return success();
      if (!write_all(to, buffer.get(), static_cast<std::size_t>(count))) {
        return upload ? store_failure("cannot write the object", errno)
                      : local_failure("cannot write the local file", errno);
      }
      if (checksum != nullptr) checksum->add(buffer.get(), static_cast<std::size_t>(count));
      offset += count;
      *copied += static_cast<uint64_t>(count);
    }
  }

  static Outcome stage(Ticket &ticket, int root, const Upload &upload, StagedFile *staged) {
    // Under the lock a name that is there has a flock on it, or nobody to whom it belongs.
    Outcome outcome = lock(ticket, root, LOCK_SH);
    if (!outcome.ok()) return outcome;
    const bool created = staged->create(root);
    const int error = errno;
    flock(root, LOCK_UN);
    if (!created) return store_failure("cannot make an object", error);
    uint64_t copied = 0;
    outcome = copy(ticket, upload.source.fd(), staged->fd(), nullptr, &copied, Direction::to_store);
    if (!outcome.ok()) return outcome;
    if (copied != upload.source.size() || !upload.source.unchanged())
      return failure(BACKUP_TRANS_ERROR_LOCAL_FILE, "the local file changed while it was sent");
    if (!set_timestamp(staged->fd(), upload.timestamp_ms) || fsync(staged->fd()) != 0)
      return store_failure("cannot write the object", errno);
    return success();
  }

  Outcome commit(Ticket &ticket, int root, const Upload &upload, StagedFile *staged) {
    FolderChain chain(root);
    {
      Outcome outcome = lock(ticket, root, LOCK_EX);
      if (!outcome.ok()) return outcome;
      const Unlock unlock(root);
      const std::vector<std::string> components = split_path(upload.path);
      if (upload.basis != nullptr) {
        outcome = compare_basis(ticket, root, components, *upload.basis);
        if (!outcome.ok()) return outcome;
      }
      if (!ticket.begin_commit()) return cancelled();
      if (!chain.enter(components, components.size() - 1, true) ||
          !staged->publish(chain.innermost(), components.back())) {
        const int error = errno;
        chain.prune();
        return store_failure("cannot store the object", error);
      }
    }
    chain.sync();
    return success();
  }

  static Outcome compare_basis(Ticket &ticket, int root, const std::vector<std::string> &components,
                               const Version &basis) {
    FolderChain chain(root);
    UniqueFd object;
    if (chain.enter(components, components.size() - 1, false))
      object.reset(openat(chain.innermost(), components.back().c_str(), kObjectFlags));
    if (!object && !means_absent(errno)) return store_failure("cannot open the object", errno);
    Version present;
    struct stat status {};
    if (object && fstat(object.get(), &status) == 0 && S_ISREG(status.st_mode)) {
      Checksum checksum(G_CHECKSUM_SHA256);
      const Outcome outcome = checksum_of(ticket, object.get(), &checksum);
      if (!outcome.ok()) return outcome;
      present = checksum.hex();
    }
    if (present == basis) return success();
    return failure(BACKUP_TRANS_ERROR_CONFLICT, "the object changed since it was read");
  }

  static Outcome checksum_of(Ticket &ticket, int object, Checksum *checksum) {
    const std::unique_ptr<char[]> buffer(new char[kBufferBytes]);
    for (;;) {
      if (ticket.cancelled()) return cancelled();
      const ssize_t count = read(object, buffer.get(), kBufferBytes);
      if (count < 0 && errno == EINTR) continue;
      if (count < 0) return store_failure("cannot read the object", errno);
      if (count == 0) return success();
      checksum->add(buffer.get(), static_cast<std::size_t>(count));
    }
  }

  // What writers that ended in the middle have left, once.
  Outcome sweep(Ticket &ticket, int root) {
    if (swept_) return success();
    const Outcome outcome = lock(ticket, root, LOCK_EX);
    if (!outcome.ok()) return outcome;
    const Unlock unlock(root);
    const Directory directory = open_directory(root);
    if (!directory) return store_failure("cannot read the store", errno);
    while (const struct dirent *entry = readdir(directory.get())) {
      if (!is_temporary_name(entry->d_name)) continue;
      const UniqueFd leftover(openat(root, entry->d_name, kObjectFlags));
      if (leftover && flock(leftover.get(), LOCK_EX | LOCK_NB) == 0)
        remove_tree(root, entry->d_name);
    }
    swept_ = true;
    return success();
  }

  const std::string root_path_;
  std::atomic<bool> swept_{false};
};

}  // namespace

std::string path_of_file_url(const std::string &url) {
  static constexpr char kScheme[] = "file://";
  if (url.compare(0, sizeof kScheme - 1, kScheme) != 0) return "";
  char *decoded = g_uri_unescape_string(url.c_str() + sizeof kScheme - 1, nullptr);
  std::string path = decoded == nullptr ? "" : decoded;
  g_free(decoded);
  if (path.empty() || path[0] != '/') return "";
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

std::shared_ptr<Backend> make_file_backend(std::string root) {
  return std::make_shared<FileBackend>(std::move(root));
}

}  // namespace transport
