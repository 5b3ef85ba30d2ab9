/**
 * @file platform_runtime_info.h
 * @brief Facts of the running device that change, the charger among them.
 *
 * Functions return #RUNTIME_INFO_ERROR_NONE or a negative error. Main thread;
 * callbacks run on the main loop.
 */
#ifndef QUARN_PLATFORM_RUNTIME_INFO_H
#define QUARN_PLATFORM_RUNTIME_INFO_H

#include <stdbool.h>

#ifdef __cplusplus
extern "C" {
#endif

#define RUNTIME_INFO_ERROR_NONE 0
#define RUNTIME_INFO_ERROR_INVALID_PARAMETER (-22)
#define RUNTIME_INFO_ERROR_IO_ERROR (-5)

typedef enum { RUNTIME_INFO_KEY_CHARGER_CONNECTED = 24 } runtime_info_key_e;

typedef void (*runtime_info_changed_cb)(runtime_info_key_e key, void *user_data);

int runtime_info_get_value_bool(runtime_info_key_e key, bool *value);
int runtime_info_set_changed_cb(runtime_info_key_e key, runtime_info_changed_cb callback,
                                void *user_data);
int runtime_info_unset_changed_cb(runtime_info_key_e key);

#ifdef __cplusplus
}
#endif
#endif
