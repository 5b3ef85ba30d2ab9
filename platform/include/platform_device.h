/**
 * @file platform_device.h
 * @brief Display state and power locks.
 *
 * Functions return #DEVICE_ERROR_NONE or a negative error. Power locks may be
 * taken and released from any thread; callbacks run on the main loop.
 */
#ifndef QUARN_PLATFORM_DEVICE_H
#define QUARN_PLATFORM_DEVICE_H

#ifdef __cplusplus
extern "C" {
#endif

typedef enum {
  DEVICE_ERROR_NONE = 0,
  DEVICE_ERROR_INVALID_PARAMETER = -22,
  DEVICE_ERROR_OPERATION_FAILED = -5
} device_error_e;

typedef enum {
  DISPLAY_STATE_NORMAL = 0,
  DISPLAY_STATE_SCREEN_DIM = 1,
  DISPLAY_STATE_SCREEN_OFF = 2
} display_state_e;

typedef enum { POWER_LOCK_CPU = 0, POWER_LOCK_DISPLAY = 1 } power_lock_e;

typedef enum {
  DEVICE_CALLBACK_BATTERY_CAPACITY = 0,
  DEVICE_CALLBACK_BATTERY_LEVEL = 1,
  DEVICE_CALLBACK_BATTERY_CHARGING = 2,
  DEVICE_CALLBACK_DISPLAY_STATE = 3
} device_callback_e;

/** A watched fact changed; what @p value holds depends on the type. */
typedef void (*device_changed_cb)(device_callback_e type, void *value, void *user_data);

int device_display_get_state(display_state_e *state);
int device_add_callback(device_callback_e type, device_changed_cb callback, void *user_data);
int device_remove_callback(device_callback_e type, device_changed_cb callback);
/** Keep the CPU or the display on. @p timeout_ms 0: until released. Locks do not count. */
int device_power_request_lock(power_lock_e type, int timeout_ms);
int device_power_release_lock(power_lock_e type);

#ifdef __cplusplus
}
#endif
#endif
