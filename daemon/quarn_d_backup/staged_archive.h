/**
 * @file staged_archive.h
 * @brief The archives and lists that wait for their upload, and who may touch them.
 */
#ifndef QUARN_D_BACKUP_STAGED_ARCHIVE_H
#define QUARN_D_BACKUP_STAGED_ARCHIVE_H

#include <cstdint>
#include <string>

struct backup_context;

/** Name of the staged list among the staged archives; no package can have it. */
inline constexpr char kStagedListLease[] = "/app_list";

/**
 * The right to write, upload and delete a package's staged archive. One run
 * holds it at a time, from the archive's making to the answer of its upload;
 * a run that has it already is given it again. Waiting for it: other threads
 * block, the main thread runs a nested loop.
 * @return false when the wait was ended: by the end of the process, the
 *         withdrawal of the request, or for a run by its cancel or the loss of
 *         Wi-Fi, which has abandoned it then
 */
[[nodiscard]] bool acquire_staged_archive(backup_context *ctx, const std::string &pkg_id);
/** The packing of a package has ended: who waits for that looks again. Any thread. */
void note_packing_ended();
/** Give it back; nothing happens when @p ctx does not hold it. Any thread. */
void release_staged_archive(backup_context *ctx, const std::string &pkg_id);
/** True when @p ctx holds the right to a package's staged archive. */
[[nodiscard]] bool holds_staged_archive(backup_context *ctx, const std::string &pkg_id);
/** A run ends: whatever it holds is given back. Any thread. */
void release_all_staged_archives(backup_context *ctx);

/**
 * Where a package's archive is staged: under its usual name, or beside it where the application has
 * a file of that name.
 */
[[nodiscard]] std::string staged_archive_path(const std::string &root_path,
                                              const std::string &pkg_id);
/** Delete a staged file if it is there, and no other's; a run and its callbacks may both come to
 * it. */
void delete_staged_file(const std::string &path);
/** Bytes of a staged file, 0 when there is none. */
[[nodiscard]] std::uint64_t staged_file_size(const std::string &path);

#endif
