/**
 * @file quarn_d_loop.h
 * @brief Ecore and GLib as one main loop, and how a signal gets into it.
 *
 * Main thread only, except quarn_loop_wake_from_signal(), which any signal
 * handler may call.
 */
#ifndef QUARN_D_LOOP_H
#define QUARN_D_LOOP_H

/**
 * Initialise Ecore with GLib sources running inside its loop. Where the
 * packaged Ecore cannot integrate GLib itself, a select function does. The
 * calling thread owns the default GLib context from here on, so that no other
 * thread can run its sources.
 */
void quarn_loop_init();

/**
 * Release Ecore. Asked for inside the running loop, it happens when that loop
 * has returned. Safe to call when nothing was initialised.
 */
void quarn_loop_shutdown();

/** Run until quarn_loop_quit(). */
void quarn_loop_begin();

/** End the main loop. */
void quarn_loop_quit();

/** A one-shot timer of @p seconds; the callback returns 0. Null on failure. */
void *quarn_loop_timer_add(double seconds, unsigned char (*callback)(void *), void *data);
/** Delete a pending timer. */
void quarn_loop_timer_del(void *timer);

/**
 * Have @p log called at once on a thread of its own, and then @p end on the
 * main thread by the main loop or by a loop nested in it, for the first signal
 * that is handed to quarn_loop_wake_from_signal(). When the process still
 * lives @p grace_ms after that, for its main thread is blocked, it ends with
 * status 0.
 * @return false when the system has no room for it; signals are then lost
 */
bool quarn_loop_watch_signals(void (*log)(int signo), void (*end)(int signo), int grace_ms);

/** Hand a signal over. Async-signal-safe. */
void quarn_loop_wake_from_signal(int signo);

#endif
