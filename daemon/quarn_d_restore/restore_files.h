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
        dirs{root + "/data", root + "/shared/data", root + "/shared/trusted"},
        upload(dirs[1] + "/" + pkgid + "_upload.zip"),
        download(dirs[1] + "/" + pkgid + "_download.zip"),
        table(dirs[1] + "/" + pkgid + ".perm"),
        snapshot(own.snapshot_place()),
        snapshot_table(snapshot + "/shared/data/" + pkgid + ".perm"),
        unfinished_table(snapshot + "/table"),
        stamps(snapshot + "/stamps"),
        unpacked(snapshot + "/unpacked"),
        told(snapshot + "/told"),
        aside(own.snapshot() + ".kept"),
        table_aside(own.snapshot() + ".table"),
        hidden_icon(own.snapshot() + ".icon"),
        unpacking(own.snapshot() + ".unpacking") {}

  /** True for an archive in transit. */
  bool is_archive(const std::string &path) const { return path == upload || path == download; }
  /** True for what the walks over the data directories leave alone. */
  bool is_skipped(const std::string &path) const {
    const std::string &ours = own.snapshot();
    return is_archive(path) || path.compare(0, ours.size(), ours) == 0 || is_own_leftover(path);
  }

  const WorkingFiles own;
  const std::array<std::string, 3> dirs; /**< in the order in which they are always visited */
  const std::string upload;
  const std::string download;
  const std::string table;            /**< file-info table as it comes out of an archive */
  const std::string snapshot;         /**< the data as it was before the restore */
  const std::string snapshot_table;   /**< written last: a snapshot that has it is complete */
  const std::string unfinished_table; /**< the same before it is whole */
  const std::string stamps;           /**< which files there were, and which copies of them */
  const std::string unpacked;         /**< which files the restore has unpacked */
  const std::string told;        /**< the table of a snapshot that counts no more, but is kept */
  const std::string aside;       /**< such a snapshot while a further restore runs, and after it */
  const std::string table_aside; /**< holds the application's own file of the table's name */
  const std::string hidden_icon; /**< lies there while the package's icon is hidden */
  const std::string unpacking;   /**< lies there while what nothing would undo is unpacked */
};

#endif
