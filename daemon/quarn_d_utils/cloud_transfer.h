/**
 * @file cloud_transfer.h
 * @brief Downloads that are no larger than they can be, and the end of a single transfer.
 *
 * Stands between the daemon and what of the transport a library of an earlier
 * release does not have: there a download has no limit while it runs, and its
 * reader refuses it; a single transfer cannot be ended, and ends by itself.
 */
#ifndef QUARN_D_UTILS_CLOUD_TRANSFER_H
#define QUARN_D_UTILS_CLOUD_TRANSFER_H

#include <cstdint>

#include "backup_transport.h"
#include "quarn_d_utils/bounds.h"

/**
 * Bytes of an archive's file: what it unpacks to, where nothing of that can be
 * compressed, its names, which an archive has twice, and the frame of each entry.
 */
inline constexpr std::uint64_t kMaxArchiveFileSize =
    3 * kMaxUnpackedSize + 256 * kMaxArchiveEntries;

/** A download on the session. Any thread. @return BACKUP_TRANS_ERROR_NONE: the callback will come
 */
[[nodiscard]] int download_bounded_async(const char *cloud_path, const char *local_path,
                                         void *user_data, backup_trans_download_cb callback,
                                         int options, std::uint64_t max_size);
/** The same, waiting for its result: not for the main thread. */
[[nodiscard]] int download_bounded(const char *cloud_path, const char *local_path, int options,
                                   std::uint64_t max_size);

/**
 * End the transfer that was requested with this @p user_data, and no other; its
 * callback follows with #BACKUP_TRANS_ERROR_CANCELLED. Any thread.
 * @return false when it has ended already, or the library cannot end it
 */
[[nodiscard]] bool abort_transfer(void *user_data);

#endif
