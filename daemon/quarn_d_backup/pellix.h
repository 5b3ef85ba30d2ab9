/**
 * @file pellix.h
 * @brief The companion's part of the walk over the packages. Main thread.
 */
#ifndef QUARN_D_BACKUP_PELLIX_H
#define QUARN_D_BACKUP_PELLIX_H

#include "platform_package_manager.h"

/** Pack the package for the companion on its first application. @return true */
bool pellix_app_info_foreach_cb(package_info_app_component_type_e type, const char *app_id,
                                void *ctx);

#endif
