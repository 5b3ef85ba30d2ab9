#include "quarn_d_restore/restore_steps.h"

#include <sys/stat.h>

#include <optional>

#include "files/held_folder.h"
#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/restore_context.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_restore/walk.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/archive_check.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_log.h"

namespace {

/**
 * What the restore works with must be where it was at its end too: else it would tell of success
 * for a package that has gone, or that the application has kept its own folder in the place of
 * the snapshot for.
 */
bool is_undisturbed(const char *pkgid, const HeldFolder &package, const HeldFolder &snapshot) {
  if (!package.is_in_place()) {
    LOGE("package (%s) was removed during its restore", pkgid);
    return false;
  }
  if (!snapshot.is_in_place()) {
    LOGE("snapshot of (%s) was moved during its restore", pkgid);
    return false;
  }
  return true;
}

/** False for an archive that the application has put in the place of the downloaded one. */
bool is_own_archive(const std::string &path) {
  struct stat status = {};
  if (safe_lstat(path.c_str(), &status) != 0) return true;  // the unpacking tells of it
  return S_ISREG(status.st_mode) && is_own_file(status) && status.st_nlink == 1;
}

/** #QUARN_OK, or a code when the archive, or only a part of it, could not be unpacked. */
int unpack(const pkg_restore_context &ctx, const std::string &archive) {
  unzip_report report;
  const int result = unzip_data(ctx.pkgid.c_str(), ctx.root.c_str(), archive.c_str(), &report);
  if (result == QUARN_OK && !report.complete()) return QUARN_UNREADABLE;
  return result;
}

/** End a restore that failed after the snapshot was made: with what became of the data. */
restore_outcome roll_back(pkg_restore_context *ctx, int result) {
  ctx->result = result;
  switch (put_snapshot_back(ctx->pkgid.c_str(), ctx->root.c_str())) {
    case rollback_result::whole:
      return restore_outcome::rolled_back;
    case rollback_result::kept:
    case rollback_result::none:
      break;
  }
  return restore_outcome::incomplete;
}

}  // namespace

restore_outcome restore_from_archive(pkg_restore_context *ctx, const HeldFolder &package,
                                     const std::string &archive, std::uint64_t size) {
  const char *pkgid = ctx->pkgid.c_str();
  const char *root = ctx->root.c_str();
  report_restore_step(ctx->pkgid, restore_stage::snapshot, size);
  if (!is_own_archive(archive)) {
    LOGE("archive of (%s) was exchanged", pkgid);
    ctx->result = QUARN_UNREADABLE;
    return restore_outcome::failed;
  }
  if (recover_package_data(pkgid, root) == recovery_result::kept) {
    // A further snapshot would take the place of what is still to be put back.
    LOGE("fail to make backup for (%s) before restore. err : %d", pkgid, QUARN_REFUSED);
    ctx->result = QUARN_REFUSED;
    return restore_outcome::incomplete;
  }
  const restore_files files(pkgid, root);
  const OwnTableAside own_table(files);
  std::optional<HeldFolder> snapshot;
  int result = own_table ? take_snapshot(pkgid, root, &snapshot) : QUARN_REFUSED;
  if (result != QUARN_OK) {
    LOGE("fail to make backup for (%s) before restore. err : %d", pkgid, result);
    ctx->result = result;
    static_cast<void>(discard_snapshot(pkgid, root));  // the data was not touched
    return restore_outcome::failed;
  }
  report_restore_step(ctx->pkgid, restore_stage::unpacking, size);
  restore_step("unpack");
  result = unpack(*ctx, archive);
  if (result != QUARN_OK) {
    LOGE("fail to restore app info for (%s) err : %d", pkgid, result);
    return roll_back(ctx, result);
  }
  restore_step("unpacked");
  report_restore_step(ctx->pkgid, restore_stage::attributes, size);
  const bool noted = note_unpacked_files(pkgid, root);
  if (!noted) LOGE("unpacked files of (%s) cannot be noted", pkgid);
  const bool restored = noted && restore_app_info(pkgid, root) != 0;
  if (restored) restore_step("restored");
  if (!restored || !is_undisturbed(pkgid, package, *snapshot) || !discard_snapshot(pkgid, root)) {
    LOGE("fail to restore for (%s)", pkgid);
    return roll_back(ctx, QUARN_REFUSED);
  }
  forget_told_snapshot(restore_files(ctx->pkgid, ctx->root));
  LOGI("restore successfully completed for (%s)", pkgid);
  return restore_outcome::restored;
}

std::uint64_t archive_size(const std::string &path) {
  struct stat status = {};
  return safe_lstat(path.c_str(), &status) == 0 ? static_cast<std::uint64_t>(status.st_size) : 0;
}
