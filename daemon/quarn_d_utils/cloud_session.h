/**
 * @file cloud_session.h
 * @brief The state of the cloud session, apart from its two public functions.
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

#endif
