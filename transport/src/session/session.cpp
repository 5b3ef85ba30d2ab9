#include "session/session.h"

#include <glib.h>

#include <algorithm>
#include <chrono>
#include <utility>

#include "core/background_thread.h"
#include "session/check.h"
#include "stores/make_backend.h"

namespace transport {
namespace {

// A worker that does not come back by then is left behind, and the callback goes ahead.
constexpr guint kCancelPatienceMs = 500;

/** Does the end of a request tell of the store, and not of the device or its user? */
bool tells_of_store(const Request &request, const Outcome &outcome) {
  return !request.ticket.cancelled() && outcome.code != BACKUP_TRANS_ERROR_CANCELLED &&
         outcome.code != BACKUP_TRANS_ERROR_LOCAL_FILE;
}

bool was_served(const Outcome &outcome) {
  return outcome.ok() || outcome.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT ||
         outcome.code == BACKUP_TRANS_ERROR_CONFLICT;
}

}  // namespace

void set_backend_maker(BackendMaker maker) { Session::get().set_maker(std::move(maker)); }

void set_retry_clock(RetryClock *clock, const RetryLimits &limits) {
  Session::get().set_clock(clock, limits);
}

Session &Session::get() {
  static Session *const session = new Session;
  return *session;
}

Session::Session() : maker_(make_backend), clock_(&RetryClock::system()) {}

int Session::init(void *user_data, backup_trans_init_cb callback) {
  if (callback == nullptr) return BACKUP_TRANS_ERROR_ARGUMENT;
  const MutexLock lock(session_mutex);
  auto config = std::make_unique<ConfigFile>(ConfigFile::default_path());
  std::shared_ptr<Backend> backend;
  std::string problem;
  if (config->refresh()) {
    backend = maker_(config->config(), &problem);
  } else {
    problem = config->problem();
  }
  const bool usable = backend != nullptr;
  if (usable) {
    ++generation_;
    served_ = config->config();
    config_ = std::move(config);
    backend_ = std::move(backend);
  } else {
    g_warning("cloud transport: %s", problem.c_str());
  }
  const unsigned generation = generation_;
  deliver([this, usable, generation, user_data, callback] {
    backup_trans_error_code code = BACKUP_TRANS_ERROR_NOT_INITIALIZED;
    if (usable)
      code = is_current(generation) ? BACKUP_TRANS_ERROR_NONE : BACKUP_TRANS_ERROR_CANCELLED;
    callback(code, user_data);
  });
  return BACKUP_TRANS_ERROR_NONE;
}

void Session::deinit() {
  const MutexLock lock(session_mutex);
  if (!config_) return;
  ++generation_;
  config_.reset();
  backend_.reset();
  pages_.forget();
  cancel_all(nullptr);
}

backup_trans_handle_h Session::create_handle() {
  const MutexLock lock(session_mutex);
  if (!config_) return nullptr;
  handles_.emplace_back();
  handles_.back().generation = generation_;
  return &handles_.back();
}

void Session::cancel(backup_trans_handle_h handle) {
  const MutexLock lock(session_mutex);
  if (is_handle(handle)) cancel_all(handle);
}

bool Session::abort(backup_trans_handle_h handle, const void *user_data) {
  const MutexLock lock(session_mutex);
  if (!is_handle(handle) || user_data == nullptr) return false;
  return cancel_those([&](const Request &request) {
    return request.handle() == handle && request.user_data() == user_data;
  });
}

// The store that serves a request made now; null with the code of the refusal.
std::shared_ptr<Backend> Session::store_for(backup_trans_handle_h handle, int *code) {
  const MutexLock lock(session_mutex);
  *code = BACKUP_TRANS_ERROR_NOT_INITIALIZED;
  if (!config_) return nullptr;
  if (!is_handle(handle)) {
    *code = BACKUP_TRANS_ERROR_ARGUMENT;
    return nullptr;
  }
  if (handle->generation != generation_) return nullptr;
  if (!config_->refresh()) {
    // Forgotten, so that the file's return is noticed as a change.
    backend_.reset();
    return nullptr;
  }
  if (!backend_ || !(config_->config() == served_)) {
    std::string problem;
    backend_ = maker_(config_->config(), &problem);
    served_ = config_->config();
    if (!backend_) g_warning("cloud transport: %s", problem.c_str());
  }
  return backend_;
}

int Session::accept(const RequestPtr &request) {
  const MutexLock lock(session_mutex);
  // The session may have ended while the request's file was opened.
  if (!config_ || request->handle()->generation != generation_)
    return BACKUP_TRANS_ERROR_NOT_INITIALIZED;
  request->number = ++accepted_;
  waiting_.push_back(request);
  if (workers_ < BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS && !start_worker() && workers_ == 0) {
    waiting_.pop_back();
    return BACKUP_TRANS_ERROR_SERVER;
  }
  return BACKUP_TRANS_ERROR_NONE;
}

backup_trans_cause Session::last_cause() {
  const MutexLock lock(session_mutex);
  return last_cause_;
}

int Session::wait_for(const RequestPtr &request) {
  MutexLock lock(session_mutex);
  ended_.wait(lock.waiting(), [&]() QUARN_REQUIRES(session_mutex) {
    return request->ended || request->ticket.cancelled();
  });
  ended_.wait_for(lock.waiting(), std::chrono::milliseconds(kCancelPatienceMs),
                  [&]() QUARN_REQUIRES(session_mutex) { return request->ended; });
  if (!request->ended) end(request, cancelled());
  return request->result->code;
}

void Session::set_maker(BackendMaker maker) {
  const MutexLock lock(session_mutex);
  maker_ = maker ? std::move(maker) : make_backend;
}

void Session::set_clock(RetryClock *clock, const RetryLimits &limits) {
  const MutexLock lock(session_mutex);
  clock_ = clock == nullptr ? &RetryClock::system() : clock;
  limits_ = limits;
}

bool Session::is_handle(backup_trans_handle_h handle) const {
  return std::any_of(handles_.begin(), handles_.end(),
                     [handle](const backup_trans_handle_s &known) { return &known == handle; });
}

bool Session::is_current(unsigned generation) {
  const MutexLock lock(session_mutex);
  return generation == generation_;
}

void Session::deliver(std::function<void()> delivery) {
  deliveries_.push_back(std::move(delivery));
  // One source a delivery: a callback that runs a nested main loop holds up its own only.
  GSource *source = g_idle_source_new();
  g_source_set_priority(source, G_PRIORITY_DEFAULT);
  g_source_set_callback(
      source,
      [](gpointer session) -> gboolean {
        static_cast<Session *>(session)->deliver_one();
        return G_SOURCE_REMOVE;
      },
      this, nullptr);
  g_source_attach(source, nullptr);
  g_source_unref(source);
}

void Session::deliver_one() {
  std::function<void()> delivery;
  {
    const MutexLock lock(session_mutex);
    delivery = std::move(deliveries_.front());
    deliveries_.pop_front();
  }
  delivery();
}

// What was accepted beside a request that failed does not tell that the trouble is over.
void Session::note_cause(const Request &request, const Outcome &outcome) {
  if (!was_served(outcome)) {
    last_cause_ = cause_of(outcome);
    failed_before_ = accepted_;
  } else if (request.number > failed_before_) {
    last_cause_ = BACKUP_TRANS_CAUSE_NONE;
  }
}

void Session::end(const RequestPtr &request, Outcome outcome) {
  if (request->ended) return;
  request->ended = true;
  request->result = std::make_unique<Outcome>(std::move(outcome));
  const Outcome &result = *request->result;
  if (tells_of_store(*request, result)) note_cause(*request, result);
  if (request->waited_for) {
    ended_.notify_all();
  } else {
    deliver([request, &result] { request->call_back(result); });
  }
}

// Unless its worker comes back before.
void Session::end_soon(const RequestPtr &request) {
  GSource *source = g_timeout_source_new(kCancelPatienceMs);
  g_source_set_callback(
      source,
      [](gpointer data) -> gboolean {
        const RequestPtr &overdue = *static_cast<RequestPtr *>(data);
        Session &session = get();
        const MutexLock lock(session_mutex);
        session.end(overdue, cancelled());
        return G_SOURCE_REMOVE;
      },
      new RequestPtr(request), [](gpointer data) { delete static_cast<RequestPtr *>(data); });
  g_source_attach(source, nullptr);
  g_source_unref(source);
}

// Everything of @p handle, or of every handle.
void Session::cancel_all(backup_trans_handle_h handle) {
  cancel_those(
      [handle](const Request &request) { return handle == nullptr || request.handle() == handle; });
}

// @return whether there was one
bool Session::cancel_those(const std::function<bool(const Request &)> &concerned) {
  bool found = false;
  for (auto it = waiting_.begin(); it != waiting_.end();) {
    if (!concerned(**it)) {
      ++it;
      continue;
    }
    found = true;
    (*it)->ticket.cancel();
    end(*it, cancelled());
    it = waiting_.erase(it);
  }
  for (const RequestPtr &request : running_) {
    if (!concerned(*request) || request->ended || !request->ticket.cancel()) continue;
    found = true;
    // Its worker ends it after having tidied up; a stuck one must not keep the caller waiting.
    if (request->waited_for) {
      ended_.notify_all();
    } else {
      end_soon(request);
    }
  }
  return found;
}

bool Session::start_worker() {
  const bool started = start_background_thread(
      kWorkerName, [](void *session) { static_cast<Session *>(session)->work(); }, this);
  if (started) ++workers_;
  return started;
}

// Null: there is nothing to do, and the worker ends.
RequestPtr Session::next_request() {
  const MutexLock lock(session_mutex);
  if (waiting_.empty()) {
    --workers_;
    return nullptr;
  }
  RequestPtr request = std::move(waiting_.front());
  waiting_.pop_front();
  running_.push_back(request);
  return request;
}

Means Session::means() {
  const MutexLock lock(session_mutex);
  return {*clock_, limits_, pages_};
}

// A worker lives as long as there is something to do.
void Session::work() {
  while (const RequestPtr request = next_request()) {
    Outcome outcome = request->run(means());
    if (request->ticket.cancelled()) outcome = cancelled();
    const MutexLock lock(session_mutex);
    running_.remove(request);
    end(request, std::move(outcome));
  }
}

}  // namespace transport
