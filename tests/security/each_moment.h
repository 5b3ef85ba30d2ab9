/**
 * @file each_moment.h
 * @brief Something that happens between two system calls of this thread, as an application does it.
 *
 * A race that is run until the moment happens is met by chance. Here the moments of some work are
 * counted, and the work is done once for each of them.
 */
#ifndef QUARN_TESTS_EACH_MOMENT_H
#define QUARN_TESTS_EACH_MOMENT_H

#include <functional>

/**
 * Called before and after each call of this thread by which the daemon opens, looks at, changes or
 * names files, as far as it makes them by the C library; what it does itself is no moment. Null for
 * nothing.
 */
extern thread_local std::function<void()> *at_each_moment;

/** While it lives this thread has the rights of an application. Nests; no capability is left. */
class AsApplication {
 public:
  AsApplication();
  ~AsApplication();
  AsApplication(const AsApplication &) = delete;
  AsApplication &operator=(const AsApplication &) = delete;

 private:
  const long group_;
  const long user_;
};

#endif
