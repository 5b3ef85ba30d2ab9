/**
 * @file package_archive.h
 * @brief The archive of a run's current package: whether it is made, and whether it is new.
 */
#ifndef QUARN_D_BACKUP_PACKAGE_ARCHIVE_H
#define QUARN_D_BACKUP_PACKAGE_ARCHIVE_H

#include <cstdint>

#include "quarn_d_backup/backup_progress.h"

struct backup_context;

/**
 * Archive the current package. The staged archive is the run's from here to
 * the answer of its upload; when the result is not QUARN_OK it is gone already.
 * @return QUARN_OK, QUARN_UNCHANGED, QUARN_SKIPPED, QUARN_UNREADABLE or QUARN_REFUSED
 */
[[nodiscard]] int make_app_data_zip(backup_context *ctx, const char *app_id);
/**
 * Load the current package's rules and test its data against space and cap.
 * @return QUARN_OK, QUARN_SKIPPED, or QUARN_REFUSED when the rules cannot be used
 */
[[nodiscard]] int check_current_backup_size(backup_context *ctx);
/** Bytes of the current package's data by the calling thread's rules. */
[[nodiscard]] std::uint64_t get_app_backup_size(backup_context *ctx);
/** crc of the current package and version in the last list, 0 when unknown. */
[[nodiscard]] int get_previous_crc_value(backup_context *ctx);
/** Queue the current package's archive for upload. */
void add_to_app_data_upload_list(backup_context *ctx);
/** The current package is among those that the run has examined. */
void enter_current_package(backup_context *ctx);
/** Undo what the current package's archive brought about: the package will not be listed. */
void withdraw_current_package(backup_context *ctx);
/** Tell what became of the current package. */
void report_package(backup_context *ctx, backup_outcome outcome, std::uint64_t size = 0,
                    std::uint64_t limit = 0);

#endif
