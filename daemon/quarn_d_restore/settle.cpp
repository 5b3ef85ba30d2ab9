#include "quarn_d_restore/settle.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <utility>
#include <vector>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "log_scope.h"
#include "platform_smack.h"
#include "quarn_d_restore/attributes.h"
#include "quarn_d_utils/disk_sync.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_d_utils/unpacked_file.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kNoteMode = 0600;
constexpr mode_t kSettledMode = 0600;

/** Gives unpacked files that have no attributes those of any new file. */
class Settling : public TreeVisitor {
 public:
  /** @param label borrowed; null where the data directory has none */
  Settling(const restore_files &files, std::string dir, const char *label)
      : files_(files), path_(std::move(dir)), label_(label) {}

  void run(TreePlace place) {
    if (place) static_cast<void>(walk_tree(&place, &path_, this));
  }

  bool scan(const TreePlace &place, std::vector<std::string> *folders) {
    std::vector<TreeEntry> entries;
    static_cast<void>(list_tree_entries(place.fd(), &entries));  // settled is what can be read
    for (TreeEntry &entry : entries) {
      if (files_.is_skipped(path_ + "/" + entry.name)) continue;
      struct stat status = {};
      const UniqueFd object =
          open_as_package(place.fd(), entry.name.c_str(), O_PATH, 0, user_, &status);
      if (object && S_ISDIR(status.st_mode)) folders->push_back(std::move(entry.name));
      if (object && is_being_unpacked(status) && status.st_uid == user_.uid) {
        settle(object.get(), status);
      }
    }
    return true;
  }

 private:
  void settle(int object, const struct stat &status) const {
    if (change_object_mode(object, status, kSettledMode) < 0) LOGE("chmod failed");
    if (label_ == nullptr) return;
    const ActAsRoot root;
    static_cast<void>(smack_setlabel(own_fd_path(object).c_str(), label_, SMACK_LABEL_ACCESS));
  }

  const restore_files &files_;
  std::string path_;
  const char *label_;
  const package_user user_ = user_of_package();
};

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

void settle_unpacked_files(const char *pkgid, const char *root) {
  const LogScope scope(root);
  const HeldFolder package(root);
  const restore_files files(pkgid, root);
  for (const auto &dir : files.dirs) {
    TreePlace place(open_held_as_package(dir, O_RDONLY | O_DIRECTORY | O_NONBLOCK),
                    TreeAccess::kPackage);
    CString label;
    if (place &&
        smack_getlabel(own_fd_path(place.fd()).c_str(), out(label), SMACK_LABEL_ACCESS) != 0) {
      label.reset();
    }
    const ActAsPackage acting;
    Settling(files, dir, label.get()).run(std::move(place));
  }
}

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
