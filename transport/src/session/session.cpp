#include "session/session.h"

#include <glib.h>
#include <pthread.h>
#include <signal.h>
#include <sys/prctl.h>

#include <algorithm>
#include <cerrno>
#include <condition_variable>
#include <deque>
#include <list>
#include <map>
#include <mutex>
#include <utility>

#include "backup_transport.h"
#include "core/remote_path.h"
#include "session/check.h"
#include "session/listing_pages.h"
#include "stores/make_backend.h"

struct backup_trans_handle_s {
  struct Basis {
    transport::Version version;
    std::weak_ptr<transport::Backend> store;
  };

  unsigned generation = 0;
  // What the next upload to a path replaces; guarded by the session's mutex.
  std::map<std::string, Basis> bases;
};

namespace transport {
namespace {

using Lock = std::unique_lock<std::mutex>;

constexpr char kDefaultContentType[] = "application/octet-stream";
constexpr std::size_t kMaxContentTypeBytes = 255;
constexpr std::size_t kWorkerStackBytes = 1024 * 1024;
// A worker that does not come back by then is left behind, and the callback goes ahead.
constexpr guint kCancelPatienceMs = 500;

enum class Kind { download, upload, list, remove_folder, check };

struct Result {
  Outcome outcome;
  ObjectInfo info;
  ListPage page;
};

struct Request {
  Kind kind = Kind::download;
  backup_trans_handle_h handle = nullptr;
  std::shared_ptr<Backend> backend;
  std::string path;
  LocalTarget target;
  LocalSource source;
  bool basis = false;
  int64_t timestamp_ms = 0;
  std::string content_type;
  int start = 0;
  int count = 0;

  void *user_data = nullptr;
  backup_trans_download_cb download_cb = nullptr;
  backup_trans_upload_cb upload_cb = nullptr;
  backup_trans_child_list_cb list_cb = nullptr;
  backup_trans_delete_cb delete_cb = nullptr;
  backup_trans_check_cb check_cb = nullptr;
  bool waited_for = false;  // by a caller, instead of a callback

  Ticket ticket;
  // Guarded by the session's mutex.
  std::uint64_t number = 0;  // in the order of their acceptance
  bool ended = false;
  std::unique_ptr<Result> result;  // once it has ended: thousands may wait
};

using RequestPtr = std::shared_ptr<Request>;

backup_trans_file_info_s public_info(const ObjectInfo &info) {
  return {info.path.c_str(), info.is_file, info.size, info.timestamp_ms};
}

std::string description(const Outcome &outcome) {
  if (outcome.ok()) return "objects can be put there, read and removed";
  return outcome.said.empty() ? outcome.message : outcome.message + " (" + outcome.said + ")";
}

/** Does the end of a request tell of the store, and not of the device or its user? */
bool tells_of_store(const Request &request) {
  const backup_trans_error_code code = request.result->outcome.code;
  return !request.ticket.cancelled() && code != BACKUP_TRANS_ERROR_CANCELLED &&
         code != BACKUP_TRANS_ERROR_LOCAL_FILE;
}

bool was_served(const Outcome &outcome) {
  return outcome.ok() || outcome.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT ||
         outcome.code == BACKUP_TRANS_ERROR_CONFLICT;
}

void call_back(const Request &request) {
  const Outcome &outcome = request.result->outcome;
  switch (request.kind) {
    case Kind::download: {
      std::string message = outcome.message;
      request.download_cb(outcome.code, request.user_data, outcome.ok() ? nullptr : message.data());
      break;
    }
    case Kind::upload: {
      const backup_trans_file_info_s info = public_info(request.result->info);
      request.upload_cb(outcome.code, request.user_data, outcome.ok() ? &info : nullptr);
      break;
    }
    case Kind::list: {
      std::vector<backup_trans_file_info_s> children;
      for (const ObjectInfo &child : request.result->page.children)
        children.push_back(public_info(child));
      const backup_trans_child_list_s list = {children.data(), static_cast<int>(children.size()),
                                              request.result->page.more};
      request.list_cb(outcome.code, request.user_data, outcome.ok() ? &list : nullptr);
      break;
    }
    case Kind::remove_folder: {
      const backup_trans_file_info_s info = {request.path.c_str(), false, 0, 0};
      request.delete_cb(outcome.code, request.user_data, &info);
      break;
    }
    case Kind::check: {
      const std::string message = description(outcome);
      request.check_cb(outcome.code, request.user_data, cause_of(outcome), message.c_str());
      break;
    }
  }
}

bool is_content_type(const std::string &text) {
  return text.size() <= kMaxContentTypeBytes &&
         std::all_of(text.begin(), text.end(), [](char c) { return c >= ' ' && c <= '~'; });
}

class Session {
 public:
  // Never destroyed: workers may still run while the process exits.
  static Session &get() {
    static Session *const session = new Session;
    return *session;
  }

  int init(void *user_data, backup_trans_init_cb callback) {
    if (callback == nullptr) return BACKUP_TRANS_ERROR_ARGUMENT;
    const Lock lock(mutex_);
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

  void deinit() {
    const Lock lock(mutex_);
    if (!config_) return;
    ++generation_;
    config_.reset();
    backend_.reset();
    pages_.forget();
    cancel_all(nullptr);
  }

  backup_trans_handle_h create_handle() {
    const Lock lock(mutex_);
    if (!config_) return nullptr;
    handles_.emplace_back();
    handles_.back().generation = generation_;
    return &handles_.back();
  }

  void cancel(backup_trans_handle_h handle) {
    const Lock lock(mutex_);
    if (is_handle(handle)) cancel_all(handle);
  }

  bool abort(backup_trans_handle_h handle, const void *user_data) {
    const Lock lock(mutex_);
    if (!is_handle(handle) || user_data == nullptr) return false;
    return cancel_those([&](const RequestPtr &request) {
      return request->handle == handle && request->user_data == user_data;
    });
  }

  // The store that serves a request made now; null with the code of the refusal.
  std::shared_ptr<Backend> store_for(backup_trans_handle_h handle, int *code) {
    const Lock lock(mutex_);
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

  int accept(const RequestPtr &request) {
    const Lock lock(mutex_);
    // The session may have ended while the request's file was opened.
    if (!config_ || request->handle->generation != generation_)
      return BACKUP_TRANS_ERROR_NOT_INITIALIZED;
    request->number = ++accepted_;
    waiting_.push_back(request);
    if (workers_ < BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS && !start_worker() && workers_ == 0) {
      waiting_.pop_back();
      return BACKUP_TRANS_ERROR_SERVER;
    }
    return BACKUP_TRANS_ERROR_NONE;
  }

  backup_trans_cause last_cause() {
    const Lock lock(mutex_);
    return last_cause_;
  }

  int wait_for(const RequestPtr &request) {
    Lock lock(mutex_);
    ended_.wait(lock, [&] { return request->ended || request->ticket.cancelled(); });
    ended_.wait_for(lock, std::chrono::milliseconds(kCancelPatienceMs),
                    [&] { return request->ended; });
    if (!request->ended) end(request, Result{cancelled(), {}, {}});
    return request->result->outcome.code;
  }

  void set_maker(BackendMaker maker) {
    const Lock lock(mutex_);
    maker_ = maker ? std::move(maker) : make_backend;
  }

  void set_clock(RetryClock *clock, const RetryLimits &limits) {
    const Lock lock(mutex_);
    clock_ = clock == nullptr ? &RetryClock::system() : clock;
    limits_ = limits;
  }

 private:
  Session() : maker_(make_backend), clock_(&RetryClock::system()) {}

  bool is_handle(backup_trans_handle_h handle) const {
    return std::any_of(handles_.begin(), handles_.end(),
                       [handle](const backup_trans_handle_s &known) { return &known == handle; });
  }

  bool is_current(unsigned generation) {
    const Lock lock(mutex_);
    return generation == generation_;
  }

  // Functions below are called with the mutex held.

  void deliver(std::function<void()> delivery) {
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

  void deliver_one() {
    std::function<void()> delivery;
    {
      const Lock lock(mutex_);
      delivery = std::move(deliveries_.front());
      deliveries_.pop_front();
    }
    delivery();
  }

  // What was accepted beside a request that failed does not tell that the trouble is over.
  void note_cause(const Request &request, const Outcome &outcome) {
    if (!was_served(outcome)) {
      last_cause_ = cause_of(outcome);
      failed_before_ = accepted_;
    } else if (request.number > failed_before_) {
      last_cause_ = BACKUP_TRANS_CAUSE_NONE;
    }
  }

  void end(const RequestPtr &request, Result result) {
    if (request->ended) return;
    request->ended = true;
    request->result = std::make_unique<Result>(std::move(result));
    const Outcome &outcome = request->result->outcome;
    if (tells_of_store(*request)) note_cause(*request, outcome);
    if (request->waited_for) {
      ended_.notify_all();
    } else {
      deliver([request] { call_back(*request); });
    }
  }

  void end_later_at_the_latest(const RequestPtr &request) {
    GSource *source = g_timeout_source_new(kCancelPatienceMs);
    g_source_set_callback(
        source,
        [](gpointer data) -> gboolean {
          const RequestPtr &overdue = *static_cast<RequestPtr *>(data);
          Session &session = get();
          const Lock lock(session.mutex_);
          session.end(overdue, Result{cancelled(), {}, {}});
          return G_SOURCE_REMOVE;
        },
        new RequestPtr(request), [](gpointer data) { delete static_cast<RequestPtr *>(data); });
    g_source_attach(source, nullptr);
    g_source_unref(source);
  }

  // Everything of @p handle, or of every handle.
  void cancel_all(backup_trans_handle_h handle) {
    cancel_those([handle](const RequestPtr &request) {
      return handle == nullptr || request->handle == handle;
    });
  }

  // @return whether there was one
  bool cancel_those(const std::function<bool(const RequestPtr &)> &concerned) {
    bool found = false;
    for (auto it = waiting_.begin(); it != waiting_.end();) {
      if (!concerned(*it)) {
        ++it;
        continue;
      }
      found = true;
      (*it)->ticket.cancel();
      end(*it, Result{cancelled(), {}, {}});
      it = waiting_.erase(it);
    }
    for (const RequestPtr &request : running_) {
      if (!concerned(request) || request->ended || !request->ticket.cancel()) continue;
      found = true;
      // Its worker ends it after having tidied up; a stuck one must not keep the caller waiting.
      if (request->waited_for) {
        ended_.notify_all();
      } else {
        end_later_at_the_latest(request);
      }
    }
    return found;
  }

  bool start_worker() {
    pthread_attr_t attributes;
    pthread_attr_init(&attributes);
    pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
    pthread_attr_setstacksize(&attributes, kWorkerStackBytes);
    // The process's signals are for its main thread.
    sigset_t all;
    sigset_t before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before);
    pthread_t thread;
    const int error = pthread_create(
        &thread, &attributes,
        [](void *session) -> void * {
          prctl(PR_SET_NAME, kWorkerName);
          static_cast<Session *>(session)->work();
          return nullptr;
        },
        this);
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    pthread_attr_destroy(&attributes);
    if (error == 0) ++workers_;
    return error == 0;
  }

  // Functions below are called without the mutex.

  // A worker lives as long as there is something to do.
  void work() {
    for (;;) {
      RequestPtr request;
      {
        const Lock lock(mutex_);
        if (waiting_.empty()) {
          --workers_;
          return;
        }
        request = std::move(waiting_.front());
        waiting_.pop_front();
        running_.push_back(request);
      }
      Result result;
      result.outcome = run(*request, &result);
      if (request->ticket.cancelled()) result = Result{cancelled(), {}, {}};
      request->target.discard();
      const Lock lock(mutex_);
      running_.remove(request);
      end(request, std::move(result));
    }
  }

  Outcome run(Request &request, Result *result) {
    RetryClock *clock = nullptr;
    RetryLimits limits;
    {
      const Lock lock(mutex_);
      clock = clock_;
      limits = limits_;
    }
    Attempt attempt{request.ticket, 0, {}};
    const auto retried = [&](const std::function<Outcome()> &once) {
      return run_with_retries(request.ticket, *clock, limits, [&](int number) {
        attempt.number = number;
        return once();
      });
    };
    switch (request.kind) {
      case Kind::download:
        return download(request, &attempt, retried);
      case Kind::upload:
        return upload(request, &attempt, result, retried);
      case Kind::list:
        return retried([&] { return list(request, &attempt, clock->now(), &result->page); });
      case Kind::remove_folder: {
        const Outcome removed =
            retried([&] { return request.backend->remove_folder(attempt, request.path); });
        pages_.forget();
        return removed;
      }
      case Kind::check:
        return check_store(request.ticket, *request.backend);
    }
    return failure(BACKUP_TRANS_ERROR_ARGUMENT, "no such request");
  }

  template <typename Retried>
  Outcome download(Request &request, Attempt *attempt, const Retried &retried) {
    Version found;
    Outcome outcome = retried([&] {
      return request.backend->download(*attempt, request.path, request.target,
                                       request.basis ? &found : nullptr);
    });
    const bool known = outcome.ok() || outcome.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT;
    if (request.basis && known) {
      const Lock lock(mutex_);
      request.handle->bases[request.path] = {std::move(found), request.backend};
    }
    return outcome;
  }

  template <typename Retried>
  Outcome upload(Request &request, Attempt *attempt, Result *result, const Retried &retried) {
    std::optional<backup_trans_handle_s::Basis> basis;
    {
      const Lock lock(mutex_);
      const auto it = request.handle->bases.find(request.path);
      if (it != request.handle->bases.end()) {
        basis = std::move(it->second);
        request.handle->bases.erase(it);
      }
    }
    if (basis && basis->store.lock() != request.backend)
      return failure(BACKUP_TRANS_ERROR_CONFLICT, "the object was read from another store");
    const Upload upload{request.path, request.source, request.timestamp_ms, request.content_type,
                        basis ? &basis->version : nullptr};
    const Outcome uploaded =
        retried([&] { return request.backend->upload(*attempt, upload, &result->info); });
    pages_.forget();
    return uploaded;
  }

  Outcome list(const Request &request, Attempt *attempt, RetryClock::Point now, ListPage *page) {
    *page = {};
    return pages_.get(
        {request.backend, request.path, request.start, request.count}, now,
        [&](int start, int count, ListPage *read) {
          return request.backend->list(*attempt, request.path, start, count, read);
        },
        page);
  }

  std::mutex mutex_;
  std::condition_variable ended_;
  BackendMaker maker_;
  RetryClock *clock_;
  RetryLimits limits_;
  unsigned generation_ = 0;
  std::unique_ptr<ConfigFile> config_;  // null: not initialised
  Config served_;                       // what backend_ was made for
  std::shared_ptr<Backend> backend_;
  ListingPages pages_;
  std::list<backup_trans_handle_s> handles_;
  std::deque<RequestPtr> waiting_;
  std::list<RequestPtr> running_;
  std::deque<std::function<void()>> deliveries_;
  int workers_ = 0;
  std::uint64_t accepted_ = 0;       // requests so far
  std::uint64_t failed_before_ = 0;  // of them, when one was not served
  backup_trans_cause last_cause_ = BACKUP_TRANS_CAUSE_NONE;
};

RequestPtr new_request(Kind kind, backup_trans_handle_h handle, std::shared_ptr<Backend> backend,
                       void *user_data) {
  auto request = std::make_shared<Request>();
  request->kind = kind;
  request->handle = handle;
  request->backend = std::move(backend);
  request->user_data = user_data;
  return request;
}

int new_download(backup_trans_handle_h handle, const char *remote_path, const char *local_path,
                 int options, RequestPtr *request) {
  int code = BACKUP_TRANS_ERROR_NONE;
  std::shared_ptr<Backend> backend = Session::get().store_for(handle, &code);
  if (!backend) return code;
  const bool options_known =
      options == BACKUP_TRANS_OPTION_NONE || options == BACKUP_TRANS_OPTION_BASIS;
  if (!is_object_path(remote_path) || local_path == nullptr || local_path[0] == '\0' ||
      !options_known)
    return BACKUP_TRANS_ERROR_ARGUMENT;
  *request = new_request(Kind::download, handle, std::move(backend), nullptr);
  (*request)->path = remote_path;
  (*request)->basis = options == BACKUP_TRANS_OPTION_BASIS;
  if (!(*request)->target.open(local_path)) return BACKUP_TRANS_ERROR_LOCAL_FILE;
  return BACKUP_TRANS_ERROR_NONE;
}

}  // namespace

void set_backend_maker(BackendMaker maker) { Session::get().set_maker(std::move(maker)); }

void set_retry_clock(RetryClock *clock, const RetryLimits &limits) {
  Session::get().set_clock(clock, limits);
}

}  // namespace transport

using transport::Kind;
using transport::RequestPtr;
using transport::Session;

extern "C" {

int backup_trans_init(void *user_data, backup_trans_init_cb callback) {
  return Session::get().init(user_data, callback);
}

void backup_trans_deinit(void) { Session::get().deinit(); }

backup_trans_handle_h backup_trans_create_handle(void) { return Session::get().create_handle(); }

int backup_trans_download_file_ors_async(backup_trans_handle_h handle, const char *remote_path,
                                         const char *local_path, void *user_data,
                                         backup_trans_download_cb callback, int options) {
  return backup_trans_download_limited_ors_async(handle, remote_path, local_path, user_data,
                                                 callback, options, 0);
}

int backup_trans_download_limited_ors_async(backup_trans_handle_h handle, const char *remote_path,
                                            const char *local_path, void *user_data,
                                            backup_trans_download_cb callback, int options,
                                            uint64_t max_size) {
  RequestPtr request;
  const int code = transport::new_download(handle, remote_path, local_path, options, &request);
  if (code != BACKUP_TRANS_ERROR_NONE) return code;
  if (callback == nullptr) return BACKUP_TRANS_ERROR_ARGUMENT;
  request->user_data = user_data;
  request->download_cb = callback;
  request->target.set_limit(max_size);
  return Session::get().accept(request);
}

int backup_trans_download_file_ors(backup_trans_handle_h handle, const char *remote_path,
                                   const char *local_path, int options) {
  return backup_trans_download_limited_ors(handle, remote_path, local_path, options, 0);
}

int backup_trans_download_limited_ors(backup_trans_handle_h handle, const char *remote_path,
                                      const char *local_path, int options, uint64_t max_size) {
  RequestPtr request;
  int code = transport::new_download(handle, remote_path, local_path, options, &request);
  if (code != BACKUP_TRANS_ERROR_NONE) return code;
  request->waited_for = true;
  request->target.set_limit(max_size);
  code = Session::get().accept(request);
  return code == BACKUP_TRANS_ERROR_NONE ? Session::get().wait_for(request) : code;
}

int backup_trans_upload_file_ors_async(backup_trans_handle_h handle, const char *local_path,
                                       const char *remote_path, backup_trans_upload_cb callback,
                                       int64_t timestamp_ms, int options, void *user_data,
                                       const char *content_type) {
  int code = BACKUP_TRANS_ERROR_NONE;
  auto backend = Session::get().store_for(handle, &code);
  if (!backend) return code;
  const std::string type = content_type == nullptr ? transport::kDefaultContentType : content_type;
  if (callback == nullptr || local_path == nullptr || local_path[0] == '\0' || timestamp_ms < 0 ||
      options != BACKUP_TRANS_OPTION_NONE || !transport::is_object_path(remote_path) ||
      !transport::is_content_type(type))
    return BACKUP_TRANS_ERROR_ARGUMENT;
  const RequestPtr request =
      transport::new_request(Kind::upload, handle, std::move(backend), user_data);
  request->path = remote_path;
  request->upload_cb = callback;
  request->timestamp_ms = timestamp_ms;
  request->content_type = type;
  if (!request->source.open(local_path)) return BACKUP_TRANS_ERROR_LOCAL_FILE;
  return Session::get().accept(request);
}

int backup_trans_get_folder_child_list_async(backup_trans_handle_h handle, const char *folder_path,
                                             int start, int count, int options, void *user_data,
                                             backup_trans_child_list_cb callback) {
  int code = BACKUP_TRANS_ERROR_NONE;
  auto backend = Session::get().store_for(handle, &code);
  if (!backend) return code;
  std::string folder;
  if (callback == nullptr || start < 0 || count < 1 || count > BACKUP_TRANS_MAX_LIST_COUNT ||
      options != BACKUP_TRANS_OPTION_NONE || !transport::parse_folder_path(folder_path, &folder))
    return BACKUP_TRANS_ERROR_ARGUMENT;
  const RequestPtr request =
      transport::new_request(Kind::list, handle, std::move(backend), user_data);
  request->path = std::move(folder);
  request->list_cb = callback;
  request->start = start;
  request->count = count;
  return Session::get().accept(request);
}

int backup_trans_delete_folder_ors_async(backup_trans_handle_h handle, const char *folder_path,
                                         void *user_data, backup_trans_delete_cb callback) {
  int code = BACKUP_TRANS_ERROR_NONE;
  auto backend = Session::get().store_for(handle, &code);
  if (!backend) return code;
  std::string folder;
  if (callback == nullptr || !transport::parse_folder_path(folder_path, &folder) || folder.empty())
    return BACKUP_TRANS_ERROR_ARGUMENT;
  const RequestPtr request =
      transport::new_request(Kind::remove_folder, handle, std::move(backend), user_data);
  request->path = std::move(folder);
  request->delete_cb = callback;
  return Session::get().accept(request);
}

int backup_trans_check_async(backup_trans_handle_h handle, void *user_data,
                             backup_trans_check_cb callback) {
  int code = BACKUP_TRANS_ERROR_NONE;
  auto backend = Session::get().store_for(handle, &code);
  if (!backend) return code;
  if (callback == nullptr) return BACKUP_TRANS_ERROR_ARGUMENT;
  const RequestPtr request =
      transport::new_request(Kind::check, handle, std::move(backend), user_data);
  request->check_cb = callback;
  return Session::get().accept(request);
}

backup_trans_cause backup_trans_last_cause(void) { return Session::get().last_cause(); }

void backup_trans_cancel_request(backup_trans_handle_h handle) { Session::get().cancel(handle); }

int backup_trans_abort_request(backup_trans_handle_h handle, void *user_data) {
  return Session::get().abort(handle, user_data) ? BACKUP_TRANS_ERROR_NONE
                                                 : BACKUP_TRANS_ERROR_ARGUMENT;
}

const char *backup_trans_error_text(backup_trans_error_code error) {
  switch (error) {
    case BACKUP_TRANS_ERROR_NONE:
      return "success";
    case BACKUP_TRANS_ERROR_ARGUMENT:
      return "the request cannot be made like this";
    case BACKUP_TRANS_ERROR_NOT_INITIALIZED:
      return "no cloud is set up";
    case BACKUP_TRANS_ERROR_AUTHENTICATION:
      return "the cloud refused the user name or password";
    case BACKUP_TRANS_ERROR_NETWORK:
      return "the cloud cannot be reached";
    case BACKUP_TRANS_ERROR_NO_SUCH_OBJECT:
      return "not in the cloud";
    case BACKUP_TRANS_ERROR_QUOTA:
      return "the cloud is full";
    case BACKUP_TRANS_ERROR_CONFLICT:
      return "changed in the cloud meanwhile";
    case BACKUP_TRANS_ERROR_CANCELLED:
      return "cancelled";
    case BACKUP_TRANS_ERROR_SERVER:
      return "the cloud answered with an error";
    case BACKUP_TRANS_ERROR_LOCAL_FILE:
      return "a file on the device cannot be read or written";
    case BACKUP_TRANS_ERROR_CERTIFICATE:
      return "the server is not the one it says it is";
    case BACKUP_TRANS_ERROR_TOO_LARGE:
      return "larger than it may be";
  }
  return "unknown error";
}

const char *backup_trans_cause_word(backup_trans_cause cause) {
  switch (cause) {
    case BACKUP_TRANS_CAUSE_NONE:
      return "ok";
    case BACKUP_TRANS_CAUSE_ADDRESS:
      return "address";
    case BACKUP_TRANS_CAUSE_CERTIFICATE:
      return "certificate";
    case BACKUP_TRANS_CAUSE_PASSWORD:
      return "password";
    case BACKUP_TRANS_CAUSE_SPACE:
      return "space";
    case BACKUP_TRANS_CAUSE_NETWORK:
      return "network";
    case BACKUP_TRANS_CAUSE_SERVER:
      return "server";
    case BACKUP_TRANS_CAUSE_DEVICE:
      return "device";
  }
  return "unknown";
}

}  // extern "C"
