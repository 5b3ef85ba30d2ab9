#include "quarn_d_restore/companion_restore.h"

#include <cstdint>
#include <string>

#include "files/held_folder.h"
#include "files/package_files.h"
#include "quarn_common.h"
#include "quarn_d_restore/app_restore.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/restore_context.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_restore/restore_progress.h"
#include "quarn_d_restore/restore_steps.h"
#include "quarn_d_restore/settle.h"
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_restore/walk.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/archive_check.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_log.h"

namespace {

std::string companion_archive(const pkg_restore_context &ctx) {
  return companion_folder() + companion_archive_name(ctx.pkgid, ctx.version);
}

/** What a restore from the companion came to. */
struct companion_restore {
  int unpacked = QUARN_OK; /**< what the unpacking gave: #QUARN_OK also when entries are missing */
  bool begun = false;      /**< something may have been unpacked */
  bool whole = false;      /**< every entry was unpacked */
  bool attributes = false; /**< everything that was unpacked has its attributes */
  std::uint64_t size = 0;
};

/** Nothing could undo an unpacking whose files then have no attributes: it is not begun. */
void tell_of_no_table(const char *pkgid, archived_table table) {
  if (table == archived_table::none) {
    LOGE("there isn't file-info file...");
  } else {
    LOGE("cannot read json info...");
  }
  LOGE("app data restore failed, so will be cleared");
  LOGE("fail to restore for (%s)", pkgid);
}

/** There is nothing to roll back to: what could be unpacked is the application's. */
void give_to_application(const pkg_restore_context &ctx, companion_restore *done) {
  const char *pkgid = ctx.pkgid.c_str();
  report_restore_step(ctx.pkgid, restore_stage::attributes, done->size);
  done->attributes = restore_app_info(pkgid, ctx.root.c_str()) != 0;
  if (!done->attributes) settle_unpacked_files(pkgid, ctx.root.c_str());
  if (done->attributes) {
    LOGI("restore completed for (%s)", pkgid);
  } else {
    LOGE("fail to restore for (%s)", pkgid);
  }
}

companion_restore unpack_from_companion(const pkg_restore_context &ctx) {
  const char *pkgid = ctx.pkgid.c_str();
  companion_restore done;
  if (!is_safe_path_component(ctx.pkgid) || !is_safe_path_component(ctx.version)) {
    LOGE("refused : not an archive name (%s, %s)", pkgid, ctx.version.c_str());
    done.unpacked = QUARN_REFUSED;
    return done;
  }
  const std::string archive = companion_archive(ctx);
  const PackageDataLock lock(ctx.pkgid, PackageUse::kChange);
  const HeldFolder package(ctx.root);
  if (recover_package_data(pkgid, ctx.root.c_str()) == recovery_result::kept) {
    // What is still to be put back would go over what is unpacked now.
    LOGE("fail to restore for (%s)", pkgid);
    done.unpacked = QUARN_REFUSED;
    return done;
  }
  const restore_files files(ctx.pkgid, ctx.root);
  const OwnTableAside own_table(files);
  if (!own_table) {
    LOGE("fail to restore for (%s)", pkgid);
    done.unpacked = QUARN_REFUSED;
    return done;
  }
  done.size = archive_size(archive);
  report_restore_step(ctx.pkgid, restore_stage::unpacking, done.size);
  const UnpackingNote note(files);
  unzip_report report;
  archived_table table = archived_table::none;
  done.unpacked = unzip_data_with_table(pkgid, ctx.root.c_str(), archive.c_str(), &report, &table);
  if (done.unpacked == QUARN_NO_FILE_INFO) {
    tell_of_no_table(pkgid, table);
    done.unpacked = QUARN_OK;
    return done;
  }
  done.begun = done.unpacked == QUARN_OK || report.extracted > 0;
  if (done.unpacked != QUARN_OK) {
    settle_unpacked_files(pkgid, ctx.root.c_str());
    return done;
  }
  done.whole = report.complete();
  if (!done.whole) {
    LOGE("%u entries of (%s) were not restored", report.refused + report.failed, pkgid);
  }
  give_to_application(ctx, &done);
  return done;
}

}  // namespace

/**
 * The companion's archive is at hand, so everything happens at once. The
 * pending count goes to -1: such a restore is not waited for, and its icon is
 * not the engine's to show.
 */
int restore_from_companion(pkg_restore_context *ctx) {
  const companion_restore done = unpack_from_companion(*ctx);
  if (done.unpacked != QUARN_OK) ctx->result = done.unpacked;
  LOGI("restore_app_data for %s complete", ctx->pkgid.c_str());
  int reported = done.unpacked;
  if (reported == QUARN_OK && done.begun && !done.whole) reported = QUARN_UNREADABLE;
  if (reported == QUARN_OK && !done.attributes) reported = QUARN_REFUSED;
  report_restore_end(ctx->pkgid,
                     reported == QUARN_OK ? restore_outcome::restored
                     : done.begun         ? restore_outcome::incomplete
                                          : restore_outcome::failed,
                     reported, done.begun ? done.size : 0);
  check_package_restore_complete(ctx);
  return done.unpacked;
}
