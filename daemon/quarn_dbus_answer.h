/**
 * @file quarn_dbus_answer.h
 * @brief The answers of clients to their callbacks: who waits for them, where, and for how long.
 *
 * The functions of quarn_dbus_client.h about waiting are served here.
 */
#ifndef QUARN_DBUS_ANSWER_H
#define QUARN_DBUS_ANSWER_H

#include <gio/gio.h>

#include <memory>
#include <optional>
#include <string>

#include "glib_handles.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_dbus_accepted.h"
#include "thread_annotations.h"

using CancellablePtr = Handle<GCancellable, &g_object_unref>;
using ContextPtr = Handle<GMainContext, &g_main_context_unref>;
using ResultPtr = Handle<GAsyncResult, &g_object_unref>;
using SourcePtr = Handle<GSource, &g_source_unref>;

/** A callback that was sent, and its answer. Its context's thread. */
class SentCall : public std::enable_shared_from_this<SentCall> {
 public:
  /** @param context where the answer arrives; null: the main thread's */
  explicit SentCall(GMainContext *context);
  SentCall(const SentCall &) = delete;
  SentCall &operator=(const SentCall &) = delete;
  ~SentCall();

  /** @p message is on its way when this returns. */
  void send(GDBusMessage *message) QUARN_REQUIRES(requests_mutex);

  [[nodiscard]] bool is_answered() const { return result_ != nullptr; }
  GMainLoop *loop() const { return loop_.get(); }
  void give_up() { g_cancellable_cancel(cancellable_.get()); }

  /** @return the answer's body; null with @p error */
  [[nodiscard]] GVariantPtr take_answer(GErrorPtr *error);

 private:
  static void on_reply(GObject *bus, GAsyncResult *result, gpointer data);

  GMainContext *context_;
  CancellablePtr cancellable_;
  GMainLoopPtr loop_;
  ResultPtr result_;
};

/** The integer that a client has answered; #QUARN_FAILED, with a line in the log, without one. */
[[nodiscard]] int result_of(SentCall *call);

/** Counts a fiber that waits for a client's answer. Main thread. */
class AwaitedAnswer {
 public:
  AwaitedAnswer(std::string client, bool of_request);
  ~AwaitedAnswer();
  AwaitedAnswer(const AwaitedAnswer &) = delete;
  AwaitedAnswer &operator=(const AwaitedAnswer &) = delete;

  /** Whether another answer of the client may be waited for. */
  [[nodiscard]] static bool may_begin(const std::string &client);

 private:
  const std::string client_;
  std::optional<PendingWork> pending_;  // where a request's own fiber waits
};

/** Whether the calling thread is the one of quarn_dbus_note_main_thread(). */
[[nodiscard]] bool is_main_thread();

/**
 * Off the main thread: wait for the answer, for as long as others have patience. Nothing else is
 * done here meanwhile.
 * @param context the call's
 */
void wait_in_place(SentCall *call, GMainContext *context, const std::string &sender);

#endif
