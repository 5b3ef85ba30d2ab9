/**
 * @file fiber.h
 * @brief Stacks of their own, so that a request can wait without the rest of the thread.
 *
 * A fiber belongs to the thread that started it. The daemon's are all on the
 * main thread, where one of them runs at a time and none is left but by a wait
 * of its own: between two waits nothing else happens on that thread. A lock
 * must not be held across a wait.
 */
#ifndef QUARN_D_UTILS_FIBER_H
#define QUARN_D_UTILS_FIBER_H

#include <cstddef>
#include <cstdint>
#include <functional>

struct quarn_fiber;

/** Bytes of address space that a fiber's stack takes; of memory it takes what it uses. */
extern const std::size_t kFiberStackSize;

/**
 * Run @p work on a stack of its own, at once. Returns when it has ended or has
 * been suspended for the first time. Without memory for a stack it runs on the
 * caller's.
 */
void run_on_fiber(std::function<void()> work);
/** The fiber that runs; null on the thread's own stack. */
[[nodiscard]] quarn_fiber *current_fiber();
/** A number that no other fiber of the process has; 0 for null. */
[[nodiscard]] std::uint64_t fiber_id(const quarn_fiber *fiber);

/** Mark a fiber: what it does is not wanted any more. The mark stays. */
void withdraw_fiber(quarn_fiber *fiber);
/** Whether a fiber has that mark; false for null. */
[[nodiscard]] bool fiber_is_withdrawn(const quarn_fiber *fiber);

/** Leave the running fiber: whoever started or resumed it goes on. */
void suspend_fiber();
/** Go on with a suspended fiber, until it ends or is suspended again. */
void resume_fiber(quarn_fiber *fiber);

/**
 * Run @p work, which needs much stack and does not wait, on the thread's own
 * stack. Returns when it has ended. Anywhere; off a fiber it is a plain call.
 */
void run_on_thread_stack(const std::function<void()> &work);

#endif
