/**
 * @file quarn_d_progress.h
 * @brief Tells listeners on the bus what backups and restores are doing.
 *
 * Each step becomes one "progress" signal whose value is a JSON text;
 * docs/progress.md lists its members. The engines only leave the text here and
 * the main loop sends it, so a slow bus never slows a run; what is left at a
 * backup's end goes out with its last step, from the thread that reports it.
 */
#ifndef QUARN_D_PROGRESS_H
#define QUARN_D_PROGRESS_H

#include <string>

#include "quarn_d_backup/backup_progress.h"
#include "quarn_d_restore/restore_progress.h"

/** The JSON text of a step. */
[[nodiscard]] std::string backup_progress_text(const backup_progress &progress);
[[nodiscard]] std::string restore_progress_text(const restore_progress &progress);

/** The engines' sinks. Any thread. */
void note_backup_progress(const backup_progress &progress);
void note_restore_progress(const restore_progress &progress);

#endif
