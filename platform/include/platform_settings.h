/**
 * @file platform_settings.h
 * @brief The device's key-value settings store.
 *
 * Keys are slash-separated texts. Values survive a reboot. Every call returns
 * #VCONF_OK or #VCONF_ERROR (missing key, value of another type, store not
 * writable). Any thread may read and write; notifications arrive on the main
 * loop only.
 */
#ifndef QUARN_PLATFORM_SETTINGS_H
#define QUARN_PLATFORM_SETTINGS_H

#ifdef __cplusplus
extern "C" {
#endif

#define VCONF_OK 0
#define VCONF_ERROR (-1)

/** One key at the moment of its change; valid during the callback only. */
typedef struct _keynode_t keynode_t;

/** A watched key changed. Runs on the main loop, also for the process's own writes. */
typedef void (*vconf_callback_fn)(keynode_t *node, void *user_data);

/** Read an integer into @p value, which is untouched on failure. */
int vconf_get_int(const char *key, int *value);
/** Write an integer. */
int vconf_set_int(const char *key, int value);
/** Read a double into @p value, which is untouched on failure. */
int vconf_get_dbl(const char *key, double *value);
/** Write a double. */
int vconf_set_dbl(const char *key, double value);
/** Watch @p key until the process ends. @p user_data stays the caller's. */
int vconf_notify_key_changed(const char *key, vconf_callback_fn callback, void *user_data);

#ifdef __cplusplus
}
#endif
#endif
