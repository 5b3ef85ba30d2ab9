#include "quarn_d_restore/hidden_icon.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <set>
#include <string>

#include "files/safe_path.h"
#include "platform_package_client.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_utils/disk_sync.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_log.h"
#include "thread_annotations.h"

namespace {

constexpr mode_t kNoteMode = 0600;
/** Of every type, as icons are hidden. */
constexpr const char *kAnyPackageType = nullptr;

Mutex hidden_mutex;
/** Packages whose icon this process hides, and will show itself. */
std::set<std::string> &hidden_here() QUARN_REQUIRES(hidden_mutex) {
  static auto *packages = new std::set<std::string>;
  return *packages;
}

void remove_note(const restore_files &files) {
  std::string name;
  const UniqueFd dir = safe_open_parent(files.hidden_icon.c_str(), &name);
  if (dir && unlinkat(dir.get(), name.c_str(), 0) != 0 && errno != ENOENT) {
    LOGE("fail to delete file : %s", files.hidden_icon.c_str());
  }
}

/** True for a note that only the daemon can have written. */
bool is_noted(const restore_files &files) {
  struct stat status = {};
  return safe_lstat(files.hidden_icon.c_str(), &status) == 0 && S_ISREG(status.st_mode) &&
         status.st_uid == geteuid();
}

}  // namespace

bool note_hidden_icon(const char *pkgid, const char *root) {
  const restore_files files(pkgid, root);
  const MutexLock lock(hidden_mutex);
  hidden_here().insert(pkgid);
  if (is_noted(files)) return true;
  const UniqueFd note =
      safe_open(files.hidden_icon.c_str(), O_WRONLY | O_CREAT | O_EXCL, kNoteMode);
  return note && sync_directory(files.dirs[1]);
}

void forget_hidden_icon(const char *pkgid, const char *root) {
  const MutexLock lock(hidden_mutex);
  hidden_here().erase(pkgid);
  const restore_files files(pkgid, root);
  if (is_noted(files)) remove_note(files);
}

void show_hidden_icon(const char *pkgid, const char *root) {
  const restore_files files(pkgid, root);
  const MutexLock lock(hidden_mutex);
  if (hidden_here().count(pkgid) != 0 || !is_noted(files)) return;
  const PkgClientPtr client(pkgmgr_client_new(PC_REQUEST));
  const int result = client == nullptr
                         ? static_cast<int>(PKGMGR_R_ERROR)
                         : pkgmgr_client_activate(client.get(), kAnyPackageType, pkgid);
  if (result != PKGMGR_R_OK) {
    LOGE("fail to appear icon of (%s)... err:%d", pkgid, result);
    return;
  }
  LOGI("success to appear icon of (%s)!", pkgid);
  remove_note(files);
}
