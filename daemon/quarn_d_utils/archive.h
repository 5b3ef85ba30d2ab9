/**
 * @file archive.h
 * @brief Archives of one package's data: packing and unpacking.
 *
 * Every function logs its failures and reports them by its result only.
 */
#ifndef QUARN_D_UTILS_ARCHIVE_H
#define QUARN_D_UTILS_ARCHIVE_H

#include <atomic>

#include "quarn_d_utils/bounds.h"

/**
 * Pack one package's data. Takes its PackageDataLock. The rules of the calling
 * thread apply. Nothing is made below a root that has gone, and a package that
 * goes meanwhile fails. The first member beyond one of @p bounds ends the work.
 * @param[out] error  set on failure only: #QUARN_UNREADABLE archive not opened, #QUARN_REFUSED an
 * entry
 * @param[out] excess when not null: the bound that was met
 * @param stop        when not null: once it is true the work ends with 36; any thread sets it
 */
void make_zip_data(const char *pkg_id, const char *root, const char *zip_path, int *error,
                   const archive_bounds &bounds = kNoBounds, archive_excess *excess = nullptr,
                   const std::atomic<bool> *stop = nullptr);

/** What became of an archive's entries. */
struct unzip_report {
  unsigned int extracted = 0; /**< files; folder entries count nowhere */
  unsigned int refused = 0;   /**< hostile: nothing of them lies below the destination */
  unsigned int failed = 0;    /**< corrupt, or not to be written; a part may lie there */
  /** True when the destination holds everything that the archive had. */
  [[nodiscard]] bool complete() const { return refused == 0 && failed == 0; }
};

/**
 * Unpack an archive below @p destination: files are created new, the
 * package's own and as unpacked_file.h says, whatever lay in their place; the table is
 * root's, mode 0600. Takes no PackageDataLock. Entries that
 * are refused or fail are logged and left out; @p report tells how many.
 * Entries that name a folder make it, and cost nothing where that is refused.
 * @return #QUARN_OK, #QUARN_OUT_OF_MEMORY, or #QUARN_UNREADABLE for an archive that cannot be
 * opened, is empty, or announces more than bounds.h lets it: of such a one nothing is unpacked
 */
[[nodiscard]] int unzip_data(const char *pkg_id, const char *destination, const char *zip_path,
                             unzip_report *report);
/** The same without a report. No part of the daemon calls it. */
[[nodiscard]] int unzip_data(const char *pkg_id, const char *destination, const char *zip_path);

#endif
