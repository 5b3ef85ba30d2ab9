/**
 * @file nested_loop.h
 * @brief How a request on the main thread waits for its own event.
 *
 * The loop that a request waits for is a mark, not a loop that runs: the
 * request leaves its fiber, the one main loop goes on, and the request goes on
 * when its own mark is quit, whatever waits beside it. Main thread, where not
 * told otherwise.
 */
#ifndef QUARN_D_UTILS_NESTED_LOOP_H
#define QUARN_D_UTILS_NESTED_LOOP_H

#include <glib.h>

#include <cstdint>

/**
 * A loop for run_nested_loop(). g_main_loop_quit() may come at any time and
 * from any thread, also before the wait begins. The caller's.
 */
[[nodiscard]] GMainLoop *new_wait_loop();

/**
 * True when the running request is not to wait any more: it was withdrawn, or
 * the process ends. run_nested_loop() then returns at once. Any thread.
 */
[[nodiscard]] bool waits_are_ended();

/**
 * Wait for a client's answer to a callback: as run_nested_loop(), but nobody
 * withdraws it, for what was asked for is settled then. Off a fiber it returns
 * at once.
 */
void wait_for_answer(GMainLoop *loop);

/**
 * End the wait of a fiber, and refuse all that it would begin later.
 * @param fiber a fiber_id()
 * @return false when it does not wait, or what it waits for has come
 */
bool withdraw_waits(std::uint64_t fiber);

/**
 * Wait until @p loop, one of new_wait_loop(), is quit; quit_nested_loops() and
 * withdraw_waits() end the wait as well. On a fiber everything else goes on
 * meanwhile; off it, GLib's sources do, and later waits end first.
 */
void run_nested_loop(GMainLoop *loop);
/** End every wait, the longest first, and refuse further ones. Returns when nobody waits. */
void quit_nested_loops();

#endif
