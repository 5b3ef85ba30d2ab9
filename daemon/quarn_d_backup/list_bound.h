/**
 * @file list_bound.h
 * @brief How large an application list may be, for everybody who writes or reads one.
 */
#ifndef QUARN_D_BACKUP_LIST_BOUND_H
#define QUARN_D_BACKUP_LIST_BOUND_H

#include <cstdint>

/**
 * Bytes of a list, the account's or the companion's: some forty thousand
 * packages. A longer one would not fit the daemon's memory, so none is read,
 * and none is written that could not be read again.
 */
inline constexpr std::uint64_t kMaxAppListSize = std::uint64_t{4} << 20;
/** From here on a list is said to be nearly full. */
inline constexpr std::uint64_t kNearlyFullAppListSize = kMaxAppListSize / 4 * 3;

#endif
