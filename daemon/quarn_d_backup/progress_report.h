/**
 * @file progress_report.h
 * @brief How the engine tells the sink of its steps, if there is one. Any thread.
 */
#ifndef QUARN_D_BACKUP_PROGRESS_REPORT_H
#define QUARN_D_BACKUP_PROGRESS_REPORT_H

#include <cstdint>

#include "quarn_d_backup/backup_progress.h"

struct backup_context;

/** Tell of a step; size and limit are those of backup_progress. */
void report_progress(const backup_context *ctx, backup_stage stage, const char *package = "",
                     backup_outcome outcome = backup_outcome::none, std::uint64_t size = 0,
                     std::uint64_t limit = 0);
/** Tell of something about the list that is to be seen to. */
void report_notice(const backup_context *ctx, const char *notice, std::uint64_t size,
                   std::uint64_t limit);

#endif
