#include "webdav/dav_locks.h"

#include <chrono>

namespace transport {

Outcome HeldLock::check() const {
  const bool ended = !token.empty() && http_now() >= until;
  return ended ? again("upload: the lock has ended") : success();
}

void LockWatch::look(Ticket &ticket, const std::string &folder) {
  DavLock lock;
  if (!client_.find_foreign_lock(ticket, folder, &lock)) return;
  {
    const MutexLock guard(mutex_);
    const auto now = std::chrono::steady_clock::now();
    if (lock.token != seen_) {
      seen_ = lock.token;
      seen_at_ = now;
      return;
    }
    if (now - seen_at_ <= kLockDuration) return;
    seen_.clear();
  }
  client_.break_lock(ticket, folder, lock);
}

}  // namespace transport
