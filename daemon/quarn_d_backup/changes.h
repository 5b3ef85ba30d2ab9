/**
 * @file changes.h
 * @brief A run's walk over the installed packages.
 */
#ifndef QUARN_D_BACKUP_CHANGES_H
#define QUARN_D_BACKUP_CHANGES_H

#include "platform_package_manager.h"

struct backup_context;

/**
 * Examine every package, archive what changed, write the list.
 * @return QUARN_OK or QUARN_FAILED
 */
[[nodiscard]] int make_backup_items(backup_context *ctx);
/** One package of that walk. @return true */
bool foreach_package_info_callback(package_info_h info, void *ctx);
/** Archive the package on its first application. @return true */
bool app_info_foreach_cb(package_info_app_component_type_e type, const char *app_id, void *ctx);
/** Clear cur_backup_enabled when the application opted out. @return true */
bool check_backup_enabled(package_info_app_component_type_e type, const char *app_id, void *ctx);

#endif
