/**
 * @file package.h
 * @brief Packages and their applications, by the package manager.
 *
 * Every function logs its failures and reports them by its result only.
 * Any thread.
 */
#ifndef QUARN_D_UTILS_PACKAGE_H
#define QUARN_D_UTILS_PACKAGE_H

#include <string>
#include <vector>

#include "thread_annotations.h"

extern Mutex installed_check_mutex;
/** Packages whose installation completed since the list was last cleared. */
extern std::vector<std::string> install_complete_pkgs QUARN_GUARDED_BY(installed_check_mutex);

/**
 * True when the application's API version is at least @p version, compared as bytes.
 * No part of the daemon calls it.
 */
[[nodiscard]] bool app_support_api_version(const char *appid, const char *version);
/** True when the application takes part in backup. */
[[nodiscard]] bool backup_enabled_app(const char *appid);
/** True when the package is in install_complete_pkgs. */
[[nodiscard]] bool already_installed_package(const char *pkgid);
/** True when the package lies on external storage. */
[[nodiscard]] bool app_data_storage_is_external(const char *pkgid);
/**
 * Package id and version of an application, malloc'd.
 * No part of the daemon calls it.
 * @return #QUARN_OK or #QUARN_FAILED
 */
[[nodiscard]] int get_pkg_info(const char *appid, char **pkgid, char **version);
/** Root path of a package, malloc'd; null on failure. */
[[nodiscard]] char *get_app_root_path(const char *pkgid);
/** The same into a string. @return #QUARN_OK or #QUARN_REFUSED */
[[nodiscard]] int get_string_app_root_path(const char *pkgid, std::string &root);

#endif
