/**
 * @file bounds.h
 * @brief What an archive may hold: one set of bounds for those who make archives and who take them.
 *
 * Whatever is made within the bounds of a backup is taken by a restore. A restore takes a little
 * more, because earlier releases made it: they counted neither names nor the table, and a restore
 * took both as long as everything together stayed below kMaxUnpackedSize.
 */
#ifndef QUARN_D_UTILS_BOUNDS_H
#define QUARN_D_UTILS_BOUNDS_H

#include <cstdint>

#include "files/tree_depth.h"
#include "quarn_common.h"

/** What is counted while an archive is made. */
struct archive_bounds {
  std::uint64_t content; /**< bytes of the files */
  std::uint64_t members; /**< files, directories and links, each a member of the table */
  std::uint64_t names;   /**< bytes of all their names, which are paths below the root */
  std::uint64_t table;   /**< bytes of the table's text */
};

/** Those of a backup. */
inline constexpr archive_bounds kBackupBounds = {kMaxBackupSize, 99999, std::uint64_t{16} << 20,
                                                 std::uint64_t{16} << 20};
/** None, for an archive that stays on the device; the depth is bounded all the same. */
inline constexpr archive_bounds kNoBounds = {UINT64_MAX, UINT64_MAX, UINT64_MAX, UINT64_MAX};

/** The longest name of one member, bytes: the archive's format has no longer ones. */
inline constexpr std::uint64_t kMaxNameSize = 65535;

/** Most entries of an archive that is unpacked: a backup's members, and the table. */
inline constexpr std::uint64_t kMaxArchiveEntries = kBackupBounds.members + 1;
/** Most bytes that it may unpack to, and most that its names may have: with the table that earlier
 * releases made. */
inline constexpr std::uint64_t kMaxUnpackedSize = kMaxBackupSize + (std::uint64_t{32} << 20);

static_assert(kBackupBounds.content + kBackupBounds.table <= kMaxUnpackedSize &&
                  kBackupBounds.names <= kMaxUnpackedSize,
              "what is backed up can be restored");

/** Which of them a package's data goes beyond. */
enum class archive_bound { none, content, members, names, table, depth };

/** The first that was met, how far it got, and the bound itself. */
struct archive_excess {
  archive_bound bound = archive_bound::none;
  std::uint64_t size = 0;
  std::uint64_t limit = 0;
};

#endif
