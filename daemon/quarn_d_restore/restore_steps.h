/**
 * @file restore_steps.h
 * @brief What is done with an archive that has come from the cloud. Main thread only.
 */
#ifndef QUARN_D_RESTORE_RESTORE_STEPS_H
#define QUARN_D_RESTORE_RESTORE_STEPS_H

#include <cstdint>
#include <string>

#include "quarn_d_restore/restore_progress.h"

class HeldFolder;
struct pkg_restore_context;

/**
 * Replace the package's data by the archive's, or leave it as it is. The caller holds the
 * PackageDataLock.
 * @param package its root, held open by the caller
 * @param size the archive's, bytes, for those who follow the progress
 * @return what became of the data; the context has the result code
 */
[[nodiscard]] restore_outcome restore_from_archive(pkg_restore_context *ctx,
                                                   const HeldFolder &package,
                                                   const std::string &archive, std::uint64_t size);
/** Bytes of an archive on the device; 0 while there is none. */
[[nodiscard]] std::uint64_t archive_size(const std::string &path);

#endif
