/**
 * @file cloud_session.h
 * @brief The session with the cloud: whether it can be had, and its handle.
 */
#ifndef QUARN_D_UTILS_CLOUD_SESSION_H
#define QUARN_D_UTILS_CLOUD_SESSION_H

#include <atomic>

#include "backup_transport.h"

/** The transport is ready and has given a handle. */
extern std::atomic<bool> cloud_init_done;
/** The handle; never released while the process lives. */
extern std::atomic<backup_trans_handle_h> _g_handle;
/** How long one caller waits for the transport's answer. */
extern unsigned int cloud_init_timeout_seconds;

/**
 * True when the transport is ready; starts it when needed and waits up to 60
 * seconds: the main thread in a nested loop, other threads on a condition.
 */
[[nodiscard]] bool cloud_initialized();
/** The transport handle; null before cloud_initialized() was true. Any thread. */
[[nodiscard]] backup_trans_handle_h cloud_handler();

/** True when a user is signed in. Main thread. */
[[nodiscard]] bool server_util_is_account_exist();

#endif
