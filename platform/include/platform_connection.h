/**
 * @file platform_connection.h
 * @brief The device's network connection.
 *
 * Functions return #CONNECTION_ERROR_NONE or a negative error. Main thread;
 * the callback runs on the main loop.
 */
#ifndef QUARN_PLATFORM_CONNECTION_H
#define QUARN_PLATFORM_CONNECTION_H

#ifdef __cplusplus
extern "C" {
#endif

typedef enum {
  CONNECTION_ERROR_NONE = 0,
  CONNECTION_ERROR_INVALID_PARAMETER = -22,
  CONNECTION_ERROR_OUT_OF_MEMORY = -12,
  CONNECTION_ERROR_OPERATION_FAILED = -5
} connection_error_e;

typedef enum {
  CONNECTION_TYPE_DISCONNECTED = 0,
  CONNECTION_TYPE_WIFI = 1,
  CONNECTION_TYPE_CELLULAR = 2
} connection_type_e;

typedef struct connection_s *connection_h;

/** The type of connection changed. */
typedef void (*connection_type_changed_cb)(connection_type_e type, void *user_data);

int connection_create(connection_h *connection);
int connection_destroy(connection_h connection);
int connection_get_type(connection_h connection, connection_type_e *type);
int connection_set_type_changed_cb(connection_h connection, connection_type_changed_cb callback,
                                   void *user_data);
int connection_unset_type_changed_cb(connection_h connection);

#ifdef __cplusplus
}
#endif
#endif
