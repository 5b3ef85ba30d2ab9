/**
 * @file quarn_d_lifecycle.h
 * @brief How the process ends: terminate requests, their timer, the exit code.
 *
 * Main thread only.
 */
#ifndef QUARN_D_LIFECYCLE_H
#define QUARN_D_LIFECYCLE_H

/** Exit status of the process: 0, or -1 when a restart was requested. */
extern int quarn_exit_code;

/**
 * Ask the process to end. Dropped while the daemon is not idle.
 * @param delay   seconds; 0.0 ends at once, another value replaces a pending request
 * @param restart end with -1, so that the service manager starts the daemon again
 */
void request_quarn_terminate(double delay, bool restart);

/**
 * Keep requests at once back until release_quarn_terminate(): a daemon that was
 * started by the bus and ends before it owns its name leaves the bus waiting
 * for it, and every caller with it.
 */
void hold_quarn_terminate();
/** Carry out the request that was kept back, if there is one and the daemon is idle. */
void release_quarn_terminate();

/** Drop a pending terminate timer, and a request that is kept back. */
void cancel_quarn_terminate();

/** Timer callback of a delayed request; returns 0 (do not repeat). */
unsigned char terminate_cb(void *data);

#endif
