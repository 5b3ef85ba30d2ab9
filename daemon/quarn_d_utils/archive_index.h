/**
 * @file archive_index.h
 * @brief What an archive says that it holds, and whether that is what a backup can hold.
 */
#ifndef QUARN_D_UTILS_ARCHIVE_INDEX_H
#define QUARN_D_UTILS_ARCHIVE_INDEX_H

#include <unzip.h>

#include <cstdint>
#include <string>

#include "quarn_d_utils/archive_check.h"
#include "quarn_d_utils/archive_input.h"

/**
 * What an archive announces, entry by entry: it must be what a backup can hold. It is counted
 * before anything is written, and again with the writing, for the file may be somebody else's.
 */
class Announced {
 public:
  /** @param archive_size bytes of the file itself */
  explicit Announced(std::uint64_t archive_size) : archive_size_(archive_size) {}

  /** @return why the archive is refused, null when it is not */
  [[nodiscard]] const char *add(const unz_file_info64 &info, const char *name);

 private:
  std::uint64_t new_folders(const char *name);

  const std::uint64_t archive_size_;
  std::uint64_t entries_ = 0;
  std::uint64_t size_ = 0;
  std::uint64_t read_ = 0;
  std::uint64_t names_ = 0;
  std::uint64_t folders_ = 0;
  std::string before_;
};

/**
 * Look at everything that an archive announces, and at its table; the entries are held to it later.
 * Of several entries of the table's name the last is the table, and replaces the others, which are
 * nobody's to read: an application's own file of that name, with whatever it holds.
 * @param[in,out] found asks for a close look at the table where it is not null
 * @return why it is refused, null when it is not
 */
[[nodiscard]] const char *look_at_archive(const OpenArchive &from, const char *pkg_id,
                                          archived_table *found);

#endif
