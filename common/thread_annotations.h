/**
 * @file thread_annotations.h
 * @brief What a mutex guards, said so that a compiler holds it.
 *
 * A member that is guarded says by what (QUARN_GUARDED_BY), and a function that is called with the
 * mutex held says so (QUARN_REQUIRES); scripts/lint lets clang compare that with what is done. The
 * standard library's mutex has no such words, hence Mutex and MutexLock, which are nothing else.
 */
#ifndef THREAD_ANNOTATIONS_H
#define THREAD_ANNOTATIONS_H

#include <mutex>

#ifdef __clang__
#define QUARN_THREAD_ATTRIBUTE(x) __attribute__((x))
#else
#define QUARN_THREAD_ATTRIBUTE(x)
#endif

/** Read and written with that mutex held only. */
#define QUARN_GUARDED_BY(mutex) QUARN_THREAD_ATTRIBUTE(guarded_by(mutex))
/** Called with that mutex held; also behind the parameters of a lambda. */
#define QUARN_REQUIRES(mutex) QUARN_THREAD_ATTRIBUTE(requires_capability(mutex))
/** Takes that mutex itself: not to be called with it held. */
#define QUARN_EXCLUDES(mutex) QUARN_THREAD_ATTRIBUTE(locks_excluded(mutex))

/** std::mutex. */
class QUARN_THREAD_ATTRIBUTE(capability("mutex")) Mutex {
 public:
  Mutex() = default;
  Mutex(const Mutex &) = delete;
  Mutex &operator=(const Mutex &) = delete;

 private:
  friend class MutexLock;
  std::mutex mutex_;
};

/** Holds a Mutex as long as it lives. One thread's. */
class QUARN_THREAD_ATTRIBUTE(scoped_lockable) MutexLock {
 public:
  explicit MutexLock(Mutex &mutex) QUARN_THREAD_ATTRIBUTE(acquire_capability(mutex))
      : lock_(mutex.mutex_) {}
  MutexLock(const MutexLock &) = delete;
  MutexLock &operator=(const MutexLock &) = delete;
  ~MutexLock() QUARN_THREAD_ATTRIBUTE(release_capability()) = default;

  /** What a std::condition_variable waits with, and for nothing else. */
  std::unique_lock<std::mutex> &waiting() { return lock_; }

 private:
  std::unique_lock<std::mutex> lock_;
};

#endif
