/**
 * @file working_files.h
 * @brief Every file that the daemon makes among a package's data, in one place.
 *
 * They are never archived, unpacked, copied or counted, and one that an ended
 * process has left is removed. Those with a fixed name are known by it; the
 * transport's, with a name of its own making, by name and owner: an application
 * cannot make a file that is root's. Any thread.
 */
#ifndef QUARN_D_UTILS_WORKING_FILES_H
#define QUARN_D_UTILS_WORKING_FILES_H

#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "files/package_files.h"
#include "quarn_d_utils/handles.h"

/**
 * True for what this daemon, or an earlier one, made: an application may give a file of its own any
 * name, but cannot give it away.
 */
[[nodiscard]] inline bool is_own_file(const struct stat &status) {
  return status.st_uid == geteuid();
}

/**
 * True for what the transport makes beside a download where the file system
 * has no nameless files.
 * @param status of the file, as lstat() tells it
 */
[[nodiscard]] bool is_own_leftover(const char *name, const struct stat &status);
/** The same for whatever lies at @p path; costs nothing for another name. */
[[nodiscard]] bool is_own_leftover(const std::string &path);

/** The names of one package's files, and which of them is to be used. */
class WorkingFiles : public package_files {
 public:
  using package_files::package_files;

  /** Of both places of a download the one that is to be used; empty when the application has both.
   */
  [[nodiscard]] std::string download_place() const;
  /** The snapshot's place: beside the usual one where that is the application's own. */
  [[nodiscard]] std::string snapshot_place() const;

  /**
   * True for both archives, for every path that begins with the snapshot's,
   * and for the transport's files.
   */
  [[nodiscard]] bool contain(const std::string &path) const {
    return names(path) || is_own_leftover(path);
  }
};

/** What claim_working_file() has claimed is deleted, and is not to be remembered any more. */
void forget_working_file(const std::string &path);
/** From now on @p path is this process's own: its sweep leaves it alone. */
void claim_working_file(const std::string &path);

/** Remember what @p fd, which was made at @p path, is by now: it is complete. */
void note_working_file(const std::string &path, int fd);

/**
 * Open the daemon's own file at @p path for reading. The directory is an
 * application's, who may put anything else there: only a regular file is
 * opened that is this process's user's, with no other name, and that is the one
 * which was noted last, if one was.
 * @return none with errno, ESTALE for something else
 */
[[nodiscard]] UniqueFd open_working_file(const std::string &path);

/**
 * Remove what an ended process has left of a package: archives in transit, a
 * table, parts of downloads. What the application owns stays, whatever its
 * name. No clock is asked: what this process uses it has claimed, and a
 * transfer that lives holds a lock on its file. Takes the PackageDataLock.
 */
void sweep_working_files(const std::string &pkg_id, const std::string &root);

#endif
