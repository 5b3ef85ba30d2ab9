/**
 * @file bus_client.h
 * @brief A client of the daemon: calls that do not block, and the object the daemon calls back.
 *
 * Everything runs on the thread-default main context of the thread that made
 * the client, and every function given to it is called there. The daemon
 * calls back before it replies, so a call must never be waited for in place.
 */
#ifndef QUARN_CLIENT_BUS_CLIENT_H
#define QUARN_CLIENT_BUS_CLIENT_H

#include <gio/gio.h>

#include <cstdint>
#include <functional>
#include <set>
#include <string>

#include "quarn_handles.h"

namespace quarn_client {

/** A call that the daemon makes on its client. */
struct Callback {
  enum class Kind {
    restore_enable,
    app_list,
    backup_status,
    cancel_result,
    app_backup_complete,
    app_restore_complete
  };
  Kind kind = Kind::restore_enable;
  std::int32_t result = 0;
  std::int32_t status = 0; /**< backup_status: one of #quarn_backup_state */
  std::string text;        /**< message, package id or application list */
  std::uint32_t req_id = 0;
};

/** Why a call came to nothing. */
struct BusFailure {
  enum class Kind { unreachable, daemon_ended, denied, unusable };
  Kind kind = Kind::unreachable;
  std::string message;
};

/** One connection to the daemon. */
class BusClient {
 public:
  struct Events {
    std::function<void()> ready; /**< connected; calls may be made */
    std::function<void(const Callback &)> callback;
    std::function<void(const std::string &)> progress; /**< text of a "progress" signal */
    /** The process that took the latest call, by its answer or a callback, has left the bus. */
    std::function<void()> daemon_ended;
    std::function<void(const BusFailure &)> failed; /**< no connection, or it was lost */
  };

  explicit BusClient(Events events);
  ~BusClient();
  BusClient(const BusClient &) = delete;
  BusClient &operator=(const BusClient &) = delete;

  /** Begins connecting to the system bus; ends in Events::ready or Events::failed. */
  void connect();

  /** Exactly one of them is called, unless the client is deleted before. */
  using Reply = std::function<void(GVariant *value)>;
  using Failure = std::function<void(const BusFailure &)>;

  /**
   * Calls a method of the daemon, starting it when it does not run.
   * @param arguments floating tuple, or null
   * @param reply_type what the reply must look like, a D-Bus signature such as "(i)"
   */
  void call(const char *method, GVariant *arguments, const char *reply_type, Reply reply,
            Failure failure);

  /** Reads all properties of the daemon's status object; the reply is "(a{sv})". */
  void read_status(Reply reply, Failure failure);

  /** Reads which packages a backup leaves in the cloud; the reply is "(v)", of an "as". */
  void read_kept_packages(Reply reply, Failure failure);
  /** Withdraws what this connection has asked for; the reply is "(u)", how many requests. */
  void cancel_own(Reply reply, Failure failure);

  /** Waits until everything is written: a reply that is still queued would be lost at the exit. */
  void flush();

 private:
  static void on_bus(GObject *source, GAsyncResult *result, gpointer user_data);
  static void on_owner(GObject *source, GAsyncResult *result, gpointer user_data);
  static void on_owner_changed(GDBusConnection *connection, const char *sender, const char *path,
                               const char *interface, const char *signal, GVariant *parameters,
                               gpointer user_data);
  static void on_progress(GDBusConnection *connection, const char *sender, const char *path,
                          const char *interface, const char *signal, GVariant *parameters,
                          gpointer user_data);
  static void on_closed(GDBusConnection *connection, gboolean by_remote, GError *error,
                        gpointer user_data);
  static void on_method(GDBusConnection *connection, const char *sender, const char *path,
                        const char *interface, const char *method, GVariant *parameters,
                        GDBusMethodInvocation *invocation, gpointer user_data);
  static void on_reply(GObject *source, GAsyncResult *result, gpointer user_data);

  bool export_object();
  void name_changed(const char *name, const char *owner);
  struct Target {
    const char *path;
    const char *interface;
    const char *method;
    bool is_request;
  };
  void call_object(const Target &target, GVariant *arguments, const char *reply_type, Reply reply,
                   Failure failure);

  struct PendingCall;

  Events events_;
  Handle<GCancellable, &g_object_unref> cancellable_;
  Handle<GDBusConnection, &g_object_unref> connection_;
  /**
   * Unique names of all that owned the daemon's name since connecting. A
   * process gives that name up before it has finished its work, and calls back
   * on the connection that was called.
   */
  std::set<std::string> daemons_;
  std::string serving_; /**< the one that took the latest call; empty while that is not known */
  guint object_id_ = 0;
  guint owner_subscription_ = 0;
  guint progress_subscription_ = 0;
  gulong closed_handler_ = 0;
};

/** An id for a request, unlikely to be any other client's; never 0. */
std::uint32_t random_request_id();

}  // namespace quarn_client

#endif
