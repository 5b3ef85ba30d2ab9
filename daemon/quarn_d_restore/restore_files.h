/**
 * @file restore_files.h
 * @brief Where a package's data and the engine's working files lie.
 */
#ifndef QUARN_D_RESTORE_RESTORE_FILES_H
#define QUARN_D_RESTORE_RESTORE_FILES_H

#include <array>
#include <string>

/** The data directories and working files of one package. */
struct restore_files {
  restore_files(const std::string &pkgid, const std::string &root)
      : dirs{root + "/data", root + "/shared/data", root + "/shared/trusted"},
        upload(dirs[1] + "/" + pkgid + "_upload.zip"),
        download(dirs[1] + "/" + pkgid + "_download.zip"),
        table(dirs[1] + "/" + pkgid + ".perm"),
        snapshot(dirs[1] + "/quarn_tmp_rst_dir"),
        snapshot_table(snapshot + "/shared/data/" + pkgid + ".perm") {}

  /** True for an archive in transit. */
  bool is_archive(const std::string &path) const { return path == upload || path == download; }
  /** True for what the walks over the data directories leave alone. */
  bool is_skipped(const std::string &path) const {
    return is_archive(path) || path.compare(0, snapshot.size(), snapshot) == 0;
  }

  const std::array<std::string, 3> dirs; /**< in the order in which they are always visited */
  const std::string upload;
  const std::string download;
  const std::string table;          /**< file-info table as it comes out of an archive */
  const std::string snapshot;       /**< the data as it was before the restore */
  const std::string snapshot_table; /**< written last: a snapshot that has it is complete */
};

#endif
