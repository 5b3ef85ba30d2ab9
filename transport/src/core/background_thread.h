/**
 * @file background_thread.h
 * @brief A thread that nobody waits for.
 */
#ifndef BACKUP_TRANSPORT_BACKGROUND_THREAD_H
#define BACKUP_TRANSPORT_BACKGROUND_THREAD_H

namespace transport {

/**
 * Run @p body in a thread of its own, detached, with a stack of 1 MiB. Signals are for others: the
 * process's are for its main thread. Any thread.
 * @param name what the system shows of it, at most 15 bytes; static
 * @param body called with @p data on the new thread
 * @return false when there can be none
 */
[[nodiscard]] bool start_background_thread(const char *name, void (*body)(void *data), void *data);

}  // namespace transport

#endif
