/**
 * @file run_private.h
 * @brief What the sources of the backup engine share among themselves.
 */
#ifndef QUARN_D_BACKUP_RUN_PRIVATE_H
#define QUARN_D_BACKUP_RUN_PRIVATE_H

#include <cstdint>
#include <string>

#include "quarn_d_backup/quarn_d_backup.h"

/** A further reference, for a record that outlives its call. */
BackupContextPtr share_backup_context(backup_context *ctx);

/* ---- context.cpp ---- */

/** Name of the staged list among the staged archives; no package can have it. */
inline constexpr char kStagedListLease[] = "/app_list";

/** True when @p ctx holds the right to a package's staged archive. */
bool holds_staged_archive(backup_context *ctx, const std::string &pkg_id);
/**
 * Where a package's archive is staged: under its usual name, or beside it where the application has
 * a file of that name.
 */
std::string staged_archive_path(const std::string &root_path, const std::string &pkg_id);
/** Delete a staged file if it is there, and no other's; a run and its callbacks may both come to
 * it. */
void delete_staged_file(const std::string &path);
/** Bytes of a staged file, 0 when there is none. */
std::uint64_t staged_file_size(const std::string &path);

/* ---- pipeline.cpp ---- */

/**
 * Whether the run is to stop, for it was cancelled or Wi-Fi is gone. It is
 * abandoned then, with its result, and its transfers are ended.
 */
bool backup_must_stop(backup_context *ctx);

/* ---- progress.cpp ---- */

/** Tell the sink, if there is one. */
void report_progress(const backup_context *ctx, backup_stage stage, const char *package = "",
                     backup_outcome outcome = backup_outcome::none, std::uint64_t size = 0,
                     std::uint64_t limit = 0);

/* ---- changes.cpp ---- */

/**
 * Load the current package's rules and test its data against space and cap.
 * @return 0, 34, or 36 when the rules cannot be used
 */
int check_current_backup_size(backup_context *ctx);

/* ---- cloud.cpp ---- */

/** Forget what per-application requests uploaded; a run starts to look at the packages. */
void forget_single_uploads();

#endif
