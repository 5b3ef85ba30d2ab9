/**
 * @file package_identity.h
 * @brief Reaching what lies below a package's folders as the package's own user.
 *
 * An application may have put there what it could not open itself: a hard link
 * to a file of root's. So the kernel is asked with the application's rights,
 * and what they do not suffice for is looked at on the descriptor that is then
 * used, never by its name again.
 *
 * The identity is the file-system identity of the calling thread alone. For as
 * long as it is another's, the kernel drops the capabilities that override
 * owners, modes and labels of files (CHOWN, DAC_OVERRIDE, DAC_READ_SEARCH,
 * FOWNER, FSETID, LINUX_IMMUTABLE, MAC_OVERRIDE, MKNOD). The others stay: labels
 * can be set, which is MAC_ADMIN's or SYS_ADMIN's, nameless files be linked, and
 * blocks that are kept for root be used. The process's own user stays root, so
 * signals, sockets and /proc take it for root. Where it is not root to begin
 * with, everything is done with the rights that it has.
 *
 * A name is one entry of a directory and no link is followed; descriptors are
 * O_CLOEXEC. Functions set errno and log nothing. Any thread.
 */
#ifndef QUARN_D_UTILS_PACKAGE_IDENTITY_H
#define QUARN_D_UTILS_PACKAGE_IDENTITY_H

#include <sys/stat.h>
#include <sys/types.h>

#include <string>

#include "quarn_d_utils/handles.h"

/** Who a package's files belong to. */
struct package_user {
  uid_t uid;
  gid_t gid;
};

/** The user whose applications' data the daemon works on. */
[[nodiscard]] package_user user_of_package();

/**
 * Give up the groups that the process was started with: they would count beside
 * the group of a package's user. Once, at the start. @return false when it failed
 */
[[nodiscard]] bool drop_other_groups();

/** The thread's file-system identity while one of the two classes below lives. */
class FileIdentity {
 public:
  FileIdentity(const FileIdentity &) = delete;
  FileIdentity &operator=(const FileIdentity &) = delete;
  /** False when the kernel did not grant it: nothing may be touched then. */
  explicit operator bool() const { return granted_; }

 protected:
  explicit FileIdentity(package_user user);
  ~FileIdentity();

 private:
  package_user before_;
  bool granted_;
};

/**
 * The calling thread is the package's user in everything that it does with
 * files. Nests, and costs nothing where it is that user already; else a few short
 * system calls to begin and to end, so it belongs around the work on a whole folder
 * rather than around one call. The functions below are cheapest inside it.
 *
 * It must not live across a fiber's wait, a step to another thread or the start
 * of one (a new thread begins with its creator's identity), nor across work on
 * files that are root's: for these an ActAsRoot stands inside it.
 */
class ActAsPackage : public FileIdentity {
 public:
  explicit ActAsPackage(package_user user = user_of_package()) : FileIdentity(user) {}
};

/** The daemon's own identity again, for its own files. */
class ActAsRoot : public FileIdentity {
 public:
  ActAsRoot() : FileIdentity({0, 0}) {}
};

/**
 * True when root may make, replace and remove names in a directory although the
 * package's user may not: it is the user's own; or one that the application
 * cannot fill, and none of those above it, up to one of the application's own,
 * is such that the application may have moved it there with all that it holds.
 */
[[nodiscard]] bool names_may_be_changed(int dir, const package_user &user);

/**
 * Open @p name of the directory @p dir as the package's user. A new file
 * (O_CREAT, which takes O_EXCL along) is that user's from the beginning.
 *
 * On EACCES alone root tries again. A new file is made, still as that user's,
 * where the directory is its own, or one that it may not write. Of what is
 * there already a regular file or a directory is opened that the user owns; a
 * file of somebody else's when it has this one name only and lies in a directory
 * that the application can neither fill nor have moved there with one above it;
 * a directory of somebody else's in such a one, or in one of the application's
 * own when the application cannot have moved it there. The object that was looked at is the one
 * that is opened.
 *
 * O_PATH answers what lies there, whoever's it is: such a descriptor says
 * nothing about whether the application could have opened it.
 *
 * @param status when not null: that of the descriptor which is returned
 * @return none with errno, EACCES for what is refused
 */
[[nodiscard]] UniqueFd open_as_package(int dir, const char *name, int flags, mode_t mode,
                                       const package_user &user, struct stat *status);

/**
 * The same for a relative path below @p dir, whose folders are entered in the
 * same way. EINVAL for an absolute path and for "..".
 */
[[nodiscard]] UniqueFd open_below_as_package(int dir, const char *path, int flags, mode_t mode,
                                             const package_user &user, struct stat *status);

/** lstat() of an entry, also in a folder that its user has closed to itself. @return 0 or -1 */
[[nodiscard]] int status_as_package(int dir, const char *name, const package_user &user,
                                    struct stat *status);

/**
 * True when root may change owner, mode or label of an open object (O_PATH is
 * enough) that lies in the directory @p dir: the user's own, or one of somebody
 * else's that open_as_package() would open.
 * @param status of @p object
 */
[[nodiscard]] bool may_be_changed(int dir, int object, const struct stat &status,
                                  const package_user &user);

/**
 * mkdirat() and unlinkat() as the package's user. On EACCES alone
 * they are done all the same, new folders still being that user's, where
 * names_may_be_changed() allows it.
 * @return 0, or -1 with errno
 */
[[nodiscard]] int mkdir_as_package(int dir, const char *name, mode_t mode,
                                   const package_user &user);
[[nodiscard]] int unlink_as_package(int dir, const char *name, int flags, const package_user &user);

/**
 * Open what lies at an absolute path below a held folder as the package's user,
 * as open_below_as_package() does; outside of one as the daemon.
 */
[[nodiscard]] UniqueFd open_held_as_package(const std::string &path, int flags);

#endif
