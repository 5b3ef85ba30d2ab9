/**
 * @file package_directory.h
 * @brief Reading the directories of a package's data with its own user's rights.
 */
#ifndef QUARN_D_UTILS_PACKAGE_DIRECTORY_H
#define QUARN_D_UTILS_PACKAGE_DIRECTORY_H

#include <dirent.h>
#include <fcntl.h>

#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"

/**
 * Open the directory @p name of @p dir for reading, as open_as_package() does.
 * @param status when not null: that of the directory which was opened
 * @return null, with errno set, when that is refused or it is none
 */
[[nodiscard]] inline DirPtr open_directory_as_package(int dir, const char *name,
                                                      const package_user &user,
                                                      struct stat *status = nullptr) {
  UniqueFd fd = open_as_package(dir, name, O_RDONLY | O_DIRECTORY | O_NONBLOCK, 0, user, status);
  if (!fd) return nullptr;
  DirPtr opened(fdopendir(fd.get()));
  if (opened != nullptr) fd.release();
  return opened;
}

#endif
