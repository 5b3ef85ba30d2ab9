#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <zip.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <memory>
#include <string>
#include <vector>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "log_scope.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/archive_entry.h"
#include "quarn_d_utils/archive_output.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/entry_writer.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_info_table.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/packing.h"
#include "quarn_d_utils/path_rules.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_d_utils/zip_archive.h"
#include "quarn_log.h"
#include "rules/rules_file.h"

thread_local Packing *packing = nullptr;

namespace {

constexpr mode_t kArchiveMode = 0600;
constexpr mode_t kFolderMode = 0755;

UniqueFd create_archive(const char *zip_path) {
  claim_working_file(zip_path);
  struct stat status {};
  // What the application has there is not made way for.
  if (safe_lstat(zip_path, &status) == 0 && is_own_file(status) && S_ISREG(status.st_mode)) {
    delete_file(zip_path);
  }
  return safe_open(zip_path, O_RDWR | O_CREAT | O_EXCL, kArchiveMode);
}

/**
 * A complete snapshot that nobody works with: its restore was cut off, and what
 * lies in the data directories is part of the old and part of the new.
 */
bool is_half_restored(const char *pkg_id, const char *root) {
  const std::string snapshot = WorkingFiles(pkg_id, root).snapshot_place();
  const std::string table = snapshot_files(pkg_id, snapshot).table;
  struct stat status = {};
  // An application can make neither of root's.
  return safe_lstat(snapshot.c_str(), &status) == 0 && S_ISDIR(status.st_mode) &&
         status.st_uid == geteuid() && file_exist(table.c_str());
}

struct ReleaseTable {
  void operator()(file_info_table_h *table) const { release_file_info_table(table); }
};

/**
 * The root of the package that is packed, as it was when that began. Nothing is made in its place
 * once it has gone: half a package, and root's, would be what its next installation finds.
 */
class PackageRoot {
 public:
  explicit PackageRoot(const char *root)
      : path_(root), dir_(safe_open(root, O_PATH | O_DIRECTORY)) {}

  /** Make the directory of a file; below the root only where that still is. */
  void create_directory_of(const char *file) const {
    const std::string path = file;
    const auto slash = path.rfind('/');
    if (path.compare(0, path_.size() + 1, path_ + "/") != 0 || slash <= path_.size()) {
      static_cast<void>(create_directory_of_file(file));  // without it nothing can be opened there
      return;
    }
    const std::string folder = path.substr(path_.size() + 1, slash - path_.size() - 1);
    if (!dir_ || is_directory(path.substr(0, slash).c_str())) return;
    const UniqueFd made = safe_mkdir_below(dir_.get(), folder.c_str(), kFolderMode);
    if (made && fchownat(made.get(), "", kAppUid, kAppGid, AT_EMPTY_PATH) != 0) {
      LOGE("fail to give %s to its application : %d", folder.c_str(), errno);
    }
  }

  /** True when it was there, and it or one of its data directories is no longer. */
  bool has_gone(const std::vector<UniqueFd> &data_dirs) const {
    struct stat opened {};
    struct stat found {};
    if (!dir_ || fstat(dir_.get(), &opened) != 0) return false;
    if (safe_lstat(path_.c_str(), &found) != 0 || found.st_dev != opened.st_dev ||
        found.st_ino != opened.st_ino) {
      return true;
    }
    return std::any_of(data_dirs.begin(), data_dirs.end(), [](const UniqueFd &dir) {
      struct stat status {};
      return fstat(dir.get(), &status) == 0 && status.st_nlink == 0;
    });
  }

 private:
  std::string path_;
  UniqueFd dir_;
};

bool may_be_packed(const char *pkg_id, const char *root) {
  if (!backup_rules_usable()) {
    LOGE("(%s) is not packed, because its rules file cannot be used: %s", pkg_id,
         rules_state_text(backup_rules_state()));
    return false;
  }
  if (is_half_restored(pkg_id, root)) {
    LOGE("restore of (%s) was interrupted, so its data is not packed", pkg_id);
    return false;
  }
  return true;
}

/** The data directories and the table; without it what went beyond a bound, or was stopped. */
void pack_all(const char *pkg_id, const char *root, zipFile zip, file_info_table_h *table,
              int *error) {
  for (const std::string &dir : package_files(pkg_id, root).data_dirs()) {
    if (packing->ended()) break;
    // What it has recorded is in the table.
    static_cast<void>(parse_app_dir_for_zip(pkg_id, root, zip, dir.c_str(), table, error));
  }
  if (packing->ended()) {
    *error = QUARN_REFUSED;
    return;
  }
  insert_file_info_table_to_zip(table, zip, pkg_id, root, error);
}

/** What an archive is to be like, and what came of it. */
struct PackRequest {
  const char *pkg_id;
  const char *root;
  const char *zip_path; /**< empty for an archive without a name */
  int *error;
  const archive_bounds &bounds;
  archive_excess *excess;
  const std::atomic<bool> *stop;
};

/** Pack into the open archive, whose library handle is @p zip. */
void pack_into(const PackRequest &request, const PackageRoot &package, file_info_table_h *table,
               ArchiveOutput *file, zipFile zip) {
  const LogScope scope(std::string("the data of ") + request.pkg_id);
  Packing current(file, request.zip_path, request.bounds, request.stop);
  packing = &current;
  pack_all(request.pkg_id, request.root, zip, table, request.error);
  if (package.has_gone(current.data_dirs)) {
    LOGE("(%s) was removed while it was packed", request.pkg_id);
    *request.error = QUARN_REFUSED;
  }
  const int closed = zipClose(zip, nullptr);
  packing = nullptr;
  release_entry_codec();
  if (closed != ZIP_OK) {
    LOGE("zipClose() failed, zip_err = [%d]", closed);
    *request.error = QUARN_REFUSED;
  }
  if (request.excess != nullptr) *request.excess = current.excess();
}

/** @param archive where it is packed into; made at its name if it is none */
void pack_package(const PackRequest &request, UniqueFd *archive) {
  const PackageDataLock lock(request.pkg_id, PackageUse::kPack);
  if (!may_be_packed(request.pkg_id, request.root)) {
    *request.error = QUARN_REFUSED;
    return;
  }
  const PackageRoot package(request.root);
  if (!*archive) package.create_directory_of(request.zip_path);
  file_info_table_h *made = nullptr;
  ready_file_info_table(&made);
  const std::unique_ptr<file_info_table_h, ReleaseTable> table(made);
  if (table == nullptr) {
    LOGE("file_info_table is NULL");
    *request.error = QUARN_REFUSED;
    return;
  }
  if (!*archive) *archive = create_archive(request.zip_path);
  ArchiveOutput file(archive->get());
  zlib_filefunc64_def functions = file.functions();
  zipFile zip = file.is_open()
                    ? zipOpen2_64(request.zip_path, APPEND_STATUS_CREATE, nullptr, &functions)
                    : nullptr;
  if (zip == nullptr) {
    LOGE("zipOpen() failed, zf is NULL");
    *request.error = QUARN_UNREADABLE;
    return;
  }
  pack_into(request, package, table.get(), &file, zip);
}

}  // namespace

UniqueFd make_archive(const char *pkg_id, const char *root, const char *zip_path, int *error,
                      const archive_bounds &bounds, archive_excess *excess,
                      const std::atomic<bool> *stop) {
  UniqueFd archive;
  pack_package({pkg_id, root, zip_path, error, bounds, excess, stop}, &archive);
  return archive;
}

void fill_archive(const char *pkg_id, const char *root, UniqueFd *archive, int *error,
                  const archive_bounds &bounds, archive_excess *excess) {
  pack_package({pkg_id, root, "", error, bounds, excess, nullptr}, archive);
}

void make_zip_data(const char *pkg_id, const char *root, const char *zip_path, int *error,
                   const archive_bounds &bounds, archive_excess *excess,
                   const std::atomic<bool> *stop) {
  // Its caller goes by the name and by *error.
  static_cast<void>(make_archive(pkg_id, root, zip_path, error, bounds, excess, stop));
}
