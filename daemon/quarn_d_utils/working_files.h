/**
 * @file working_files.h
 * @brief The daemon's own files among a package's data: never archived, never unpacked.
 */
#ifndef QUARN_D_UTILS_WORKING_FILES_H
#define QUARN_D_UTILS_WORKING_FILES_H

#include <string>

/** Their paths for one package below one root. */
class WorkingFiles {
 public:
  WorkingFiles(const std::string &pkg_id, const std::string &root)
      : upload_(root + "/shared/data/" + pkg_id + "_upload.zip"),
        download_(root + "/shared/data/" + pkg_id + "_download.zip"),
        snapshot_(root + "/shared/data/quarn_tmp_rst_dir") {}

  /** True for both archives, and for every path that begins with the snapshot's. */
  bool contain(const std::string &path) const {
    return path.compare(0, snapshot_.size(), snapshot_) == 0 || path == upload_ ||
           path == download_;
  }

 private:
  std::string upload_;
  std::string download_;
  std::string snapshot_;
};

#endif
