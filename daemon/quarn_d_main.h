/**
 * @file quarn_d_main.h
 * @brief The process: its start, its end, its signals.
 *
 * Main thread only, except signal_handler().
 */
#ifndef QUARN_D_MAIN_H
#define QUARN_D_MAIN_H

#include <cstdint>

/** 1 between init_quarn() and deinit_quarn(). */
extern std::int32_t quarn_started;
/** What quarnd_dbus_init() returned. */
extern std::uint32_t quarn_dbus_owner_id;

/** All that main() does. @return the process' exit status */
int quarn_run();

/**
 * What "quarnd --recover" does instead, once after a boot and before the daemon
 * may be started: it needs neither account nor bus. @return the exit status
 */
int quarn_recover();

/** Set up the loop, the bus, the scheduler; only the first call does anything. */
void init_quarn();
/** Undo init_quarn(); only the first call after it does anything. */
void deinit_quarn();

/** Of SIGINT, SIGHUP, SIGTERM and SIGQUIT: wakes the thread that sees to the end. */
void signal_handler(int signo);

#endif
