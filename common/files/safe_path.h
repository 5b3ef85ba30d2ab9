/**
 * @file safe_path.h
 * @brief Reaching files below an application's root without following its links.
 *
 * A symbolic link in a path is followed only when root owns both the link and
 * the directory it lies in, and nobody else may write that directory: such a
 * link is the device maker's, any other could be an application's. A path at or
 * below a folder that the thread holds is reached from that folder, see
 * held_folder.h. All functions set errno on failure and log nothing. Any thread.
 */
#ifndef QUARN_SAFE_PATH_H
#define QUARN_SAFE_PATH_H

#include <sys/stat.h>
#include <sys/types.h>

#include <string>

#include "quarn_handles.h"

/**
 * Open an absolute path. The last component is never followed when it is a
 * link (ELOOP, or with O_PATH the link itself). O_CLOEXEC is added.
 */
[[nodiscard]] UniqueFd safe_open(const char *path, int flags, mode_t mode = 0);

/** The parent of @p path, as an O_PATH directory; @p name receives the last component. */
[[nodiscard]] UniqueFd safe_open_parent(const char *path, std::string *name);

/** lstat() of @p path. @return 0 or -1 */
[[nodiscard]] int safe_lstat(const char *path, struct stat *status);

/** Open a directory for reading; null on failure. */
[[nodiscard]] DirPtr safe_opendir(const char *path);

/**
 * Open the directory @p name in the directory @p dir; null when it is a link.
 * Walks go deeper with it as far as tree_depth.h has it: every level holds a
 * descriptor.
 */
[[nodiscard]] DirPtr safe_opendir_at(int dir, const char *name);

/**
 * Open the regular file @p name of the directory @p dir for reading, and tell its status; none
 * when it cannot be opened or is anything else, a link included. Its time of access stays where
 * the process may let it.
 */
[[nodiscard]] UniqueFd safe_open_file_at(int dir, const char *name, struct stat *status);

/** True for "." and "..". */
[[nodiscard]] bool is_dot_entry(const char *name);

/** A path during a walk: goes down by one name, and back when it goes out of scope. */
class PathStep {
 public:
  PathStep(std::string *path, const char *name) : path_(path), length_(path->size()) {
    path_->push_back('/');
    path_->append(name);
  }
  ~PathStep() { path_->resize(length_); }
  PathStep(const PathStep &) = delete;
  PathStep &operator=(const PathStep &) = delete;

 private:
  std::string *path_;
  std::size_t length_;
};

/** Make @p path and its missing ancestors. @return 0 or -1 */
[[nodiscard]] int safe_mkdir_with_parents(const char *path, mode_t mode);

/**
 * Open a relative path below the directory @p dir: no link is followed and
 * nothing outside is reached; ".." and absolute names fail with EINVAL.
 */
[[nodiscard]] UniqueFd safe_open_below(int dir, const char *path, int flags, mode_t mode = 0);

/** Make a relative path below @p dir, ancestors too; the directory itself (O_PATH). */
[[nodiscard]] UniqueFd safe_mkdir_below(int dir, const char *path, mode_t mode);

/** The name by which this process's services reach what @p fd holds: "/proc/PID/fd/N". */
[[nodiscard]] std::string fd_path(int fd);
/** The same for this process alone: "/proc/self/fd/N". */
[[nodiscard]] std::string own_fd_path(int fd);
/**
 * The same for a descriptor of the O_PATH kind: "/proc/thread-self/fd/N", for the calling thread.
 * Services of this process that spare themselves the walk to a descriptor whose name they know
 * would ask one of that kind in vain.
 */
[[nodiscard]] std::string own_place_path(int fd);

#endif
