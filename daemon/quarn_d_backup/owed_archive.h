/**
 * @file owed_archive.h
 * @brief Archives whose restore on installation has not brought the data back.
 *
 * A package that was installed for its restore, and whose restore failed or was
 * cut short, has the data that it came with. Its archive is the only place
 * where the user's is, and a backup would put the one over the other. So it is
 * owed until a restore succeeded, or somebody has backed up just that package.
 * A note in the package tells the next daemon, and goes with the package. Any
 * thread.
 */
#ifndef QUARN_D_BACKUP_OWED_ARCHIVE_H
#define QUARN_D_BACKUP_OWED_ARCHIVE_H

#include <string>
#include <vector>

#include "quarn_d_backup/archive_hold.h"

/**
 * The backup of @p package that the device @p serial has made is owed to it.
 * @param root of the package; empty when it is not known, then only this process knows
 */
void note_owed_archive(const std::string &serial, const std::string &package,
                       const std::string &root);
/** The cloud has no archive of the version that is installed: only other versions are owed. */
void owe_other_versions(const std::string &serial, const std::string &package,
                        const std::string &root);
/** It is owed no longer. */
void forget_owed_archive(const std::string &serial, const std::string &package,
                         const std::string &root);
/** What is owed, after a look for an earlier daemon's note. */
[[nodiscard]] archive_claim look_for_owed_archive(const std::string &serial,
                                                  const std::string &package,
                                                  const std::string &root);
/** What is known to be owed. */
[[nodiscard]] archive_claim owed_claim(const std::string &serial, const std::string &package);
/** Every package of that device that something is known to be owed to. */
[[nodiscard]] std::vector<std::string> owed_packages(const std::string &serial);
/** Nothing is owed to a package that was removed. */
void forget_owed_of_removed_packages();

#endif
