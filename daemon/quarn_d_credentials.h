/**
 * @file quarn_d_credentials.h
 * @brief What the bus tells of a caller, and the group of those who may do everything.
 */
#ifndef QUARN_D_CREDENTIALS_H
#define QUARN_D_CREDENTIALS_H

#include <glib.h>
#include <sys/types.h>

#include "quarn_d_callers.h"

/**
 * Read a reply of the bus' GetConnectionCredentials, "(a{sv})" with the keys that the bus daemon
 * has. Any thread.
 * @param reply borrowed
 * @return `known` is false when it tells of no user
 */
[[nodiscard]] quarn_caller read_credentials(GVariant *reply);

/** Number of the clients' group, kNoGroup when the system has none. Any thread. */
[[nodiscard]] gid_t client_group();
/** The group that counts instead of the system's; for tests. */
void set_client_group(gid_t group);

#endif
