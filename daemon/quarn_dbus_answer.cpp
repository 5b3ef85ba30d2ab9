#include "quarn_dbus_answer.h"

#include <atomic>
#include <cstdint>
#include <map>
#include <set>
#include <thread>
#include <utility>
#include <vector>

#include "gio_handles.h"
#include "quarn_common.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_dbus_client.h"
#include "quarn_log.h"

namespace {

/** Milliseconds that a client may take to answer. */
constexpr int kClientTimeout = 3000000;
constexpr char kReplyFormat[] = "(i)";
/** Milliseconds between the looks whether others have waited for long enough. */
constexpr guint kPatienceCheckMs = 1000;

// None of these is ever destroyed: threads live as long as the process.

std::atomic<bool> waiting_stopped{false};
struct sent_calls {
  /** Of each callback whose answer is waited for. */
  std::set<GCancellable *> awaited QUARN_GUARDED_BY(requests_mutex);
};
sent_calls &sent = *new sent_calls;

std::atomic<callback_patience> patience{nullptr};
/** What was spent on waits that nothing else is done in. */
struct spent_time {
  Mutex mutex;
  std::int64_t waited_us QUARN_GUARDED_BY(mutex) = 0;
  /** Of the wait that stands; 0: none. */
  std::int64_t waiting_since_us QUARN_GUARDED_BY(mutex) = 0;
};
spent_time &spent = *new spent_time;

std::thread::id main_thread;
/** By client, the fibers of the main thread that wait for its answer; of all in the other. */
std::map<std::string, std::size_t> &answers_of_client = *new std::map<std::string, std::size_t>;
std::size_t answers_of_all = 0;

gboolean keep_looking(gpointer) { return G_SOURCE_CONTINUE; }

/** Counts the time of a wait that nothing else is done in. */
class TimedWait {
 public:
  TimedWait() : since_us_(g_get_monotonic_time()) {
    const MutexLock lock(spent.mutex);
    spent.waiting_since_us = since_us_;
  }
  ~TimedWait() {
    const MutexLock lock(spent.mutex);
    spent.waited_us += g_get_monotonic_time() - since_us_;
    spent.waiting_since_us = 0;
  }
  TimedWait(const TimedWait &) = delete;
  TimedWait &operator=(const TimedWait &) = delete;

 private:
  const std::int64_t since_us_;
};

}  // namespace

SentCall::SentCall(GMainContext *context)
    : context_(context), cancellable_(g_cancellable_new()), loop_(new_wait_loop()) {}

SentCall::~SentCall() {
  const MutexLock lock(requests_mutex);
  sent.awaited.erase(cancellable_.get());
}

void SentCall::send(GDBusMessage *message) {
  sent.awaited.insert(cancellable_.get());
  if (context_ != nullptr) g_main_context_push_thread_default(context_);
  auto own = std::make_unique<std::shared_ptr<SentCall>>(shared_from_this());
  g_dbus_connection_send_message_with_reply(quarn_dbus_connection, message,
                                            G_DBUS_SEND_MESSAGE_FLAGS_NONE, kClientTimeout, nullptr,
                                            cancellable_.get(), on_reply, own.release());
  if (context_ != nullptr) g_main_context_pop_thread_default(context_);
}

GVariantPtr SentCall::take_answer(GErrorPtr *error) {
  if (!result_) {
    error->reset(g_error_new_literal(G_IO_ERROR, G_IO_ERROR_CANCELLED, "the process ends"));
    return nullptr;
  }
  const MessagePtr reply(g_dbus_connection_send_message_with_reply_finish(
      quarn_dbus_connection, result_.get(), out(*error)));
  if (!reply || g_dbus_message_to_gerror(reply.get(), out(*error)) != FALSE) return nullptr;
  GVariant *body = g_dbus_message_get_body(reply.get());
  return GVariantPtr(body == nullptr ? g_variant_ref_sink(g_variant_new_tuple(nullptr, 0))
                                     : g_variant_ref(body));
}

void SentCall::on_reply(GObject *, GAsyncResult *result, gpointer data) {
  const std::unique_ptr<std::shared_ptr<SentCall>> call(
      static_cast<std::shared_ptr<SentCall> *>(data));
  (*call)->result_.reset(G_ASYNC_RESULT(g_object_ref(result)));
  g_main_loop_quit((*call)->loop_.get());
}

int result_of(SentCall *call) {
  GErrorPtr error;
  const GVariantPtr reply = call->take_answer(&error);
  if (error) {
    LOGE("g_dbus_connection_call_sync() Fail(%s)", error->message);
    return QUARN_FAILED;
  }
  if (!reply || g_variant_is_of_type(reply.get(), G_VARIANT_TYPE(kReplyFormat)) == FALSE) {
    LOGE("g_dbus_connection_call_sync 'Launch' error");
    return QUARN_FAILED;
  }
  gint32 result = QUARN_FAILED;
  g_variant_get(reply.get(), kReplyFormat, &result);
  return result;
}

AwaitedAnswer::AwaitedAnswer(std::string client, bool of_request) : client_(std::move(client)) {
  ++answers_of_client[client_];
  ++answers_of_all;
  if (of_request) pending_.emplace();
}

AwaitedAnswer::~AwaitedAnswer() {
  const auto entry = answers_of_client.find(client_);
  if (--entry->second == 0) answers_of_client.erase(entry);
  --answers_of_all;
}

bool AwaitedAnswer::may_begin(const std::string &client) {
  const auto entry = answers_of_client.find(client);
  return answers_of_all < kMostAnswersAwaited &&
         (entry == answers_of_client.end() || entry->second < kMostAnswersOfClient);
}

bool is_main_thread() { return std::this_thread::get_id() == main_thread; }

void wait_in_place(SentCall *call, GMainContext *context, const std::string &sender) {
  const TimedWait timed;
  const SourcePtr look(g_timeout_source_new(kPatienceCheckMs));
  g_source_set_callback(look.get(), keep_looking, nullptr, nullptr);
  g_source_attach(look.get(), context);
  g_main_context_push_thread_default(context);
  bool given_up = false;
  while (!call->is_answered()) {
    const callback_patience exhausted = patience;
    if (!given_up && exhausted != nullptr && exhausted(sender)) {
      LOGE("(%s) does not answer its callback : others go on", sender.c_str());
      given_up = true;
      call->give_up();
    }
    if (!call->is_answered()) g_main_context_iteration(context, TRUE);
  }
  g_main_context_pop_thread_default(context);
  g_source_destroy(look.get());
}

void quarn_dbus_stop_waiting() {
  std::vector<CancellablePtr> standing;
  {
    const MutexLock lock(requests_mutex);
    waiting_stopped = true;
    for (GCancellable *call : sent.awaited)
      standing.emplace_back(G_CANCELLABLE(g_object_ref(call)));
  }
  for (const CancellablePtr &call : standing) g_cancellable_cancel(call.get());
}

void quarn_dbus_note_main_thread() { main_thread = std::this_thread::get_id(); }

void quarn_dbus_set_patience(callback_patience exhausted) { patience = exhausted; }

std::int64_t quarn_dbus_time_waited() {
  const MutexLock lock(spent.mutex);
  const std::int64_t since = spent.waiting_since_us;
  return spent.waited_us + (since == 0 ? 0 : g_get_monotonic_time() - since);
}

bool quarn_dbus_waiting_stopped() { return waiting_stopped; }
