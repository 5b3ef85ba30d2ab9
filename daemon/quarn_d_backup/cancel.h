/**
 * @file cancel.h
 * @brief What a cancel of manual backups meets: the runs that stood when it came.
 */
#ifndef QUARN_D_BACKUP_CANCEL_H
#define QUARN_D_BACKUP_CANCEL_H

#include <cstdint>
#include <string>

/**
 * Withdraw the manual backups of one client: those that are queued, and the
 * one that runs, with its transfers. Each is sent the final status cancelled,
 * by the worker. Any thread.
 * @param sender the client's unique bus name
 * @return how many
 */
std::uint32_t cancel_backups_of(const std::string &sender);

/** The manual backup that the worker runs was cancelled. Any thread. */
[[nodiscard]] bool running_backup_cancelled();

/**
 * The worker's run has its outcome: no later cancel meets it.
 * @return whether one has
 */
bool settle_running_backup();

#endif
