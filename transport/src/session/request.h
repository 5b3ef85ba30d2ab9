/**
 * @file request.h
 * @brief What every request to the cloud is: accepted, run by a worker, and ended once.
 */
#ifndef BACKUP_TRANSPORT_REQUEST_H
#define BACKUP_TRANSPORT_REQUEST_H

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>

#include "backup_transport.h"
#include "core/backend.h"
#include "core/retry.h"
#include "session/listing_pages.h"
#include "thread_annotations.h"

namespace transport {

/** Whatever the session's threads share; one, as the session is. */
inline Mutex session_mutex;

/** What the next upload to a path replaces. */
struct Basis {
  Version version;
  std::weak_ptr<Backend> store; /**< that it was read from */
};

}  // namespace transport

struct backup_trans_handle_s {
  unsigned generation QUARN_GUARDED_BY(transport::session_mutex) = 0;
  std::map<std::string, transport::Basis> bases QUARN_GUARDED_BY(transport::session_mutex);
};

namespace transport {

/** What a worker has for its requests. */
struct Means {
  RetryClock &clock;
  RetryLimits limits;
  ListingPages &pages;
};

/** Thousands may wait, so each kind has only what it needs (requests.h). */
class Request {
 public:
  Request(backup_trans_handle_h handle, std::shared_ptr<Backend> backend, void *user_data);
  Request(const Request &) = delete;
  Request &operator=(const Request &) = delete;
  virtual ~Request() = default;

  /** Do it, with as many attempts as it takes. On a worker's thread, once, without the mutex. */
  virtual Outcome run(const Means &means) QUARN_EXCLUDES(session_mutex) = 0;

  /**
   * Tell whoever made it. On the main thread, once, and never where somebody waits for it.
   * @param outcome a success only where run() has returned
   */
  virtual void call_back(const Outcome &outcome) QUARN_EXCLUDES(session_mutex) = 0;

  backup_trans_handle_h handle() const { return handle_; }
  const void *user_data() const { return user_data_; }

  Ticket ticket;
  bool waited_for = false; /**< by a caller, instead of a callback; set before it is accepted */

  std::uint64_t number QUARN_GUARDED_BY(session_mutex) = 0; /**< in the order of acceptance */
  bool ended QUARN_GUARDED_BY(session_mutex) = false;
  /** Once it has ended, and the same from then on. */
  std::unique_ptr<Outcome> result QUARN_GUARDED_BY(session_mutex);

 protected:
  /** Run @p once until it does not end with a transient failure. */
  Outcome with_retries(const Means &means, const std::function<Outcome(Attempt &)> &once);

  Backend &backend() const { return *backend_; }
  const std::shared_ptr<Backend> &shared_backend() const { return backend_; }
  void *callers_data() const { return user_data_; }

 private:
  const backup_trans_handle_h handle_;
  const std::shared_ptr<Backend> backend_;
  void *const user_data_;
};

using RequestPtr = std::shared_ptr<Request>;

}  // namespace transport

#endif
