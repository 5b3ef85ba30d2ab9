#include "scripted_client.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <optional>

#include "glib_handles.h"

namespace {

constexpr unsigned int kDeadlineSeconds = 10;
constexpr char kPath[] = "/org/orvane/Quarn/GDBus";
constexpr char kName[] = "org.orvane.Quarn";

constexpr char kCallbackXml[] =
    "<node><interface name='org.orvane.Quarn'>"
    "<method name='restore_enable_cb'><arg type='i' direction='in'/><arg type='s' "
    "direction='in'/><arg type='u' direction='in'/></method>"
    "<method name='get_app_list_cb'><arg type='i' direction='in'/><arg type='s' "
    "direction='in'/><arg type='u' direction='in'/></method>"
    "<method name='manual_backup_status'><arg type='i' direction='in'/><arg type='i' "
    "direction='in'/><arg type='u' direction='in'/></method>"
    "<method name='manual_backup_cancel_result'><arg type='i' direction='in'/><arg type='u' "
    "direction='in'/></method>"
    "<method name='app_data_backup_complete'><arg type='i' direction='in'/><arg type='s' "
    "direction='in'/><arg type='u' direction='in'/></method>"
    "<method name='app_data_restore_complete'><arg type='i' direction='in'/><arg type='s' "
    "direction='in'/><arg type='u' direction='in'/></method>"
    "</interface></node>";

std::string print(GVariant *value) {
  const GText text(g_variant_print(value, FALSE));
  return text.get();
}

GVariant *parse(const std::string &text) {
  GErrorPtr error;
  GVariant *value = g_variant_parse(nullptr, text.c_str(), nullptr, nullptr, out(error));
  if (value == nullptr) ADD_FAILURE() << text << ": " << error->message;
  return value;
}

/** The bus ends with the program. */
class BusOwner : public ::testing::Environment {
 public:
  void TearDown() override { bus_.reset(); }
  const PrivateBus &bus() {
    if (!bus_) {
      bus_.emplace();
      setenv("DBUS_SYSTEM_BUS_ADDRESS", bus_->address().c_str(), 1);
      // The bus ends before the program; that is no reason to raise SIGTERM.
      const ConnectionHandle shared(g_bus_get_sync(G_BUS_TYPE_SYSTEM, nullptr, nullptr));
      g_dbus_connection_set_exit_on_close(shared.get(), FALSE);
      shared_ = G_DBUS_CONNECTION(g_object_ref(shared.get()));
    }
    return *bus_;
  }

 private:
  std::optional<PrivateBus> bus_;
  GDBusConnection *shared_ = nullptr; /**< keeps the process' one connection alive */
};

BusOwner *const bus_owner = [] {
  auto *owner = new BusOwner;
  ::testing::AddGlobalTestEnvironment(owner);
  return owner;
}();

}  // namespace

std::string private_bus_address() { return bus_owner->bus().address(); }

ConnectionHandle connect_to_private_bus() { return bus_owner->bus().connect(); }

ScriptedClient::ScriptedClient(bool with_object)
    : connection_(connect_to_private_bus()),
      name_(g_dbus_connection_get_unique_name(connection_.get())),
      with_object_(with_object) {
  thread_ = std::thread([this] { run(); });
  std::unique_lock<std::mutex> lock(mutex_);
  changed_.wait(lock, [this] { return ready_; });
}

ScriptedClient::~ScriptedClient() {
  GSource *quit = g_idle_source_new();
  g_source_set_callback(
      quit,
      [](gpointer loop) -> gboolean {
        g_main_loop_quit(static_cast<GMainLoop *>(loop));
        return G_SOURCE_REMOVE;
      },
      loop_, nullptr);
  g_source_attach(quit, context_);
  g_source_unref(quit);
  thread_.join();
  g_main_loop_unref(loop_);
  g_main_context_unref(context_);
}

void ScriptedClient::run() {
  context_ = g_main_context_new();
  g_main_context_push_thread_default(context_);
  loop_ = g_main_loop_new(context_, FALSE);
  static constexpr GDBusInterfaceVTable kTable{on_call, nullptr, nullptr, {}};
  GDBusNodeInfo *node = g_dbus_node_info_new_for_xml(kCallbackXml, nullptr);
  if (with_object_) {
    registration_ = g_dbus_connection_register_object(connection_.get(), kPath, node->interfaces[0],
                                                      &kTable, this, nullptr, nullptr);
  }
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    ready_ = true;
  }
  changed_.notify_all();
  g_main_loop_run(loop_);
  if (registration_ != 0) g_dbus_connection_unregister_object(connection_.get(), registration_);
  g_dbus_connection_close_sync(connection_.get(), nullptr, nullptr);
  for (GDBusMethodInvocation *invocation : unanswered_) g_object_unref(invocation);
  // What the closing has left to be told goes away with the context.
  while (g_main_context_iteration(context_, FALSE) != FALSE) {
  }
  g_dbus_node_info_unref(node);
  g_main_context_pop_thread_default(context_);
}

void ScriptedClient::on_call(GDBusConnection *, const gchar *, const gchar *, const gchar *,
                             const gchar *method, GVariant *parameters,
                             GDBusMethodInvocation *invocation, gpointer data) {
  auto *self = static_cast<ScriptedClient *>(data);
  std::string reply = "(0,)";
  bool silent = false;
  {
    const std::lock_guard<std::mutex> lock(self->mutex_);
    self->callbacks_.push_back(method + print(parameters));
    const auto scripted = self->answers_.find(method);
    if (scripted != self->answers_.end()) reply = scripted->second;
    silent = self->silent_.count(method) != 0;
    if (silent) self->unanswered_.push_back(invocation);
  }
  self->changed_.notify_all();
  if (silent) return;
  // As a message: a wrong reply shall go out as well.
  GDBusMessage *answer =
      g_dbus_message_new_method_reply(g_dbus_method_invocation_get_message(invocation));
  g_dbus_message_set_body(answer, parse(reply));
  g_dbus_connection_send_message(self->connection_.get(), answer, G_DBUS_SEND_MESSAGE_FLAGS_NONE,
                                 nullptr, nullptr);
  g_object_unref(answer);
  g_object_unref(invocation);
}

std::vector<std::string> ScriptedClient::callbacks() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return callbacks_;
}

void ScriptedClient::answer(const std::string &method, const std::string &reply) {
  const std::lock_guard<std::mutex> lock(mutex_);
  answers_[method] = reply;
}

void ScriptedClient::keep_silent(const std::string &method) {
  const std::lock_guard<std::mutex> lock(mutex_);
  silent_[method] = true;
}

void ScriptedClient::answer_silent() {
  std::vector<GDBusMethodInvocation *> late;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    late.swap(unanswered_);
    silent_.clear();
  }
  for (GDBusMethodInvocation *invocation : late) {
    const Handle<GDBusMessage, &g_object_unref> answer(
        g_dbus_message_new_method_reply(g_dbus_method_invocation_get_message(invocation)));
    g_dbus_message_set_body(answer.get(), parse("(0,)"));
    g_dbus_connection_send_message(connection_.get(), answer.get(), G_DBUS_SEND_MESSAGE_FLAGS_NONE,
                                   nullptr, nullptr);
    g_object_unref(invocation);
  }
}

bool ScriptedClient::wait_for_callbacks(std::size_t count) const {
  std::unique_lock<std::mutex> lock(mutex_);
  return changed_.wait_for(lock, std::chrono::seconds(kDeadlineSeconds),
                           [this, count] { return callbacks_.size() >= count; });
}

namespace {

void on_answer(GObject *connection, GAsyncResult *result, gpointer data) {
  const std::unique_ptr<std::shared_ptr<CallOutcome>> outcome(
      static_cast<std::shared_ptr<CallOutcome> *>(data));
  GErrorPtr error;
  const GVariantPtr reply(
      g_dbus_connection_call_finish(G_DBUS_CONNECTION(connection), result, out(error)));
  if (reply) {
    (*outcome)->reply = print(reply.get());
  } else {
    const GText name(g_dbus_error_get_remote_error(error.get()));
    if (name) (*outcome)->error_name = name.get();
    g_dbus_error_strip_remote_error(error.get());
    (*outcome)->error_text = error->message;
  }
  (*outcome)->finished = true;
}

}  // namespace

void ScriptedClient::start_call(const std::string &method, const std::string &arguments,
                                std::shared_ptr<CallOutcome> outcome, const char *interface_name) {
  g_dbus_connection_call(connection_.get(), kName, kPath, interface_name, method.c_str(),
                         parse(arguments), nullptr, G_DBUS_CALL_FLAGS_NONE,
                         static_cast<int>(kDeadlineSeconds) * 1000, nullptr, on_answer,
                         new std::shared_ptr<CallOutcome>(std::move(outcome)));
}

void ScriptedClient::call_bus(const char *method) const {
  GErrorPtr error;
  const GVariantPtr reply(g_dbus_connection_call_sync(
      connection_.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
      method, nullptr, nullptr, G_DBUS_CALL_FLAGS_NONE, -1, nullptr, out(error)));
  EXPECT_TRUE(reply) << error->message;
}

CallOutcome ScriptedClient::call(const std::string &method, const std::string &arguments,
                                 const char *interface_name) {
  const auto outcome = std::make_shared<CallOutcome>();
  start_call(method, arguments, outcome, interface_name);
  EXPECT_TRUE(run_until([&] { return outcome->finished; })) << method;
  return *outcome;
}
