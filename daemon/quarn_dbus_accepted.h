/**
 * @file quarn_dbus_accepted.h
 * @brief The requests that are accepted and have not had their last callback. Any thread.
 *
 * quarn_dbus_accept_request() and quarn_dbus_end_requests() of quarn_dbus_client.h are served here.
 */
#ifndef QUARN_DBUS_ACCEPTED_H
#define QUARN_DBUS_ACCEPTED_H

#include "thread_annotations.h"

struct client_cb_data;

/**
 * Held while a callback is handed to the connection, so that no request has two last ones and
 * none has a first one after it.
 */
extern Mutex &requests_mutex;

/**
 * Whether the client of @p record may still be called. The record is not looked into.
 * @param is_last with this callback its request ends
 */
[[nodiscard]] bool take_turn(const client_cb_data *record, bool is_last)
    QUARN_REQUIRES(requests_mutex);

#endif
