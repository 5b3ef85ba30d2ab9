/**
 * @file restore_files.h
 * @brief Where a package's data and the engine's working files lie.
 */
#ifndef QUARN_D_RESTORE_RESTORE_FILES_H
#define QUARN_D_RESTORE_RESTORE_FILES_H

#include <array>
#include <string>

#include "quarn_d_utils/working_files.h"

/** The data directories and working files of one package. */
struct restore_files {
  restore_files(const std::string &pkgid, const std::string &root)
      : own(pkgid, root),
        dirs(own.data_dirs()),
        table(own.table()),
        snapshot(own.snapshot_place()),
        parts(pkgid, snapshot),
        aside(own.snapshot_aside()),
        table_aside(own.table_aside()),
        hidden_icon(own.hidden_icon()),
        unpacking(own.unpacking()) {}

  /** True for what the walks over the data directories leave alone. */
  [[nodiscard]] bool is_skipped(const std::string &path) const { return own.contain(path); }

  const WorkingFiles own;
  const std::array<std::string, kDataDirs.size()> dirs;
  const std::string table;    /**< file-info table as it comes out of an archive */
  const std::string snapshot; /**< the data as it was before the restore */
  const snapshot_files parts; /**< what lies in it */
  const std::string aside;    /**< one that counts no more while a further restore runs */
  const std::string table_aside;
  const std::string hidden_icon;
  const std::string unpacking;
};

#endif
