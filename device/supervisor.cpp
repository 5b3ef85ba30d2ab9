#include "supervisor.h"

#include <fcntl.h>
#include <glib-unix.h>
#include <poll.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/timerfd.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <sstream>

#include "daemon_run.h"
#include "device.h"
#include "device_bus.h"
#include "device_view.h"
#include "state/alarms.h"
#include "state/clock.h"
#include "state/watch.h"

namespace {

/** A daemon that is told to end tells its clients first; a stop waits longer than it for that. */
constexpr int kDaemonSeconds = 8;
constexpr int kMillisInSecond = 1000;

struct Running {
  std::string device;
  GMainLoop *loop = nullptr;
  pid_t bus = 0;
  Connection connection;
  std::unique_ptr<embedded::StateWatch> alarms;
  std::unique_ptr<embedded::StateWatch> clock;
  int timer = -1;
  bool own_namespace = false;
};

void wake_daemon(Running *self) {
  // A daemon that runs takes the alarm by itself; one that ends without is seen by its name.
  GVariant *reply =
      call_bus(self->connection.get(), "NameHasOwner", g_variant_new("(s)", kBusName), nullptr);
  gboolean running = FALSE;
  if (reply != nullptr) {
    g_variant_get(reply, "(b)", &running);
    g_variant_unref(reply);
  }
  if (running != FALSE) return;
  // Nobody waits for the answer: a daemon that does not want to run ends by itself.
  g_dbus_connection_call(self->connection.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus",
                         "org.freedesktop.DBus", "StartServiceByName",
                         g_variant_new("(su)", kBusName, 0U), nullptr, G_DBUS_CALL_FLAGS_NONE, -1,
                         nullptr, nullptr, nullptr);
}

void look_at_alarms(Running *self) {
  embedded::fire_due_alarms(self->device, embedded::device_now_ms(self->device));
  if (embedded::has_fired_alarms(self->device, kAlarmOwner)) wake_daemon(self);
  itimerspec when{};
  if (const auto due = embedded::next_due(self->device)) {
    // A time before the machine's own epoch is due as well, but cannot be waited for.
    const std::int64_t at =
        std::max<std::int64_t>(*due - embedded::clock_offset_ms(self->device), 1);
    when.it_value.tv_sec = at / kMillisInSecond;
    when.it_value.tv_nsec = at % kMillisInSecond * 1000000L;
  }
  timerfd_settime(self->timer, TFD_TIMER_ABSTIME, &when, nullptr);
}

gboolean on_timer(gint fd, GIOCondition, gpointer data) {
  std::uint64_t count = 0;
  if (read(fd, &count, sizeof count) < 0 && errno == EAGAIN) return G_SOURCE_CONTINUE;
  look_at_alarms(static_cast<Running *>(data));
  return G_SOURCE_CONTINUE;
}

gboolean on_stop(gpointer data) {
  g_main_loop_quit(static_cast<Running *>(data)->loop);
  return G_SOURCE_REMOVE;
}

void on_bus_exit(GPid, gint, gpointer data) {
  auto *self = static_cast<Running *>(data);
  self->bus = 0;
  g_main_loop_quit(self->loop);
}

/** A daemon that ended while an alarm fell due has not taken it: start it again. */
void on_owner_changed(GDBusConnection *, const gchar *, const gchar *, const gchar *, const gchar *,
                      GVariant *parameters, gpointer data) {
  const gchar *owner = nullptr;
  g_variant_get_child(parameters, 2, "&s", &owner);
  auto *self = static_cast<Running *>(data);
  if (*owner == '\0' && embedded::has_fired_alarms(self->device, kAlarmOwner)) {
    wake_daemon(self);
  }
}

void stop_daemon(Running *self) {
  GVariant *reply = call_bus(self->connection.get(), "GetConnectionUnixProcessID",
                             g_variant_new("(s)", kBusName), nullptr);
  if (reply == nullptr) return;
  guint32 pid = 0;
  g_variant_get(reply, "(u)", &pid);
  g_variant_unref(reply);
  const Fd process(static_cast<int>(syscall(SYS_pidfd_open, static_cast<pid_t>(pid), 0)));
  kill(static_cast<pid_t>(pid), SIGTERM);
  if (process.fd < 0) return;
  pollfd ended{process.fd, POLLIN, 0};
  if (poll(&ended, 1, kDaemonSeconds * kMillisInSecond) == 0)
    kill(static_cast<pid_t>(pid), SIGKILL);
}

/** The device's own view of its files, and its bus; the device can be found from then on. */
void start_device(Running *self) {
  self->own_namespace = enter_own_namespace(self->device);
  if (!self->own_namespace) map_apps_path(self->device);
  set_environment(self->device);
  recover_after_boot();
  self->bus = start_bus(self->device);
  write_file(self->device + "/" + kSupervisorFile, std::to_string(getpid()) + " " +
                                                       birth_of(getpid()) + " " +
                                                       (self->own_namespace ? "1" : "0") + "\n");
}

/** Its signals, bus, timer and files as sources of a loop. GLib may have threads of its own then.
 */
void watch_device(Running *self) {
  self->connection = connect_bus(self->device);
  GVariant *hello = call_bus(self->connection.get(), "GetId", nullptr, nullptr);
  if (hello == nullptr) throw Failure("the device's bus does not answer");
  g_variant_unref(hello);
  g_dbus_connection_set_exit_on_close(self->connection.get(), FALSE);
  self->loop = g_main_loop_new(nullptr, FALSE);
  g_unix_signal_add(SIGTERM, on_stop, self);
  g_unix_signal_add(SIGINT, on_stop, self);
  g_child_watch_add(self->bus, on_bus_exit, self);
  g_dbus_connection_signal_subscribe(
      self->connection.get(), "org.freedesktop.DBus", "org.freedesktop.DBus", "NameOwnerChanged",
      "/org/freedesktop/DBus", kBusName, G_DBUS_SIGNAL_FLAGS_NONE, on_owner_changed, self, nullptr);
  self->timer = timerfd_create(CLOCK_REALTIME, TFD_NONBLOCK | TFD_CLOEXEC);
  g_unix_fd_add(self->timer, G_IO_IN, on_timer, self);
  self->alarms = std::make_unique<embedded::StateWatch>(self->device, embedded::kAlarmsFile,
                                                        [self] { look_at_alarms(self); });
  self->clock = std::make_unique<embedded::StateWatch>(self->device, embedded::kClockFile,
                                                       [self] { look_at_alarms(self); });
}

/** To whoever waits for the start. */
void tell_ready(const Running &self, int tell) {
  const std::string note = self.own_namespace
                               ? std::string()
                               : std::string("mount namespaces are not permitted here: ") +
                                     kAppsPath + " is mapped to this device";
  const std::string message = kReady + note;
  if (write(tell, message.data(), message.size()) < 0) std::perror("quarn-device");
  close(tell);
}

void stop_device(Running *self) {
  if (self->bus != 0) {
    stop_daemon(self);
    kill(self->bus, SIGTERM);
    waitpid(self->bus, nullptr, 0);
  }
  if (!self->own_namespace) unmap_apps_path(self->device);
  unlink((self->device + "/run/bus").c_str());
}

/** @param lock of the start, held until the supervisor can be found: a start may be killed */
[[noreturn]] void supervise(const std::string &device, int tell, int lock) {
  int status = DEVICE_FAILED;
  try {
    signal(SIGHUP, SIG_IGN);
    signal(SIGPIPE, SIG_IGN);
    Running self;
    self.device = device;
    start_device(&self);
    close(lock);
    watch_device(&self);
    tell_ready(self, tell);
    look_at_alarms(&self);
    g_main_loop_run(self.loop);
    stop_device(&self);
    status = DEVICE_OK;
  } catch (const std::exception &error) {
    std::fprintf(stderr, "quarn-device: %s\n", error.what());
    if (write(tell, error.what(), std::strlen(error.what())) < 0) std::perror("quarn-device");
  }
  std::fflush(nullptr);
  _exit(status);
}

}  // namespace

std::string birth_of(pid_t pid) {
  std::ifstream file("/proc/" + std::to_string(pid) + "/stat");
  std::string text;
  std::getline(file, text);
  const auto name_end = text.rfind(')');
  if (name_end == std::string::npos) return "";
  std::istringstream fields(text.substr(name_end + 2));
  constexpr int kStartTimeField = 19;  // counted from the state, which is the first
  std::string field;
  fields >> field;
  if (field == "Z" || field == "X") return "";
  for (int i = 0; i < kStartTimeField; ++i) fields >> field;
  return field;
}

bool find_supervisor(const std::string &device, Supervisor *supervisor) {
  std::ifstream file(device + "/" + kSupervisorFile);
  std::string birth;
  if (!(file >> supervisor->pid >> birth >> supervisor->own_namespace)) return false;
  return birth == birth_of(supervisor->pid);
}

bool is_started(const std::string &device) {
  Supervisor supervisor;
  return find_supervisor(device, &supervisor);
}

int fork_supervisor(const std::string &device, int lock) {
  int tell[2];
  if (pipe2(tell, O_CLOEXEC) != 0) throw Failure("cannot make a pipe: " + reason());
  const pid_t child = fork();
  if (child < 0) throw Failure("cannot start: " + reason());
  if (child == 0) {
    setsid();
    if (fork() != 0) _exit(0);
    const int log =
        open((device + "/log/device.log").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    const int null = open("/dev/null", O_RDWR | O_CLOEXEC);
    dup2(null, STDIN_FILENO);
    dup2(log, STDOUT_FILENO);
    dup2(log, STDERR_FILENO);
    // Whoever started us may wait for its pipes to close, or hold locks that must not live on.
    for (int fd = 3; fd < 256; ++fd) {
      if (fd != tell[1] && fd != lock) close(fd);
    }
    if (chdir("/") != 0) _exit(1);
    supervise(device, tell[1], lock);
  }
  close(tell[1]);
  waitpid(child, nullptr, 0);
  return tell[0];
}
