/**
 * @file fault.h
 * @brief Makes calls of the code under test fail: the linker leads them through fault.cpp.
 */
#ifndef FAULT_H
#define FAULT_H

/**
 * While it lives, calls of @p function on this thread fail with @p error: those
 * after the first @p skipped ones, and of these the first @p times. One at a time.
 */
class Fault {
 public:
  Fault(const char *function, int error, int skipped = 0, int times = 1);
  ~Fault();
  Fault(const Fault &) = delete;
  Fault &operator=(const Fault &) = delete;

  /** Calls that failed. */
  int hits() const;
};

/** Calls @p hook before each call of @p function on this thread, until null is set. */
void set_call_hook(const char *function, void (*hook)());

#endif
