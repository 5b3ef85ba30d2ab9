/**
 * @file package_trouble.h
 * @brief Why a package's data cannot be packed whole.
 */
#ifndef QUARN_D_BACKUP_PACKAGE_TROUBLE_H
#define QUARN_D_BACKUP_PACKAGE_TROUBLE_H

#include <string>

#include "quarn_d_backup/backup_progress.h"

/**
 * Looks through the package's data directories, as the calling thread may.
 * @return removed, too_deep or unreadable; none when every folder can be read
 */
[[nodiscard]] backup_outcome find_package_trouble(const std::string &root);

#endif
