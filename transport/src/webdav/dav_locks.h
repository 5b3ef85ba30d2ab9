/**
 * @file dav_locks.h
 * @brief The lock that an upload holds, and those that are in its way.
 */
#ifndef BACKUP_TRANSPORT_DAV_LOCKS_H
#define BACKUP_TRANSPORT_DAV_LOCKS_H

#include <string>

#include "core/retry.h"
#include "thread_annotations.h"
#include "webdav/dav_client.h"

namespace transport {

/** The lock on a folder; without a token where the server has none. One thread's. */
struct HeldLock {
  std::string token;
  RetryClock::Point until; /**< it lasts, unless somebody takes it away */

  /** Not every server looks at the proof of a lock that has ended. @return a failure if it has */
  Outcome check() const;
};

/**
 * Some servers keep the lock of a device that died for ever. One that was seen for longer than it
 * can have been held is taken away. Any thread; the client outlives it.
 */
class LockWatch {
 public:
  explicit LockWatch(const DavClient &client) : client_(client) {}

  /** A lock on @p folder was in the way. */
  void look(Ticket &ticket, const std::string &folder);

 private:
  const DavClient &client_;
  Mutex mutex_;
  std::string seen_ QUARN_GUARDED_BY(mutex_);  // the last one that was in the way
  std::chrono::steady_clock::time_point seen_at_ QUARN_GUARDED_BY(mutex_);
};

}  // namespace transport

#endif
