/**
 * @file platform_package_manager.h
 * @brief Installed packages and the events of their installation.
 *
 * All functions return #PACKAGE_MANAGER_ERROR_NONE or a negative error. Texts
 * returned through out pointers are allocated with malloc and belong to the
 * caller. Queries may be made from any thread; events arrive on the main loop.
 */
#ifndef QUARN_PLATFORM_PACKAGE_MANAGER_H
#define QUARN_PLATFORM_PACKAGE_MANAGER_H

#include <stdbool.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef enum {
  PACKAGE_MANAGER_ERROR_NONE = 0,
  PACKAGE_MANAGER_ERROR_INVALID_PARAMETER = -22,
  PACKAGE_MANAGER_ERROR_OUT_OF_MEMORY = -12,
  PACKAGE_MANAGER_ERROR_IO_ERROR = -5,
  PACKAGE_MANAGER_ERROR_NO_SUCH_PACKAGE = -71
} package_manager_error_e;

typedef enum {
  PACKAGE_MANAGER_EVENT_TYPE_INSTALL = 0,
  PACKAGE_MANAGER_EVENT_TYPE_UNINSTALL = 1,
  PACKAGE_MANAGER_EVENT_TYPE_UPDATE = 2
} package_manager_event_type_e;

typedef enum {
  PACKAGE_MANAGER_EVENT_STATE_STARTED = 0,
  PACKAGE_MANAGER_EVENT_STATE_PROCESSING = 1,
  PACKAGE_MANAGER_EVENT_STATE_COMPLETED = 2,
  PACKAGE_MANAGER_EVENT_STATE_FAILED = 3
} package_manager_event_state_e;

/** Which application components of a package to visit. */
typedef enum {
  PACKAGE_INFO_ALLAPP = 0,
  PACKAGE_INFO_UIAPP = 1,
  PACKAGE_INFO_SERVICEAPP = 2
} package_info_app_component_type_e;

/** Subscription to package events. */
typedef struct package_manager_s *package_manager_h;
/** One installed package. */
typedef struct package_info_s *package_info_h;

/** One package of a walk; @p info belongs to the service. Return false to stop. */
typedef bool (*package_manager_package_info_cb)(package_info_h info, void *user_data);
/** One component of a package; @p app_id is valid during the call. Return false to stop. */
typedef bool (*package_info_app_cb)(package_info_app_component_type_e comp_type, const char *app_id,
                                    void *user_data);
/** One package event. The texts are valid during the call. @p progress is a percentage. */
typedef void (*package_manager_event_cb)(const char *type, const char *package,
                                         package_manager_event_type_e event_type,
                                         package_manager_event_state_e event_state, int progress,
                                         package_manager_error_e error, void *user_data);

/** Make a handle for events; released with package_manager_destroy(). */
int package_manager_create(package_manager_h *manager);
int package_manager_destroy(package_manager_h manager);
/** Subscribe. Events from before the call are not delivered. Main thread. */
int package_manager_set_event_cb(package_manager_h manager, package_manager_event_cb callback,
                                 void *user_data);
int package_manager_unset_event_cb(package_manager_h manager);
/** Visit every installed package, in the order of their ids. */
int package_manager_foreach_package_info(package_manager_package_info_cb callback, void *user_data);
/** Look one package up; the handle is released with package_info_destroy(). */
int package_manager_get_package_info(const char *package_id, package_info_h *info);

int package_info_destroy(package_info_h info);
/** Visit the package's application components in the order of its manifest. */
int package_info_foreach_app_from_package(package_info_h info,
                                          package_info_app_component_type_e comp_type,
                                          package_info_app_cb callback, void *user_data);
int package_info_get_package(package_info_h info, char **package_id);
int package_info_get_version(package_info_h info, char **version);
/** The kind of package, "tpk" or "wgt". */
int package_info_get_type(package_info_h info, char **type);
/** Absolute path of the package root, without a trailing slash. */
int package_info_get_root_path(package_info_h info, char **path);
/** True when the package came with the device. */
int package_info_is_preload_package(package_info_h info, bool *preload);

#ifdef __cplusplus
}
#endif
#endif
