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

/** What a signal does. All but end() are called on the watching thread. */
struct quarn_signal_watch {
  /**
   * A signal came. @return milliseconds until it ends the process: 0 at once,
   * negative: it does not. Another signal may end it earlier.
   */
  int (*take)(int signo);
  /** The process is to end: let the main thread go on, wherever it waits. */
  void (*begin_end)();
  /** On the main thread, by the main loop or by a loop nested in it. */
  void (*end)(int signo);
  /** The process has not ended by then: the last thing that is done. */
  void (*last)();
  int grace_ms; /**< from begin_end() to last() and the end with status 0 */
};

/**
 * Have a thread of its own wait for signals that are handed to
 * quarn_loop_wake_from_signal().
 * @return false when the system has no room for it; signals are then lost
 */
[[nodiscard]] bool quarn_loop_watch_signals(const quarn_signal_watch &watch);

/** Hand a signal over. Async-signal-safe. */
void quarn_loop_wake_from_signal(int signo);

#endif
