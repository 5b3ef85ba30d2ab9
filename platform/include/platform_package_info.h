/**
 * @file platform_package_info.h
 * @brief The package database: records of packages and applications.
 *
 * Functions return #PMINFO_R_OK or a negative error. Texts handed out point
 * into the record and live as long as it does. Any thread.
 */
#ifndef QUARN_PLATFORM_PACKAGE_INFO_H
#define QUARN_PLATFORM_PACKAGE_INFO_H

#ifdef __cplusplus
extern "C" {
#endif

#define PMINFO_R_OK 0
#define PMINFO_R_EINVAL (-2)
#define PMINFO_R_ERROR (-1)
#define PMINFO_R_ENOENT (-4)

typedef enum {
  PMINFO_INTERNAL_STORAGE = 0,
  PMINFO_EXTERNAL_STORAGE = 1
} pkgmgrinfo_installed_storage;

/** Record of a package; released with pkgmgrinfo_pkginfo_destroy_pkginfo(). */
typedef void *pkgmgrinfo_pkginfo_h;
/** Record of an application; released with pkgmgrinfo_appinfo_destroy_appinfo(). */
typedef void *pkgmgrinfo_appinfo_h;

int pkgmgrinfo_pkginfo_get_pkginfo(const char *pkgid, pkgmgrinfo_pkginfo_h *handle);
int pkgmgrinfo_pkginfo_destroy_pkginfo(pkgmgrinfo_pkginfo_h handle);
int pkgmgrinfo_pkginfo_get_version(pkgmgrinfo_pkginfo_h handle, char **version);
/** Where the package's data lies. */
int pkgmgrinfo_pkginfo_get_installed_storage(pkgmgrinfo_pkginfo_h handle,
                                             pkgmgrinfo_installed_storage *storage);

int pkgmgrinfo_appinfo_get_appinfo(const char *appid, pkgmgrinfo_appinfo_h *handle);
int pkgmgrinfo_appinfo_destroy_appinfo(pkgmgrinfo_appinfo_h handle);
/** The id of the package that the application belongs to. */
int pkgmgrinfo_appinfo_get_pkgid(pkgmgrinfo_appinfo_h handle, char **pkgid);
/** The platform interface version that the application was built for, "4.0" for example. */
int pkgmgrinfo_appinfo_get_api_version(pkgmgrinfo_appinfo_h handle, char **api_version);
/** One metadata value of the application's manifest; an error when the key is absent. */
int pkgmgrinfo_appinfo_get_metadata_value(pkgmgrinfo_appinfo_h handle, const char *key,
                                          char **value);

#ifdef __cplusplus
}
#endif
#endif
