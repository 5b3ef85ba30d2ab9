#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <utility>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_utils/disk_sync.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_d_utils/unpacked_file.h"
#include "quarn_d_utils/working_files.h"

namespace {

constexpr mode_t kPrivateFile = 0600;
constexpr std::size_t kWaitingStamps = 4096;
constexpr char kUnfinished[] = ".new";

using Stamps = std::vector<std::uint64_t>;

/** Spreads what differs little over all bits. */
std::uint64_t mix(std::uint64_t value) {
  value = (value ^ (value >> 30U)) * 0xbf58476d1ce4e5b9U;
  value = (value ^ (value >> 27U)) * 0x94d049bb133111ebU;
  return value ^ (value >> 31U);
}

/** Append the stamps of a file. @return false when there is none that is whole */
bool read_stamps(const std::string &path, Stamps *stamps) {
  const UniqueFd file = safe_open(path.c_str(), O_RDONLY);
  struct stat status = {};
  if (!file || fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) return false;
  const auto count = static_cast<std::size_t>(status.st_size) / sizeof(std::uint64_t);
  const std::size_t before = stamps->size();
  stamps->resize(before + count);
  auto *at = reinterpret_cast<char *>(stamps->data() + before);
  std::size_t left = count * sizeof(std::uint64_t);
  while (left > 0) {
    const ssize_t got = TEMP_FAILURE_RETRY(read(file.get(), at, left));
    if (got <= 0) return false;
    at += got;
    left -= static_cast<std::size_t>(got);
  }
  return true;
}

/** Shows the regular files of a package's data to @p visit, by path and status. */
template <typename Visit>
class DataWalk : public TreeVisitor {
 public:
  DataWalk(const restore_files &files, Visit visit) : files_(files), visit_(std::move(visit)) {}

  /** As long as it answers true. */
  void run() {
    const ActAsPackage acting;
    for (const auto &dir : files_.dirs) {
      TreePlace place(open_held_as_package(dir, O_RDONLY | O_DIRECTORY | O_NONBLOCK),
                      TreeAccess::kPackage);
      path_ = dir;
      if (place) static_cast<void>(walk_tree(&place, &path_, this));
      if (!wanted_) return;
    }
  }

  /** A folder that is deeper than any that is backed up; empty for none. */
  const std::string &dug() const { return dug_; }

  TreeStep too_deep(TreePlace * /*place*/, const std::string & /*name*/) {
    dug_ = path_;
    return TreeStep::passed;
  }

  bool scan(const TreePlace &place, std::vector<std::string> *folders) {
    std::vector<TreeEntry> entries;
    // What cannot be read now has no stamp, and counts as the application's once it can.
    static_cast<void>(list_tree_entries(place.fd(), &entries));
    for (TreeEntry &entry : entries) {
      const std::string path = path_ + "/" + entry.name;
      if (files_.is_skipped(path) || path == files_.table) continue;
      struct stat status = {};
      if (status_as_package(place.fd(), entry.name.c_str(), user_of_package(), &status) != 0) {
        continue;
      }
      if (S_ISDIR(status.st_mode)) {
        folders->push_back(std::move(entry.name));
      } else if (S_ISREG(status.st_mode) && !is_own_leftover(entry.name.c_str(), status)) {
        wanted_ = visit_(path, status);
        if (!wanted_) return false;
      }
    }
    return true;
  }

 private:
  const restore_files &files_;
  Visit visit_;
  std::string path_;
  std::string dug_;
  bool wanted_ = true;
};

}  // namespace

std::uint64_t file_stamp(const struct stat &status) {
  std::uint64_t stamp = mix(status.st_ino);
  stamp = mix(stamp ^ static_cast<std::uint64_t>(status.st_size));
  stamp = mix(stamp ^ static_cast<std::uint64_t>(status.st_mtim.tv_sec));
  return mix(stamp ^ static_cast<std::uint64_t>(status.st_mtim.tv_nsec));
}

StampWriter::StampWriter(std::string path) : path_(std::move(path)) {
  file_ = safe_open((path_ + kUnfinished).c_str(), O_WRONLY | O_CREAT | O_TRUNC, kPrivateFile);
  failed_ = !file_;
}

void StampWriter::add(const struct stat &status) {
  waiting_.push_back(file_stamp(status));
  if (waiting_.size() >= kWaitingStamps) flush();
}

void StampWriter::flush() {
  const auto *at = reinterpret_cast<const char *>(waiting_.data());
  std::size_t left = waiting_.size() * sizeof(std::uint64_t);
  while (!failed_ && left > 0) {
    const ssize_t written = TEMP_FAILURE_RETRY(write(file_.get(), at, left));
    failed_ = written <= 0;
    if (failed_) break;
    at += written;
    left -= static_cast<std::size_t>(written);
  }
  waiting_.clear();
}

bool StampWriter::finish() {
  flush();
  if (failed_ || fsync(file_.get()) != 0) return false;
  const std::string unfinished = path_ + kUnfinished;
  std::string name;
  const UniqueFd parent = safe_open_parent(path_.c_str(), &name);
  return parent &&
         renameat(parent.get(), (name + kUnfinished).c_str(), parent.get(), name.c_str()) == 0 &&
         sync_directory(path_.substr(0, path_.rfind('/')));
}

bool note_unpacked_files(const char *pkgid, const char *root) {
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  StampWriter stamps(files.parts.unpacked);
  DataWalk(files, [&](const std::string &, const struct stat &status) {
    stamps.add(status);
    return true;
  }).run();
  return stamps.finish();
}

bool application_has_written(const restore_files &files, std::string *path) {
  Stamps known;
  // A snapshot of an earlier release tells nothing of it.
  if (!read_stamps(files.parts.stamps, &known)) return false;
  const bool unpacked = read_stamps(files.parts.unpacked, &known);
  std::sort(known.begin(), known.end());
  bool written = false;
  DataWalk walk(files, [&](const std::string &file, const struct stat &status) {
    if (std::binary_search(known.begin(), known.end(), file_stamp(status))) return true;
    // What the unpacking makes nobody opens until all of it is noted.
    if (!unpacked && is_being_unpacked(status)) return true;
    *path = file;
    written = true;
    return false;
  });
  walk.run();
  if (written || walk.dug().empty()) return written;
  // Neither the restore nor the rollback goes there: what it holds is the application's.
  *path = walk.dug();
  return true;
}
