#include "fake_daemon.h"

#include <fcntl.h>
#include <glib-unix.h>
#include <gtest/gtest.h>
#include <pty.h>
#include <sys/ioctl.h>

#include <cstdlib>
#include <utility>

#include "quarn_common.h"

namespace {

constexpr unsigned short kRows = 25;

constexpr char kDaemonXml[] =
    "<node><interface name='org.orvane.Quarn'>"
    "<method name='set_activation'><arg type='i' direction='in'/><arg type='i' direction='out'/>"
    "</method>"
    "<method name='backup_enable'><arg type='i' direction='in'/><arg type='i' direction='out'/>"
    "</method>"
    "<method name='restore_enable'><arg type='i' direction='in'/><arg type='i' direction='in'/>"
    "<arg type='s' direction='in'/><arg type='s' direction='in'/><arg type='u' direction='in'/>"
    "<arg type='i' direction='out'/></method>"
    "<method name='last_bu_time'><arg type='t' direction='out'/></method>"
    "<method name='get_app_list'><arg type='i' direction='in'/><arg type='u' direction='in'/>"
    "<arg type='i' direction='out'/></method>"
    "<method name='manual_backup_start'><arg type='u' direction='in'/>"
    "<arg type='i' direction='out'/></method>"
    "<method name='manual_backup_cancel'><arg type='u' direction='in'/>"
    "<arg type='i' direction='out'/></method>"
    "<method name='app_data_backup_start'><arg type='s' direction='in'/>"
    "<arg type='u' direction='in'/><arg type='i' direction='out'/></method>"
    "<method name='app_data_restore_start'><arg type='s' direction='in'/>"
    "<arg type='u' direction='in'/><arg type='i' direction='out'/></method>"
    "<method name='make_app_data'><arg type='s' direction='in'/><arg type='i' direction='out'/>"
    "</method>"
    "</interface>"
    "<interface name='org.orvane.Quarn.Packages'>"
    "<method name='CancelOwn'><arg type='u' direction='out'/></method>"
    "</interface></node>";

constexpr char kPackagesPath[] = "/org/orvane/Quarn/Packages";

using NodeInfo = Handle<GDBusNodeInfo, &g_dbus_node_info_unref>;

GVariantPtr child(GDBusMethodInvocation *invocation, std::size_t index) {
  return GVariantPtr(
      g_variant_get_child_value(g_dbus_method_invocation_get_parameters(invocation), index));
}

/** Calls back that quarnctl has not answered yet. */
int unanswered = 0;

void after_call_back(GObject *source, GAsyncResult *result, gpointer user_data) {
  const std::unique_ptr<std::function<void()>> then(
      static_cast<std::function<void()> *>(user_data));
  --unanswered;
  GErrorPtr error;
  const GVariantPtr reply(
      g_dbus_connection_call_finish(G_DBUS_CONNECTION(source), result, out(error)));
  ASSERT_TRUE(reply) << (error ? error->message : "");
  gint32 answer = -1;
  g_variant_get(reply.get(), "(i)", &answer);
  EXPECT_EQ(answer, 0);
  if (*then) (*then)();
}

}  // namespace

IncomingCall::IncomingCall(GDBusConnection *connection, GDBusMethodInvocation *invocation)
    : connection_(connection),
      invocation_(static_cast<GDBusMethodInvocation *>(g_object_ref(invocation)), &g_object_unref) {
}

std::string IncomingCall::client() const {
  return g_dbus_method_invocation_get_sender(invocation_.get());
}

std::uint32_t IncomingCall::req_id() const {
  const std::size_t count =
      g_variant_n_children(g_dbus_method_invocation_get_parameters(invocation_.get()));
  return g_variant_get_uint32(child(invocation_.get(), count - 1).get());
}

std::int32_t IncomingCall::int_argument(std::size_t index) const {
  return g_variant_get_int32(child(invocation_.get(), index).get());
}

std::string IncomingCall::text_argument(std::size_t index) const {
  return g_variant_get_string(child(invocation_.get(), index).get(), nullptr);
}

void IncomingCall::reply(int result) const { reply_value(g_variant_new("(i)", result)); }

void IncomingCall::reply_value(GVariant *value) const {
  g_dbus_method_invocation_return_value(invocation_.get(), value);
}

void IncomingCall::reply_error(const char *name, const char *message) const {
  g_dbus_method_invocation_return_dbus_error(invocation_.get(), name, message);
}

void IncomingCall::reply_raw(GVariant *value) const {
  const Handle<GDBusMessage, &g_object_unref> message(
      g_dbus_message_new_method_reply(g_dbus_method_invocation_get_message(invocation_.get())));
  g_dbus_message_set_body(message.get(), value);
  g_dbus_connection_send_message(connection_, message.get(), G_DBUS_SEND_MESSAGE_FLAGS_NONE,
                                 nullptr, nullptr);
  g_object_unref(invocation_.get());  // as a reply would have done
}

void IncomingCall::call_back(const char *method, GVariant *arguments,
                             std::function<void()> then) const {
  ++unanswered;
  g_dbus_connection_call(connection_, client().c_str(), kQuarnObjectPath, kQuarnInterface, method,
                         arguments, G_VARIANT_TYPE("(i)"), G_DBUS_CALL_FLAGS_NONE, -1, nullptr,
                         after_call_back, new std::function<void()>(std::move(then)));
}

FakeDaemon::FakeDaemon(const PrivateBus &bus) : connection_(bus.connect()) {
  static const GDBusInterfaceVTable table = {on_call, nullptr, nullptr, {}};
  const NodeInfo node(g_dbus_node_info_new_for_xml(kDaemonXml, nullptr));
  object_ = g_dbus_connection_register_object(connection_.get(), kQuarnObjectPath,
                                              node->interfaces[0], &table, this, nullptr, nullptr);
  packages_object_ = g_dbus_connection_register_object(
      connection_.get(), kPackagesPath, node->interfaces[1], &table, this, nullptr, nullptr);
  GErrorPtr error;
  const GVariantPtr reply(g_dbus_connection_call_sync(
      connection_.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
      "RequestName", g_variant_new("(su)", kQuarnBusName, 0U), nullptr, G_DBUS_CALL_FLAGS_NONE, -1,
      nullptr, out(error)));
  EXPECT_TRUE(reply) << (error ? error->message : "");
}

FakeDaemon::~FakeDaemon() {
  // An answer may still be on its way when quarnctl itself has ended.
  EXPECT_TRUE(run_until([] { return unanswered == 0; }));
  die();
}

void FakeDaemon::give_name_up() {
  const GVariantPtr reply(g_dbus_connection_call_sync(
      connection_.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
      "ReleaseName", g_variant_new("(s)", kQuarnBusName), nullptr, G_DBUS_CALL_FLAGS_NONE, -1,
      nullptr, nullptr));
  EXPECT_TRUE(reply);
}

void FakeDaemon::die() {
  if (g_dbus_connection_is_closed(connection_.get()) == FALSE) {
    g_dbus_connection_flush_sync(connection_.get(), nullptr, nullptr);
    g_dbus_connection_unregister_object(connection_.get(), object_);
    g_dbus_connection_unregister_object(connection_.get(), packages_object_);
    if (status_filter_ != 0) g_dbus_connection_remove_filter(connection_.get(), status_filter_);
    status_filter_ = 0;
    g_dbus_connection_close_sync(connection_.get(), nullptr, nullptr);
  }
  while (g_main_context_iteration(nullptr, FALSE) != FALSE) {
  }
}

void FakeDaemon::serve_status(GVariant *properties) {
  status_.reset(g_variant_ref_sink(properties));
  status_filter_ = g_dbus_connection_add_filter(connection_.get(), answer_status, this, nullptr);
}

void FakeDaemon::serve_kept_packages(GVariant *packages) {
  kept_.reset(g_variant_ref_sink(packages));
}

GDBusMessage *FakeDaemon::answer_status(GDBusConnection *connection, GDBusMessage *message,
                                        gboolean incoming, gpointer user_data) {
  auto *self = static_cast<FakeDaemon *>(user_data);
  const char *path = g_dbus_message_get_path(message);
  if (incoming == FALSE || path == nullptr || std::string(path) != "/org/orvane/Quarn/Status") {
    return message;
  }
  const Handle<GDBusMessage, &g_object_unref> reply(g_dbus_message_new_method_reply(message));
  if (self->kept_ && g_strcmp0(g_dbus_message_get_member(message), "Get") == 0) {
    g_dbus_message_set_body(reply.get(), g_variant_new("(v)", self->kept_.get()));
  } else {
    g_dbus_message_set_body(reply.get(), g_variant_new("(@a{sv})", self->status_.get()));
  }
  g_dbus_connection_send_message(connection, reply.get(), G_DBUS_SEND_MESSAGE_FLAGS_NONE, nullptr,
                                 nullptr);
  g_object_unref(message);
  return nullptr;
}

void FakeDaemon::publish(const std::string &text) {
  GErrorPtr error;
  EXPECT_TRUE(g_dbus_connection_emit_signal(connection_.get(), nullptr, "/progress",
                                            kQuarnInterface, "progress",
                                            g_variant_new("(s)", text.c_str()), out(error)));
}

void FakeDaemon::on_call(GDBusConnection *connection, const char *, const char *, const char *,
                         const char *method, GVariant *, GDBusMethodInvocation *invocation,
                         gpointer user_data) {
  auto *self = static_cast<FakeDaemon *>(user_data);
  self->calls_.emplace_back(method);
  const auto found = self->scripts_.find(method);
  if (found == self->scripts_.end()) {
    g_dbus_method_invocation_return_dbus_error(invocation, "org.freedesktop.DBus.Error.Failed",
                                               "the test expects no such call");
    return;
  }
  // A copy: the script may replace itself.
  const Script script = found->second;
  script(IncomingCall(connection, invocation));
}

QuarnctlRun::QuarnctlRun(const PrivateBus &bus, const std::vector<std::string> &arguments,
                         unsigned short columns) {
  const bool terminal = columns != 0;
  int flags = G_SUBPROCESS_FLAGS_STDERR_PIPE;
  if (!terminal) flags |= G_SUBPROCESS_FLAGS_STDOUT_PIPE;
  const Handle<GSubprocessLauncher, &g_object_unref> launcher(
      g_subprocess_launcher_new(static_cast<GSubprocessFlags>(flags)));
  g_subprocess_launcher_setenv(launcher.get(), "DBUS_SYSTEM_BUS_ADDRESS", bus.address().c_str(),
                               TRUE);
  g_subprocess_launcher_setenv(launcher.get(), "TZ", "UTC", TRUE);
  g_subprocess_launcher_setenv(launcher.get(), "TERM", "xterm", TRUE);
  if (terminal) {
    int master = -1;
    int slave = -1;
    const winsize size = {kRows, columns, 0, 0};
    EXPECT_EQ(openpty(&master, &slave, nullptr, nullptr, &size), 0);
    terminal_.reset(master);
    fcntl(master, F_SETFL, O_NONBLOCK);
    fcntl(master, F_SETFD, FD_CLOEXEC);
    g_subprocess_launcher_take_stdin_fd(launcher.get(), fcntl(slave, F_DUPFD_CLOEXEC, 0));
    g_subprocess_launcher_take_stdout_fd(launcher.get(), slave);
    terminal_source_ = g_unix_fd_add(
        master, static_cast<GIOCondition>(G_IO_IN | G_IO_HUP | G_IO_ERR), on_terminal, this);
  }
  std::vector<const char *> argv{QUARNCTL};
  for (const std::string &argument : arguments) argv.push_back(argument.c_str());
  argv.push_back(nullptr);
  GErrorPtr error;
  process_.reset(g_subprocess_launcher_spawnv(launcher.get(), argv.data(), out(error)));
  EXPECT_TRUE(process_) << (error ? error->message : "");
  g_subprocess_communicate_utf8_async(process_.get(), nullptr, nullptr, on_end, this);
}

QuarnctlRun::~QuarnctlRun() {
  if (!ended_) {
    g_subprocess_force_exit(process_.get());
    run_until([this] { return ended_; });
  }
  if (terminal_source_ != 0) g_source_remove(terminal_source_);
}

gboolean QuarnctlRun::on_terminal(int fd, GIOCondition, gpointer user_data) {
  auto *self = static_cast<QuarnctlRun *>(user_data);
  char buffer[4096];
  const ssize_t got = read(fd, buffer, sizeof buffer);
  if (got > 0) {
    self->outcome_.out.append(buffer, static_cast<std::size_t>(got));
    return G_SOURCE_CONTINUE;
  }
  self->terminal_source_ = 0;
  return G_SOURCE_REMOVE;
}

void QuarnctlRun::on_end(GObject *source, GAsyncResult *result, gpointer user_data) {
  auto *self = static_cast<QuarnctlRun *>(user_data);
  char *stdout_text = nullptr;
  char *stderr_text = nullptr;
  GErrorPtr error;
  EXPECT_TRUE(g_subprocess_communicate_utf8_finish(G_SUBPROCESS(source), result, &stdout_text,
                                                   &stderr_text, out(error)))
      << (error ? error->message : "");
  const GText stdout_owner(stdout_text);
  const GText stderr_owner(stderr_text);
  if (stdout_text != nullptr) self->outcome_.out = stdout_text;
  if (stderr_text != nullptr) self->outcome_.err = stderr_text;
  GSubprocess *process = self->process_.get();
  self->outcome_.exit = g_subprocess_get_if_exited(process) != FALSE
                            ? g_subprocess_get_exit_status(process)
                            : -g_subprocess_get_term_sig(process);
  self->ended_ = true;
}

void QuarnctlRun::signal(int number) { g_subprocess_send_signal(process_.get(), number); }

void QuarnctlRun::type(const std::string &text) {
  EXPECT_EQ(write(terminal_.get(), text.data(), text.size()), static_cast<ssize_t>(text.size()));
}

Outcome QuarnctlRun::wait() {
  EXPECT_TRUE(run_until([this] { return ended_ && terminal_source_ == 0; }))
      << "quarnctl has not ended";
  return outcome_;
}

Outcome quarnctl(const PrivateBus &bus, const std::vector<std::string> &arguments) {
  return QuarnctlRun(bus, arguments).wait();
}

GVariant *status_arguments(int error, int status, std::uint32_t req_id) {
  return g_variant_new("(iiu)", error, status, req_id);
}

GVariant *text_arguments(int error, const std::string &text, std::uint32_t req_id) {
  return g_variant_new("(isu)", error, text.c_str(), req_id);
}
