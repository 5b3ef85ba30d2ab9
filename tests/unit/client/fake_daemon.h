/**
 * @file fake_daemon.h
 * @brief A daemon on a private bus that does what a test tells it, and runs of quarnctl.
 */
#ifndef QUARN_TESTS_FAKE_DAEMON_H
#define QUARN_TESTS_FAKE_DAEMON_H

#include <gio/gio.h>

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "glib_handles.h"
#include "private_bus.h"
#include "quarn_handles.h"
#include "run_until.h"

/** A method call that quarnctl has made. */
class IncomingCall {
 public:
  IncomingCall(GDBusConnection *connection, GDBusMethodInvocation *invocation);

  std::string client() const;
  /** The last argument, which is the request's id in all calls that have one. */
  std::uint32_t req_id() const;
  std::int32_t int_argument(std::size_t index) const;
  std::string text_argument(std::size_t index) const;

  void reply(int result) const;
  void reply_value(GVariant *value) const;
  void reply_error(const char *name, const char *message) const;
  /** A reply that the introspection data does not allow. */
  void reply_raw(GVariant *value) const;

  /**
   * Calls the client back and goes on when it has answered, as the daemon does.
   * The answer has to be "(i)" 0.
   */
  void call_back(const char *method, GVariant *arguments, std::function<void()> then = {}) const;

 private:
  GDBusConnection *connection_;
  // Shared: a script may ask for the caller after the reply, which uses one reference up.
  std::shared_ptr<GDBusMethodInvocation> invocation_;
};

/** The bus name, the object, and a function for each method that a test expects. */
class FakeDaemon {
 public:
  explicit FakeDaemon(const PrivateBus &bus);
  ~FakeDaemon();
  FakeDaemon(const FakeDaemon &) = delete;
  FakeDaemon &operator=(const FakeDaemon &) = delete;

  using Script = std::function<void(const IncomingCall &)>;
  void on(const std::string &method, Script script) { scripts_[method] = std::move(script); }

  /** Leaves the bus, as a process that dies does. */
  void die();
  /** Gives the bus name up, as a process does that finishes its work without it. */
  void give_name_up();
  /** Serves a status object; @p properties is an a{sv}. */
  void serve_status(GVariant *properties);
  /** With a status object: answers what a backup leaves in the cloud; @p packages is an "as". */
  void serve_kept_packages(GVariant *packages);
  /** Publishes a "progress" signal. */
  void publish(const std::string &text);
  GDBusConnection *connection() const { return connection_.get(); }
  /** Methods that were called, in order. */
  const std::vector<std::string> &calls() const { return calls_; }

 private:
  static GDBusMessage *answer_status(GDBusConnection *connection, GDBusMessage *message,
                                     gboolean incoming, gpointer user_data);
  static void on_call(GDBusConnection *connection, const char *sender, const char *path,
                      const char *interface, const char *method, GVariant *parameters,
                      GDBusMethodInvocation *invocation, gpointer user_data);

  ConnectionHandle connection_;
  guint object_ = 0;
  guint packages_object_ = 0;
  guint status_filter_ = 0;
  GVariantPtr status_;
  GVariantPtr kept_;
  std::map<std::string, Script> scripts_;
  std::vector<std::string> calls_;
};

/** How one run of quarnctl ended. */
struct Outcome {
  int exit = -1;
  std::string out;
  std::string err;
};

/** A run of quarnctl against a bus. */
class QuarnctlRun {
 public:
  /** @param columns not 0: give it a terminal of this width as standard output */
  QuarnctlRun(const PrivateBus &bus, const std::vector<std::string> &arguments,
              unsigned short columns = 0);
  ~QuarnctlRun();
  QuarnctlRun(const QuarnctlRun &) = delete;
  QuarnctlRun &operator=(const QuarnctlRun &) = delete;

  void signal(int number);
  /** With a terminal: what somebody types there. */
  void type(const std::string &text);
  /** What has come on the terminal so far. */
  const std::string &shown() const { return outcome_.out; }
  /** Runs the main context until the process has ended. */
  Outcome wait();

 private:
  static void on_end(GObject *source, GAsyncResult *result, gpointer user_data);
  static gboolean on_terminal(int fd, GIOCondition condition, gpointer user_data);

  Handle<GSubprocess, &g_object_unref> process_;
  Outcome outcome_;
  bool ended_ = false;
  UniqueFd terminal_;
  guint terminal_source_ = 0;
};

/** One run from start to end. */
Outcome quarnctl(const PrivateBus &bus, const std::vector<std::string> &arguments);

/** "(iiu)" and "(isu)" for IncomingCall::call_back. */
GVariant *status_arguments(int error, int status, std::uint32_t req_id);
GVariant *text_arguments(int error, const std::string &text, std::uint32_t req_id);

#endif
