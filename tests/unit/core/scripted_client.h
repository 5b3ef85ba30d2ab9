/**
 * @file scripted_client.h
 * @brief A bus of the program's own as the system bus, and a scripted client on it.
 */
#ifndef SCRIPTED_CLIENT_H
#define SCRIPTED_CLIENT_H

#include <gio/gio.h>

#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "private_bus.h"
#include "run_until.h"

/** Start the bus of this program when it does not run yet. @return its address */
std::string private_bus_address();

/** A connection of one's own to that bus. */
ConnectionHandle connect_to_private_bus();

/** What came of a call: the printed reply, or an error's D-Bus name and text. */
struct CallOutcome {
  bool finished = false;
  std::string reply;
  std::string error_name;
  std::string error_text;
};

/**
 * A client: exports the callback methods on a thread of its own, writes every
 * callback down and answers as it was told.
 */
class ScriptedClient {
 public:
  /** @param with_object export the callback object */
  explicit ScriptedClient(bool with_object = true);
  ~ScriptedClient();
  ScriptedClient(const ScriptedClient &) = delete;
  ScriptedClient &operator=(const ScriptedClient &) = delete;

  /** Unique bus name. */
  const std::string &name() const { return name_; }
  /** Callbacks so far, as "method(arguments)". */
  std::vector<std::string> callbacks() const;
  /** Answer @p method with @p reply, a printed tuple; else "(0,)". */
  void answer(const std::string &method, const std::string &reply);
  /** Never answer @p method. */
  void keep_silent(const std::string &method);
  /** Answer, late, what was not answered. */
  void answer_silent();
  /** Wait for that many callbacks. */
  bool wait_for_callbacks(std::size_t count) const;

  /**
   * Call the daemon and serve the default context until the answer is there.
   * @param arguments a printed tuple
   */
  CallOutcome call(const std::string &method, const std::string &arguments,
                   const char *interface_name = "org.orvane.Quarn");
  /** The same without waiting; @p outcome is complete when finished is set. */
  void start_call(const std::string &method, const std::string &arguments,
                  std::shared_ptr<CallOutcome> outcome,
                  const char *interface_name = "org.orvane.Quarn");

  /** Ask the bus itself and wait for its answer. */
  void call_bus(const char *method) const;

  GDBusConnection *connection() const { return connection_.get(); }

 private:
  static void on_call(GDBusConnection *connection, const gchar *sender, const gchar *path,
                      const gchar *interface_name, const gchar *method, GVariant *parameters,
                      GDBusMethodInvocation *invocation, gpointer self);
  void run();

  ConnectionHandle connection_;
  std::string name_;
  GMainContext *context_ = nullptr;
  GMainLoop *loop_ = nullptr;
  std::thread thread_;
  guint registration_ = 0;
  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  bool ready_ = false;
  bool with_object_;
  std::vector<std::string> callbacks_;
  std::map<std::string, std::string> answers_;
  std::map<std::string, bool> silent_;
  std::vector<GDBusMethodInvocation *> unanswered_;
};

#endif
