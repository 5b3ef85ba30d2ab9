/**
 * @file detached_thread.h
 * @brief Threads that live beside the program's own work, and end with the process or by
 * themselves.
 */
#ifndef QUARN_DETACHED_THREAD_H
#define QUARN_DETACHED_THREAD_H

#include <pthread.h>
#include <signal.h>

#include <cstddef>

/**
 * Start a thread that nobody joins and that no signal reaches. Any thread.
 * @param stack its stack's size, bytes
 * @param data  of the body; the caller's still when there is no thread
 * @return 0, or the error of pthread_create()
 */
[[nodiscard]] inline int start_detached_thread(std::size_t stack, void *(*body)(void *),
                                               void *data) {
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
  pthread_attr_setstacksize(&attributes, stack);
  sigset_t all;
  sigset_t before;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, &before);
  pthread_t thread;
  const int error = pthread_create(&thread, &attributes, body, data);
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
  pthread_attr_destroy(&attributes);
  return error;
}

#endif
