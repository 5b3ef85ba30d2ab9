/**
 * @file quarn_d_loop.h
 * @brief Ecore and GLib as one main loop, and loops nested in it.
 *
 * Main thread only, except quarn_loop_wake_from_signal().
 */
#ifndef QUARN_D_LOOP_H
#define QUARN_D_LOOP_H

/**
 * Initialise Ecore with GLib sources running inside its loop. Where the
 * packaged Ecore cannot integrate GLib itself, a select function does.
 */
void quarn_loop_init();

/** Release Ecore. Safe to call when nothing was initialised. */
void quarn_loop_shutdown();

/** Run until quarn_loop_quit(). */
void quarn_loop_begin();

/** End the main loop. */
void quarn_loop_quit();

/** A one-shot timer of @p seconds; the callback returns 0. Null on failure. */
void *quarn_loop_timer_add(double seconds, unsigned char (*callback)(void *), void *data);
/** Delete a pending timer. */
void quarn_loop_timer_del(void *timer);

#endif
