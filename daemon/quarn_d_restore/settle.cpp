#include "quarn_d_restore/settle.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "files/safe_path.h"
#include "quarn_d_utils/disk_sync.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kNoteMode = 0600;

/** True for a note that only the daemon can have written. */
bool is_noted(const restore_files &files) {
  struct stat status = {};
  return safe_lstat(files.unpacking.c_str(), &status) == 0 && S_ISREG(status.st_mode) &&
         is_own_file(status);
}

void remove_note(const restore_files &files) {
  std::string name;
  const UniqueFd dir = safe_open_parent(files.unpacking.c_str(), &name);
  if (dir && unlinkat(dir.get(), name.c_str(), 0) != 0 && errno != ENOENT) {
    LOGE("fail to delete file : %s", files.unpacking.c_str());
  }
}

}  // namespace

UnpackingNote::UnpackingNote(const restore_files &files) : files_(files) {
  if (is_noted(files)) return;
  const UniqueFd note = safe_open(files.unpacking.c_str(), O_WRONLY | O_CREAT | O_EXCL, kNoteMode);
  if (!note || !sync_directory(files.dirs[1])) {
    LOGE("that data is unpacked cannot be noted : %s", files.unpacking.c_str());
  }
}

UnpackingNote::~UnpackingNote() {
  if (is_noted(files_)) remove_note(files_);
}

void settle_interrupted_unpacking(const char *pkgid, const char *root) {
  const restore_files files(pkgid, root);
  if (!is_noted(files)) return;
  LOGI("restore of (%s) was interrupted, so what it has brought is left to the application", pkgid);
  settle_unpacked_files(pkgid, root);
  remove_note(files);
}
