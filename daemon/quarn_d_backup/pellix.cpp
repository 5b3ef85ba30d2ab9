#include "quarn_d_backup/pellix.h"

#include <fcntl.h>
#include <glib.h>
#include <json-c/json.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "backup_transport.h"
#include "files/package_files.h"
#include "files/safe_path.h"
#include "glib_handles.h"
#include "platform_package_manager.h"
#include "platform_smack.h"
#include "quarn_common.h"
#include "quarn_d_backup/app_list.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/changes.h"
#include "quarn_d_backup/package_archive.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/zip_archive.h"
#include "quarn_log.h"

namespace {

constexpr char kListName[] = "app_list.txt";
constexpr mode_t kPrivateFile = 0600;
constexpr mode_t kArchiveMode = 0777;  // the companion's own rules decide who reads it

/** Known as ours wherever working files are swept and passed over. */
std::string hidden_name() {
  const GText random(g_uuid_string_random());
  return std::string(BACKUP_TRANS_TEMPORARY_PREFIX) + random.get();
}

/** Let nobody but the companion into its folder, before anything of another's lies there. */
bool close_companion_folder() {
  const UniqueFd dir = safe_open(companion_folder().c_str(), O_RDONLY | O_DIRECTORY);
  struct stat status = {};
  if (!dir || fstat(dir.get(), &status) != 0) return false;
  // a folder that is not the companion's own may be its group's
  const bool by_group = status.st_uid != kAppUid && status.st_gid == kAppGid;
  const mode_t others = by_group ? S_IRWXO : S_IRWXG | S_IRWXO;
  return (status.st_mode & others) == 0 ||
         fchmod(dir.get(), status.st_mode & ALLPERMS & ~others) == 0;
}

/** A file in the open folder that nobody can find; with a name where there are none without. */
UniqueFd make_hidden_file(int dir, std::string *name) {
  UniqueFd file(openat(dir, ".", O_TMPFILE | O_RDWR | O_CLOEXEC, kPrivateFile));
  if (file || (errno != EOPNOTSUPP && errno != EISDIR && errno != EINVAL)) return file;
  *name = hidden_name();
  return UniqueFd(
      openat(dir, name->c_str(), O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, kPrivateFile));
}

/** Name what is open as @p file, over a file or link that may lie there; not over a folder. */
bool publish(int dir, int file, std::string *hidden, const std::string &name) {
  if (hidden->empty()) {
    *hidden = hidden_name();
    const std::string held = own_fd_path(file);
    if (linkat(AT_FDCWD, held.c_str(), dir, hidden->c_str(), AT_SYMLINK_FOLLOW) != 0) return false;
  }
  if (renameat(dir, hidden->c_str(), dir, name.c_str()) != 0) return false;
  hidden->clear();
  return true;
}

/** Give the archive to the companion. */
void hand_over_archive(int archive, const std::string &path) {
  const std::string held = fd_path(archive);
  if (smack_setlabel(held.c_str(), kPellixPackage, SMACK_LABEL_ACCESS) != 0) {
    LOGE("smack_setlabel failed for %s", path.c_str());
  }
  if (fchmod(archive, kArchiveMode) != 0) LOGE("chmod failed");
}

/** Pack the current package. @return true when the archive lies at its name */
bool pack_for_companion(backup_context *ctx, const std::string &name) {
  const std::string path = companion_folder() + name;
  const UniqueFd dir = safe_open(companion_folder().c_str(), O_RDONLY | O_DIRECTORY);
  if (file_exist(path.c_str())) delete_file(path.c_str());
  std::string hidden;
  UniqueFd archive = dir ? make_hidden_file(dir.get(), &hidden) : UniqueFd();
  if (!archive) {
    LOGE("cannot make archive %s", path.c_str());
    return false;
  }
  int error = QUARN_OK;
  fill_archive(ctx->cur_pkg_id.c_str(), ctx->cur_root_path.c_str(), &archive, &error,
               kBackupBounds);
  const bool packed = error == QUARN_OK;
  const bool published = packed && publish(dir.get(), archive.get(), &hidden, name);
  if (packed && !published) LOGE("cannot put archive %s in its place", path.c_str());
  if (!hidden.empty()) unlinkat(dir.get(), hidden.c_str(), 0);
  if (published) hand_over_archive(archive.get(), path);
  return published;
}

void make_companion_archive(backup_context *ctx) {
  if (check_current_backup_size(ctx) != QUARN_OK) return;
  const std::string name = companion_archive_name(ctx->cur_pkg_id, ctx->cur_version);
  if (!pack_for_companion(ctx, name)) return;
  json_object_array_add(ctx->app_data_path,
                        json_object_new_string((companion_folder() + name).c_str()));
}

}  // namespace

char *get_app_list_for_pellix() {
  LOGI("make_pellix_app_list");
  const BackupContextPtr ctx(new backup_context);
  ctx->for_pellix = true;
  const std::string list_path = companion_folder() + kListName;
  if (!create_app_list_info(ctx.get())) return nullptr;
  // packing would make the directory, and with it half a package that is not installed
  if (!is_directory(companion_folder().c_str())) {
    LOGE("no directory for app list file %s", list_path.c_str());
    return nullptr;
  }
  if (!close_companion_folder()) {
    LOGE("cannot close %s to others", companion_folder().c_str());
    return nullptr;
  }
  const int ret = package_manager_foreach_package_info(foreach_package_info_callback, ctx.get());
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_foreach_package_info() failed %d", ret);
    return nullptr;
  }
  const char *document = json_object_get_string(ctx->app_list_root.get());
  const std::string written = document == nullptr ? "" : document;
  const bool saved = save_app_list_to_file(ctx.get());
  note_request_end(notes_of(ctx.get()).cause);
  if (!saved) return nullptr;
  CString text;
  // another text is not this list: the folder is the companion's
  const bool read = read_data_from_file(list_path.c_str(), out(text));
  if (!read || written != text.get()) {
    LOGE("cannot read app list file...");
    text.reset();
  }
  delete_staged_file(list_path);
  return text.release();
}

bool pellix_app_info_foreach_cb(package_info_app_component_type_e, const char *, void *user_data) {
  auto *ctx = static_cast<backup_context *>(user_data);
  if (!ctx->cur_backup_enabled || ctx->zip_made) return true;
  ctx->zip_made = true;
  make_companion_archive(ctx);
  return true;
}
