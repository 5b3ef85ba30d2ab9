/**
 * @file platform_system_info.h
 * @brief Facts of the device model that never change. Any thread.
 */
#ifndef QUARN_PLATFORM_SYSTEM_INFO_H
#define QUARN_PLATFORM_SYSTEM_INFO_H

#ifdef __cplusplus
extern "C" {
#endif

#define SYSTEM_INFO_ERROR_NONE 0
#define SYSTEM_INFO_ERROR_INVALID_PARAMETER (-22)
#define SYSTEM_INFO_ERROR_IO_ERROR (-5)

/** Key of the device's model name. */
#define SYSTEM_INFO_KEY_MODEL_NAME "http://orvane.org/system/model_name"

/** Read a text; on success @p value is malloc'd and the caller's. */
int system_info_get_platform_string(const char *key, char **value);

#ifdef __cplusplus
}
#endif
#endif
