/**
 * @file archive_download.h
 * @brief The download of a package's archive, and its repeats. Main thread only.
 */
#ifndef QUARN_D_RESTORE_ARCHIVE_DOWNLOAD_H
#define QUARN_D_RESTORE_ARCHIVE_DOWNLOAD_H

#include <memory>
#include <string>

#include "backup_transport.h"

struct pkg_restore_context;
struct archive_download;
using ArchiveDownloadPtr = std::unique_ptr<archive_download>;

/** One download, from its request to its answer. */
struct archive_download {
  std::string local_path;
  std::string cloud_path;
  pkg_restore_context *ctx = nullptr; /**< lent; outlives the download */
  /** Told of the answer that counts, from the main loop. */
  void (*done)(ArchiveDownloadPtr download, backup_trans_error_code error) = nullptr;
  int times_aborted = 0;
  bool withdrawn = false; /**< nobody waits for it any more */
};

/**
 * Hand it to the transport.
 * @return false when that was refused: the context has the result, and nothing will follow
 */
[[nodiscard]] bool begin_archive_download(ArchiveDownloadPtr download);
/** Remove a downloaded archive, or what was put in its place for one. */
void remove_download(const std::string &path);

/** End the download of one restore, if the transport has it. */
void abort_download_of(const pkg_restore_context *ctx);
/** End the downloads of installed packages: restore mode was withdrawn. */
void abort_monitored_downloads();

#endif
