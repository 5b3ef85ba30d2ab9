/**
 * @file single_folders.h
 * @brief The cloud's folders that per-application requests have filled beside a run.
 *
 * A run's list does not know of them, so its clean-up asks here before it deletes. Any thread.
 */
#ifndef QUARN_D_BACKUP_SINGLE_FOLDERS_H
#define QUARN_D_BACKUP_SINGLE_FOLDERS_H

#include <cstddef>
#include <string>

/** As many are told apart; with more, every folder counts as one of them until the next run. */
inline constexpr std::size_t kMostSingleFolders = 4096;

/** A request uploads this version of a package. */
void note_single_upload(const std::string &serial, const std::string &pkg_id,
                        const std::string &version);
/** Whether a request has filled @p folder since the run looked at the packages. */
[[nodiscard]] bool uploaded_by_single_request(const std::string &folder);
/** Forget what per-application requests uploaded; a run starts to look at the packages. */
void forget_single_uploads();

#endif
