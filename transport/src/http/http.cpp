#include "http/http.h"

#include <glib.h>

#include <condition_variable>
#include <deque>
#include <list>
#include <memory>

#include "core/background_thread.h"
#include "http/exchange.h"
#include "http/library.h"
#include "http/xml_answer.h"
#include "thread_annotations.h"

namespace transport {
namespace {

using Clock = std::chrono::steady_clock;

constexpr char kThreadName[] = "cloud-transport";
constexpr int kIdleMs = 15000;
constexpr std::chrono::seconds kExitPatience{2};

class Engine {
 public:
  // Never destroyed: see stop_at_exit().
  static Engine &get() {
    static Engine *const engine = new Engine;
    return *engine;
  }

  HttpAnswer perform(Ticket &ticket, const HttpRequest &request) {
    auto exchange = std::make_shared<Exchange>();
    exchange->request = &request;
    ticket.set_waker([this, exchange] {
      const MutexLock lock(engine_mutex);
      exchange->unwanted = true;
      if (multi_ != nullptr) curl_.multi_wakeup(multi_);
    });
    if (ticket.cancelled()) {
      ticket.set_waker(nullptr);
      exchange->answer.problem = cancelled();
      return exchange->answer;
    }
    if (const char *missing = xml_missing_for_answers()) {
      ticket.set_waker(nullptr);
      exchange->answer.problem =
          failure(BACKUP_TRANS_ERROR_NETWORK, std::string(missing) + " cannot be loaded");
      return std::move(exchange->answer);
    }
    {
      MutexLock lock(engine_mutex);
      if (start()) {
        incoming_.push_back(exchange);
        curl_.multi_wakeup(multi_);
        finished_.wait(lock.waiting(),
                       [&]() QUARN_REQUIRES(engine_mutex) { return exchange->done; });
      } else {
        exchange->answer.problem = failure(
            BACKUP_TRANS_ERROR_NETWORK, loaded_ ? "the HTTP library cannot be started"
                                                : std::string(kHttpLibrary) + " cannot be loaded");
      }
    }
    ticket.set_waker(nullptr);
    if (ticket.cancelled()) exchange->answer.problem = cancelled();
    return std::move(exchange->answer);
  }

  void set_clock(RetryClock *clock) {
    const MutexLock lock(engine_mutex);
    clock_ = clock == nullptr ? &RetryClock::system() : clock;
  }

  RetryClock *clock() {
    const MutexLock lock(engine_mutex);
    return clock_;
  }

  void prepare() {
    const MutexLock lock(engine_mutex);
    load_library();
  }

  void wake() {
    MutexLock lock(engine_mutex);
    if (!running_) return;
    const unsigned wanted = begun_rounds_ + 1;
    curl_.multi_wakeup(multi_);
    finished_.wait(lock.waiting(), [&]() QUARN_REQUIRES(engine_mutex) {
      return !running_ || ended_rounds_ >= wanted;
    });
  }

 private:
  Engine() = default;

  bool load_library() QUARN_REQUIRES(engine_mutex) {
    if (loaded_) return true;
    loaded_ = load_http_library(&curl_);
    if (!loaded_ && !told_) g_warning("cloud transport: %s cannot be loaded", kHttpLibrary);
    told_ = true;
    // After the TLS library's own handler was registered, thus to run before it.
    if (loaded_) std::atexit([] { get().stop_at_exit(); });
    return loaded_;
  }

  bool start() QUARN_REQUIRES(engine_mutex) {
    if (running_) return true;
    if (!load_library() || stopping_) return false;
    if (multi_ == nullptr) {
      multi_ = curl_.multi_init();
      if (multi_ == nullptr) return false;
      curl_.multi_setopt(multi_, CURLMOPT_PIPELINING, CURLPIPE_MULTIPLEX);
      // By itself it closes connections when few transfers are left, to make others soon after.
      curl_.multi_setopt(multi_, CURLMOPT_MAXCONNECTS,
                         static_cast<long>(BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS));
    }
    running_ = start_background_thread(
        kThreadName, [](void *engine) { static_cast<Engine *>(engine)->run(); }, this);
    return running_;
  }

  // Nothing may be inside the TLS library when the process takes it down.
  void stop_at_exit() {
    MutexLock lock(engine_mutex);
    stopping_ = true;
    if (!running_) return;
    curl_.multi_wakeup(multi_);
    finished_.wait_for(lock.waiting(), kExitPatience,
                       [this]() QUARN_REQUIRES(engine_mutex) { return !running_; });
  }

  void run() {
    std::list<ExchangePtr> active;
    CURLM *multi = nullptr;  // only this thread does away with it
    Clock::time_point now;
    while (begin_round(&active, &multi, &now)) {
      int still_running = 0;
      curl_.multi_perform(multi, &still_running);
      collect(multi, &active);
      int patience = kIdleMs;
      for (auto it = active.begin(); it != active.end();) {
        const ExchangePtr exchange = *it++;
        note_progress(curl_, sockets_, now, exchange.get());
        if (is_overdue(now, exchange.get(), &patience)) give_up(exchange, &active);
      }
      end_round();
      int events = 0;
      curl_.multi_poll(multi, nullptr, 0, patience, &events);
      if (active.empty() && events == 0 && stops_when_idle()) return;
    }
  }

  // Takes what was asked for, and drops what nobody wants any more. False when the thread shall
  // end.
  bool begin_round(std::list<ExchangePtr> *active, CURLM **multi, Clock::time_point *now) {
    const MutexLock lock(engine_mutex);
    // From before the bytes are moved, so that none which came in time counts as missing.
    *now = clock_->now();
    *multi = multi_;
    ++begun_rounds_;
    if (stopping_) {
      running_ = false;
      finished_.notify_all();
      return false;
    }
    for (const ExchangePtr &exchange : incoming_) {
      begin(*exchange, *now);
      active->push_back(exchange);
    }
    incoming_.clear();
    for (auto it = active->begin(); it != active->end();) {
      if ((*it)->unwanted) end(**it);
      it = (*it)->done ? active->erase(it) : std::next(it);
    }
    return true;
  }

  void end_round() {
    const MutexLock lock(engine_mutex);
    ended_rounds_ = begun_rounds_;
    finished_.notify_all();
  }

  // Whether nothing was asked for so long that the thread ends, with its connections.
  bool stops_when_idle() {
    const MutexLock lock(engine_mutex);
    const bool idle_over = Clock::now() - last_end_ >= std::chrono::milliseconds(kIdleMs);
    if (!incoming_.empty() || !idle_over) return false;
    curl_.multi_cleanup(multi_);
    multi_ = nullptr;
    running_ = false;
    finished_.notify_all();
    return true;
  }

  void give_up(const ExchangePtr &exchange, std::list<ExchangePtr> *active) {
    exchange->answer.problem =
        failure(BACKUP_TRANS_ERROR_NETWORK,
                exchange->rate.is_kept() ? "the server went silent" : "the server is too slow");
    exchange->answer.problem.transient = true;
    const MutexLock lock(engine_mutex);
    end(*exchange);
    active->remove(exchange);
  }

  // On the transport thread, as what follows.
  void begin(Exchange &exchange, Clock::time_point now) QUARN_REQUIRES(engine_mutex) {
    exchange.began_at = now;
    exchange.moved_at = now;
    exchange.rate.begin(now);
    transport::prepare(curl_, &sockets_, &exchange);
    curl_.multi_add_handle(multi_, exchange.easy);
  }

  void end(Exchange &exchange) QUARN_REQUIRES(engine_mutex) {
    if (exchange.done) return;
    curl_.multi_remove_handle(multi_, exchange.easy);
    curl_.easy_cleanup(exchange.easy);
    curl_.slist_free_all(exchange.headers);
    exchange.done = true;
    last_end_ = Clock::now();
    finished_.notify_all();
  }

  void collect(CURLM *multi, std::list<ExchangePtr> *active) {
    int left = 0;
    while (CURLMsg *message = curl_.multi_info_read(multi, &left)) {
      if (message->msg != CURLMSG_DONE) continue;
      const CURLcode code = message->data.result;
      char *data = nullptr;
      curl_.easy_getinfo(message->easy_handle, CURLINFO_PRIVATE, &data);
      Exchange &exchange = *reinterpret_cast<Exchange *>(data);
      exchange.answer.problem = problem_of(curl_, exchange, code);
      if (gives_away(*exchange.request, exchange.answer.reason)) exchange.answer.reason.clear();
      const MutexLock lock(engine_mutex);
      end(exchange);
      active->remove_if([&](const ExchangePtr &other) { return other.get() == &exchange; });
    }
  }

  std::condition_variable finished_;
  Curl curl_;        // once loaded_, the same for good
  Sockets sockets_;  // the transport thread's own
  CURLM *multi_ QUARN_GUARDED_BY(engine_mutex) = nullptr;
  bool loaded_ QUARN_GUARDED_BY(engine_mutex) = false;
  bool told_ QUARN_GUARDED_BY(engine_mutex) = false;  // that it could not be loaded
  bool running_ QUARN_GUARDED_BY(engine_mutex) = false;
  bool stopping_ QUARN_GUARDED_BY(engine_mutex) = false;
  std::deque<ExchangePtr> incoming_ QUARN_GUARDED_BY(engine_mutex);
  Clock::time_point last_end_ QUARN_GUARDED_BY(engine_mutex);
  unsigned begun_rounds_ QUARN_GUARDED_BY(engine_mutex) = 0;
  unsigned ended_rounds_ QUARN_GUARDED_BY(engine_mutex) = 0;
  RetryClock *clock_ QUARN_GUARDED_BY(engine_mutex) = &RetryClock::system();
};

}  // namespace

HttpAnswer http_perform(Ticket &ticket, const HttpRequest &request) {
  return Engine::get().perform(ticket, request);
}

bool http_pause(Ticket &ticket, std::chrono::milliseconds duration) {
  return Engine::get().clock()->pause(ticket, duration);
}

RetryClock::Point http_now() { return Engine::get().clock()->now(); }

void set_http_clock(RetryClock *clock) { Engine::get().set_clock(clock); }

void prepare_http() { Engine::get().prepare(); }

void wake_http() { Engine::get().wake(); }

}  // namespace transport
