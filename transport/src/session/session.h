/**
 * @file session.h
 * @brief What is behind backup_transport.h: the store in use, handles, the waiting line, workers,
 * and the delivery of the callbacks; and what tests reach of it.
 */
#ifndef BACKUP_TRANSPORT_SESSION_H
#define BACKUP_TRANSPORT_SESSION_H

#include <condition_variable>
#include <deque>
#include <functional>
#include <list>
#include <memory>
#include <string>

#include "core/backend.h"
#include "core/config.h"
#include "core/retry.h"
#include "session/listing_pages.h"
#include "session/request.h"
#include "thread_annotations.h"

namespace transport {

/** @return null, with @p problem, when the configuration names no store that can be */
using BackendMaker =
    std::function<std::shared_ptr<Backend>(const Config &config, std::string *problem)>;

/** Have other stores than the configured ones from the next init on; empty: the real ones. */
void set_backend_maker(BackendMaker maker);

/** Have another clock and other limits for the retries; null: the real ones. */
void set_retry_clock(RetryClock *clock, const RetryLimits &limits);

/** Name of the threads that run requests. */
constexpr char kWorkerName[] = "cloud-request";

/** One a process. Any thread; codes and promises are those of backup_transport.h. */
class Session {
 public:
  /** Never destroyed: workers may still run while the process exits. */
  static Session &get();

  int init(void *user_data, backup_trans_init_cb callback) QUARN_EXCLUDES(session_mutex);
  void deinit() QUARN_EXCLUDES(session_mutex);
  /** The session's own, for good; null without an init. */
  backup_trans_handle_h create_handle() QUARN_EXCLUDES(session_mutex);
  void cancel(backup_trans_handle_h handle) QUARN_EXCLUDES(session_mutex);
  /** @return whether there was such a request */
  bool abort(backup_trans_handle_h handle, const void *user_data) QUARN_EXCLUDES(session_mutex);

  /** The store that serves a request made now; null with the @p code of the refusal. */
  [[nodiscard]] std::shared_ptr<Backend> store_for(backup_trans_handle_h handle, int *code)
      QUARN_EXCLUDES(session_mutex);
  /** Have it run. @return the code of the refusal, else none */
  [[nodiscard]] int accept(const RequestPtr &request) QUARN_EXCLUDES(session_mutex);
  /** Until one that was accepted as waited for has ended. @return how */
  [[nodiscard]] int wait_for(const RequestPtr &request) QUARN_EXCLUDES(session_mutex);
  backup_trans_cause last_cause() QUARN_EXCLUDES(session_mutex);

  void set_maker(BackendMaker maker) QUARN_EXCLUDES(session_mutex);
  void set_clock(RetryClock *clock, const RetryLimits &limits) QUARN_EXCLUDES(session_mutex);

 private:
  Session();

  bool is_handle(backup_trans_handle_h handle) const QUARN_REQUIRES(session_mutex);
  bool is_current(unsigned generation) QUARN_EXCLUDES(session_mutex);
  void deliver(std::function<void()> delivery) QUARN_REQUIRES(session_mutex);
  void deliver_one() QUARN_EXCLUDES(session_mutex);
  void note_cause(const Request &request, const Outcome &outcome) QUARN_REQUIRES(session_mutex);
  void end(const RequestPtr &request, Outcome outcome) QUARN_REQUIRES(session_mutex);
  void end_soon(const RequestPtr &request) QUARN_REQUIRES(session_mutex);
  void cancel_all(backup_trans_handle_h handle) QUARN_REQUIRES(session_mutex);
  bool cancel_those(const std::function<bool(const Request &)> &concerned)
      QUARN_REQUIRES(session_mutex);
  bool start_worker() QUARN_REQUIRES(session_mutex);
  RequestPtr next_request() QUARN_EXCLUDES(session_mutex);
  Means means() QUARN_EXCLUDES(session_mutex);
  void work() QUARN_EXCLUDES(session_mutex);

  std::condition_variable ended_;
  ListingPages pages_;
  BackendMaker maker_ QUARN_GUARDED_BY(session_mutex);
  RetryClock *clock_ QUARN_GUARDED_BY(session_mutex);
  RetryLimits limits_ QUARN_GUARDED_BY(session_mutex);
  unsigned generation_ QUARN_GUARDED_BY(session_mutex) = 0;
  /** Null: not initialised. */
  std::unique_ptr<ConfigFile> config_ QUARN_GUARDED_BY(session_mutex);
  Config served_ QUARN_GUARDED_BY(session_mutex);  // what backend_ was made for
  std::shared_ptr<Backend> backend_ QUARN_GUARDED_BY(session_mutex);
  std::list<backup_trans_handle_s> handles_ QUARN_GUARDED_BY(session_mutex);
  std::deque<RequestPtr> waiting_ QUARN_GUARDED_BY(session_mutex);
  std::list<RequestPtr> running_ QUARN_GUARDED_BY(session_mutex);
  std::deque<std::function<void()>> deliveries_ QUARN_GUARDED_BY(session_mutex);
  int workers_ QUARN_GUARDED_BY(session_mutex) = 0;
  std::uint64_t accepted_ QUARN_GUARDED_BY(session_mutex) = 0;       // requests so far
  std::uint64_t failed_before_ QUARN_GUARDED_BY(session_mutex) = 0;  // when one was not served
  backup_trans_cause last_cause_ QUARN_GUARDED_BY(session_mutex) = BACKUP_TRANS_CAUSE_NONE;
};

}  // namespace transport

#endif
