#include "quarn_d_backup/owed_archive.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <map>
#include <utility>

#include "files/safe_path.h"
#include "quarn_d_backup/kept_packages.h"
#include "quarn_d_utils/disk_sync.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"
#include "thread_annotations.h"

namespace {

constexpr mode_t kNoteMode = 0600;
constexpr char kWhole = 'w';
constexpr char kVersions = 'v';
constexpr std::size_t kLongestNote = 256;

/** So many may come to be owed before a look is taken at which of their packages are there. */
constexpr std::size_t kOwedBetweenLooks = 256;

Mutex owed_mutex;
/** How many the last look left. */
std::size_t owed_when_looked QUARN_GUARDED_BY(owed_mutex) = 0;
/** By serial and package. */
std::map<std::pair<std::string, std::string>, archive_claim> &owed() QUARN_REQUIRES(owed_mutex) {
  static auto *all = new std::map<std::pair<std::string, std::string>, archive_claim>;
  return *all;
}

/** The note at @p path, where only the daemon can have written it. */
UniqueFd open_note(const std::string &path, int flags, mode_t mode = 0) {
  UniqueFd note = safe_open(path.c_str(), flags | O_NONBLOCK, mode);
  struct stat status = {};
  if (note && (fstat(note.get(), &status) != 0 || !S_ISREG(status.st_mode) ||
               !is_own_file(status) || status.st_nlink != 1)) {
    note.reset();
  }
  return note;
}

/** A note that is empty was cut short; what it stands for is owed all the same. */
archive_claim read_note(const std::string &path, const std::string &serial) {
  const UniqueFd note = open_note(path, O_RDONLY);
  if (!note) return archive_claim::none;
  char text[kLongestNote];
  const ssize_t length = read(note.get(), text, sizeof text);
  if (length <= 0) return archive_claim::whole;
  if (std::string(text + 1, static_cast<std::size_t>(length) - 1) != serial) {
    return archive_claim::none;
  }
  return text[0] == kVersions ? archive_claim::versions : archive_claim::whole;
}

bool write_note(const WorkingFiles &files, const std::string &serial, archive_claim claim) {
  const UniqueFd note = open_note(files.owed(), O_WRONLY | O_CREAT, kNoteMode);
  const std::string text = (claim == archive_claim::versions ? kVersions : kWhole) + serial;
  return note && ftruncate(note.get(), 0) == 0 &&
         write(note.get(), text.data(), text.size()) == static_cast<ssize_t>(text.size()) &&
         fsync(note.get()) == 0 && sync_directory(files.folder());
}

void owe(const std::string &serial, const std::string &package, const std::string &root,
         archive_claim claim) QUARN_REQUIRES(owed_mutex) {
  owed()[{serial, package}] = claim;
  if (root.empty()) return;
  const WorkingFiles files(package, root);
  if (read_note(files.owed(), serial) == claim) return;
  if (!write_note(files, serial, claim)) {
    LOGE("that the archive of (%s) is owed cannot be noted", package.c_str());
  }
}

}  // namespace

void note_owed_archive(const std::string &serial, const std::string &package,
                       const std::string &root) {
  bool many = false;
  {
    const MutexLock lock(owed_mutex);
    many = owed().size() >= owed_when_looked + kOwedBetweenLooks;
  }
  // before, for a package that is being installed may not be known yet
  if (many) forget_owed_of_removed_packages();
  const MutexLock lock(owed_mutex);
  owe(serial, package, root, archive_claim::whole);
}

void owe_other_versions(const std::string &serial, const std::string &package,
                        const std::string &root) {
  const MutexLock lock(owed_mutex);
  if (owed().count({serial, package}) != 0) owe(serial, package, root, archive_claim::versions);
}

void forget_owed_archive(const std::string &serial, const std::string &package,
                         const std::string &root) {
  const MutexLock lock(owed_mutex);
  owed().erase({serial, package});
  const WorkingFiles files(package, root);
  if (read_note(files.owed(), serial) == archive_claim::none) return;
  std::string name;
  const UniqueFd dir = safe_open_parent(files.owed().c_str(), &name);
  if (dir && unlinkat(dir.get(), name.c_str(), 0) != 0 && errno != ENOENT) {
    LOGE("fail to delete file : %s", files.owed().c_str());
  }
}

archive_claim look_for_owed_archive(const std::string &serial, const std::string &package,
                                    const std::string &root) {
  const MutexLock lock(owed_mutex);
  const auto known = owed().find({serial, package});
  if (known != owed().end()) return known->second;
  const archive_claim claim = read_note(WorkingFiles(package, root).owed(), serial);
  if (claim != archive_claim::none) owed()[{serial, package}] = claim;
  return claim;
}

archive_claim owed_claim(const std::string &serial, const std::string &package) {
  const MutexLock lock(owed_mutex);
  const auto known = owed().find({serial, package});
  return known == owed().end() ? archive_claim::none : known->second;
}

std::vector<std::string> owed_packages(const std::string &serial) {
  const MutexLock lock(owed_mutex);
  std::vector<std::string> packages;
  for (const auto &one : owed()) {
    if (one.first.first == serial) packages.push_back(one.first.second);
  }
  return packages;
}

void forget_owed_of_removed_packages() {
  std::vector<std::pair<std::string, std::string>> known;
  {
    const MutexLock lock(owed_mutex);
    for (const auto &one : owed()) known.push_back(one.first);
  }
  for (const auto &one : known) {
    if (may_be_installed(one.second)) continue;
    const MutexLock lock(owed_mutex);
    owed().erase(one);
  }
  const MutexLock lock(owed_mutex);
  owed_when_looked = owed().size();
}
