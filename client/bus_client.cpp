#include "bus_client.h"

#include <cstring>
#include <utility>

#include "glib_handles.h"
#include "quarn_common.h"

namespace quarn_client {

namespace {

constexpr char kBusService[] = "org.freedesktop.DBus";
constexpr char kBusPath[] = "/org/freedesktop/DBus";
constexpr char kPropertiesInterface[] = "org.freedesktop.DBus.Properties";
constexpr char kStatusPath[] = "/org/orvane/Quarn/Status";
constexpr char kStatusInterface[] = "org.orvane.Quarn.Status";
constexpr char kCleanUpInterface[] = "org.orvane.Quarn.CleanUp";
constexpr char kPackagesPath[] = "/org/orvane/Quarn/Packages";
constexpr char kPackagesInterface[] = "org.orvane.Quarn.Packages";
constexpr char kProgressSignal[] = "progress";
constexpr char kProgressPath[] = "/progress";
// The caller has a clock of its own; the bus library's would end a long transfer.
constexpr int kNoTimeout = G_MAXINT;

constexpr char kCallbackXml[] =
    "<node>"
    " <interface name='org.orvane.Quarn'>"
    "  <method name='restore_enable_cb'>"
    "   <arg type='i' name='err' direction='in'/>"
    "   <arg type='s' name='msg' direction='in'/>"
    "   <arg type='u' name='req_id' direction='in'/>"
    "   <arg type='i' name='ret' direction='out'/>"
    "  </method>"
    "  <method name='get_app_list_cb'>"
    "   <arg type='i' name='err' direction='in'/>"
    "   <arg type='s' name='msg' direction='in'/>"
    "   <arg type='u' name='req_id' direction='in'/>"
    "   <arg type='i' name='ret' direction='out'/>"
    "  </method>"
    "  <method name='manual_backup_status'>"
    "   <arg type='i' name='err' direction='in'/>"
    "   <arg type='i' name='status' direction='in'/>"
    "   <arg type='u' name='req_id' direction='in'/>"
    "   <arg type='i' name='ret' direction='out'/>"
    "  </method>"
    "  <method name='manual_backup_cancel_result'>"
    "   <arg type='i' name='err' direction='in'/>"
    "   <arg type='u' name='req_id' direction='in'/>"
    "   <arg type='i' name='ret' direction='out'/>"
    "  </method>"
    "  <method name='app_data_backup_complete'>"
    "   <arg type='i' name='err' direction='in'/>"
    "   <arg type='s' name='msg' direction='in'/>"
    "   <arg type='u' name='req_id' direction='in'/>"
    "   <arg type='i' name='ret' direction='out'/>"
    "  </method>"
    "  <method name='app_data_restore_complete'>"
    "   <arg type='i' name='err' direction='in'/>"
    "   <arg type='s' name='msg' direction='in'/>"
    "   <arg type='u' name='req_id' direction='in'/>"
    "   <arg type='i' name='ret' direction='out'/>"
    "  </method>"
    " </interface>"
    "</node>";

struct CallbackName {
  const char *method;
  Callback::Kind kind;
};

constexpr CallbackName kCallbacks[] = {
    {"restore_enable_cb", Callback::Kind::restore_enable},
    {"get_app_list_cb", Callback::Kind::app_list},
    {"app_data_backup_complete", Callback::Kind::app_backup_complete},
    {"app_data_restore_complete", Callback::Kind::app_restore_complete},
};

constexpr char kStatusMethod[] = "manual_backup_status";
constexpr char kCancelMethod[] = "manual_backup_cancel_result";

using NodeInfo = Handle<GDBusNodeInfo, &g_dbus_node_info_unref>;
using Message = Handle<GDBusMessage, &g_object_unref>;
using VariantType = Handle<GVariantType, &g_variant_type_free>;

Callback read_callback(const char *method, GVariant *parameters) {
  Callback callback;
  if (std::strcmp(method, kStatusMethod) == 0) {
    callback.kind = Callback::Kind::backup_status;
    g_variant_get(parameters, "(iiu)", &callback.result, &callback.status, &callback.req_id);
    return callback;
  }
  if (std::strcmp(method, kCancelMethod) == 0) {
    callback.kind = Callback::Kind::cancel_result;
    g_variant_get(parameters, "(iu)", &callback.result, &callback.req_id);
    return callback;
  }
  for (const CallbackName &name : kCallbacks) {
    if (std::strcmp(method, name.method) == 0) callback.kind = name.kind;
  }
  const char *text = nullptr;
  g_variant_get(parameters, "(i&su)", &callback.result, &text, &callback.req_id);
  callback.text = text;
  return callback;
}

bool is_cancelled(const GError *error) {
  return g_error_matches(error, G_IO_ERROR, G_IO_ERROR_CANCELLED) != FALSE;
}

BusFailure failure_of(GError *error) {
  const GText name(g_dbus_error_is_remote_error(error) != FALSE
                       ? g_dbus_error_get_remote_error(error)
                       : nullptr);
  g_dbus_error_strip_remote_error(error);
  const std::string text = error->message;
  const auto is = [error](GDBusError code) {
    return g_error_matches(error, G_DBUS_ERROR, code) != FALSE;
  };
  if (is(G_DBUS_ERROR_ACCESS_DENIED)) {
    return {
        BusFailure::Kind::denied,
        std::string("not permitted: this needs root, or to be in the group ") + QUARN_CLIENT_GROUP};
  }
  if (is(G_DBUS_ERROR_AUTH_FAILED)) {
    return {BusFailure::Kind::denied, "the bus does not accept this user: " + text};
  }
  if (is(G_DBUS_ERROR_NO_REPLY)) {
    return {BusFailure::Kind::daemon_ended, "the daemon ended before it had answered"};
  }
  if (name && std::strstr(name.get(), ".Spawn.") != nullptr) {
    return {
        BusFailure::Kind::unreachable,
        "the daemon did not start (it ends at once when no cloud account is signed in): " + text};
  }
  if (is(G_DBUS_ERROR_SERVICE_UNKNOWN) || is(G_DBUS_ERROR_NAME_HAS_NO_OWNER) ||
      is(G_DBUS_ERROR_TIMED_OUT) || is(G_DBUS_ERROR_TIMEOUT) || is(G_DBUS_ERROR_DISCONNECTED) ||
      error->domain == G_IO_ERROR) {
    return {BusFailure::Kind::unreachable, "cannot reach the daemon: " + text};
  }
  return {BusFailure::Kind::unusable, "the daemon refused the call: " + text};
}

}  // namespace

struct BusClient::PendingCall {
  BusClient *client; /**< not to be used once the call is cancelled */
  VariantType reply_type;
  bool is_request; /**< whoever answers it has taken what was asked for */
  Reply reply;
  Failure failure;
};

BusClient::BusClient(Events events)
    : events_(std::move(events)), cancellable_(g_cancellable_new()) {}

BusClient::~BusClient() {
  g_cancellable_cancel(cancellable_.get());
  if (!connection_) return;
  if (closed_handler_ != 0) g_signal_handler_disconnect(connection_.get(), closed_handler_);
  if (owner_subscription_ != 0) {
    g_dbus_connection_signal_unsubscribe(connection_.get(), owner_subscription_);
  }
  if (progress_subscription_ != 0) {
    g_dbus_connection_signal_unsubscribe(connection_.get(), progress_subscription_);
  }
  if (object_id_ != 0) g_dbus_connection_unregister_object(connection_.get(), object_id_);
}

void BusClient::connect() { g_bus_get(G_BUS_TYPE_SYSTEM, cancellable_.get(), on_bus, this); }

void BusClient::on_bus(GObject *, GAsyncResult *result, gpointer user_data) {
  GErrorPtr error;
  Handle<GDBusConnection, &g_object_unref> connection(g_bus_get_finish(result, out(error)));
  if (!connection) {
    if (is_cancelled(error.get())) return;
    auto *self = static_cast<BusClient *>(user_data);
    self->events_.failed({BusFailure::Kind::unreachable,
                          std::string("cannot reach the system bus: ") + error->message});
    return;
  }
  auto *self = static_cast<BusClient *>(user_data);
  self->connection_ = std::move(connection);
  GDBusConnection *bus = self->connection_.get();
  g_dbus_connection_set_exit_on_close(bus, FALSE);
  self->closed_handler_ = g_signal_connect(bus, "closed", G_CALLBACK(on_closed), self);
  self->owner_subscription_ = g_dbus_connection_signal_subscribe(
      bus, kBusService, kBusService, "NameOwnerChanged", kBusPath, nullptr,
      G_DBUS_SIGNAL_FLAGS_NONE, on_owner_changed, self, nullptr);
  // From any sender: a daemon that works on without its name is told from strangers here.
  self->progress_subscription_ = g_dbus_connection_signal_subscribe(
      bus, nullptr, kQuarnInterface, kProgressSignal, kProgressPath, nullptr,
      G_DBUS_SIGNAL_FLAGS_NONE, on_progress, self, nullptr);
  if (!self->export_object()) {
    self->events_.failed(
        {BusFailure::Kind::unreachable, "cannot export the object that the daemon calls back"});
    return;
  }
  g_dbus_connection_call(bus, kBusService, kBusPath, kBusService, "GetNameOwner",
                         g_variant_new("(s)", kQuarnBusName), G_VARIANT_TYPE("(s)"),
                         G_DBUS_CALL_FLAGS_NONE, kNoTimeout, self->cancellable_.get(), on_owner,
                         self);
}

bool BusClient::export_object() {
  static const GDBusInterfaceVTable table = {on_method, nullptr, nullptr, {}};
  const NodeInfo node(g_dbus_node_info_new_for_xml(kCallbackXml, nullptr));
  if (!node) return false;
  object_id_ = g_dbus_connection_register_object(
      connection_.get(), kQuarnObjectPath, node->interfaces[0], &table, this, nullptr, nullptr);
  return object_id_ != 0;
}

void BusClient::on_owner(GObject *source, GAsyncResult *result, gpointer user_data) {
  GErrorPtr error;
  const GVariantPtr reply(
      g_dbus_connection_call_finish(G_DBUS_CONNECTION(source), result, out(error)));
  if (!reply && is_cancelled(error.get())) return;
  auto *self = static_cast<BusClient *>(user_data);
  if (reply) {
    const char *owner = nullptr;
    g_variant_get(reply.get(), "(&s)", &owner);
    self->daemons_.insert(owner);
  }
  self->events_.ready();
}

void BusClient::on_owner_changed(GDBusConnection *, const char *, const char *, const char *,
                                 const char *, GVariant *parameters, gpointer user_data) {
  auto *self = static_cast<BusClient *>(user_data);
  if (g_variant_is_of_type(parameters, G_VARIANT_TYPE("(sss)")) == FALSE) return;
  const char *name = nullptr;
  const char *owner = nullptr;
  g_variant_get(parameters, "(&s&s&s)", &name, nullptr, &owner);
  self->name_changed(name, owner);
}

void BusClient::name_changed(const char *name, const char *owner) {
  if (std::strcmp(name, kQuarnBusName) == 0) {
    if (*owner != '\0') daemons_.insert(owner);
  } else if (*owner == '\0' && serving_ == name) {
    serving_.clear();
    events_.daemon_ended();
  }
}

void BusClient::on_progress(GDBusConnection *, const char *sender, const char *, const char *,
                            const char *, GVariant *parameters, gpointer user_data) {
  auto *self = static_cast<BusClient *>(user_data);
  if (self->daemons_.count(sender) == 0) return;
  if (g_variant_is_of_type(parameters, G_VARIANT_TYPE("(s)")) == FALSE) return;
  const char *text = nullptr;
  g_variant_get(parameters, "(&s)", &text);
  self->events_.progress(text);
}

void BusClient::on_closed(GDBusConnection *, gboolean, GError *, gpointer user_data) {
  static_cast<BusClient *>(user_data)->events_.failed(
      {BusFailure::Kind::unreachable, "the connection to the system bus was lost"});
}

void BusClient::on_method(GDBusConnection *, const char *sender, const char *, const char *,
                          const char *method, GVariant *parameters,
                          GDBusMethodInvocation *invocation, gpointer user_data) {
  auto *self = static_cast<BusClient *>(user_data);
  if (self->daemons_.count(sender) == 0) {
    g_dbus_method_invocation_return_error_literal(invocation, G_DBUS_ERROR,
                                                  G_DBUS_ERROR_ACCESS_DENIED,
                                                  "only the daemon may call this object");
    return;
  }
  self->serving_ = sender;
  const Callback callback = read_callback(method, parameters);
  g_dbus_method_invocation_return_value(invocation, g_variant_new("(i)", QUARN_OK));
  self->events_.callback(callback);
}

void BusClient::call(const char *method, GVariant *arguments, const char *reply_type, Reply reply,
                     Failure failure) {
  call_object({kQuarnObjectPath, kQuarnInterface, method, true}, arguments, reply_type,
              std::move(reply), std::move(failure));
}

void BusClient::read_status(Reply reply, Failure failure) {
  call_object({kStatusPath, kPropertiesInterface, "GetAll", false},
              g_variant_new("(s)", kStatusInterface), "(a{sv})", std::move(reply),
              std::move(failure));
}

void BusClient::cancel_own(Reply reply, Failure failure) {
  call_object({kPackagesPath, kPackagesInterface, "CancelOwn", false}, nullptr, "(u)",
              std::move(reply), std::move(failure));
}

void BusClient::call_object(const Target &target, GVariant *arguments, const char *reply_type,
                            Reply reply, Failure failure) {
  const Message message(
      g_dbus_message_new_method_call(kQuarnBusName, target.path, target.interface, target.method));
  if (arguments != nullptr) g_dbus_message_set_body(message.get(), arguments);
  auto *pending = new PendingCall{this, VariantType(g_variant_type_new(reply_type)),
                                  target.is_request, std::move(reply), std::move(failure)};
  g_dbus_connection_send_message_with_reply(connection_.get(), message.get(),
                                            G_DBUS_SEND_MESSAGE_FLAGS_NONE, kNoTimeout, nullptr,
                                            cancellable_.get(), on_reply, pending);
}

void BusClient::on_reply(GObject *source, GAsyncResult *result, gpointer user_data) {
  const std::unique_ptr<PendingCall> pending(static_cast<PendingCall *>(user_data));
  GErrorPtr error;
  const Message message(g_dbus_connection_send_message_with_reply_finish(G_DBUS_CONNECTION(source),
                                                                         result, out(error)));
  if (!message && is_cancelled(error.get())) return;
  if (!message || g_dbus_message_to_gerror(message.get(), out(error)) != FALSE) {
    pending->failure(failure_of(error.get()));
    return;
  }
  if (pending->is_request) pending->client->serving_ = g_dbus_message_get_sender(message.get());
  GVariant *const body = g_dbus_message_get_body(message.get());
  if (body == nullptr || g_variant_is_of_type(body, pending->reply_type.get()) == FALSE) {
    pending->failure({BusFailure::Kind::unusable,
                      std::string("the daemon's answer is not usable: it is of type ") +
                          (body == nullptr ? "()" : g_variant_get_type_string(body))});
    return;
  }
  pending->reply(body);
}

void BusClient::read_kept_packages(Reply reply, Failure failure) {
  call_object({kStatusPath, kPropertiesInterface, "Get", false},
              g_variant_new("(ss)", kCleanUpInterface, "KeptPackages"), "(v)", std::move(reply),
              std::move(failure));
}

void BusClient::flush() {
  if (connection_) g_dbus_connection_flush_sync(connection_.get(), nullptr, nullptr);
}

std::uint32_t random_request_id() {
  const guint32 id = g_random_int();
  return id == 0 ? 1 : id;
}

}  // namespace quarn_client
