#include "daemon_run.h"

#include <signal.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>

#include "device.h"
#include "device_bus.h"
#include "device_view.h"
#include "state/power.h"

namespace {

constexpr char kRestartsFile[] = "run/restarts";
/** A daemon that asks for its restart gets it this often in a row. */
constexpr int kMaxRestarts = 5;

/** The daemon beside this program, or an installed one; empty when there is none. */
std::string daemon_program() {
  const std::string beside = program_directory() + "/quarnd";
  for (const char *program : {beside.c_str(), QUARN_INSTALLED_DAEMON, "/usr/sbin/quarnd"}) {
    if (access(program, X_OK) == 0) return program;
  }
  return "";
}

/** Count the restarts in a row; a clean end begins a new one. */
bool may_restart(const std::string &device, bool failed) {
  const std::string path = device + "/" + kRestartsFile;
  int restarts = 0;
  std::ifstream(path) >> restarts;
  if (!failed || restarts >= kMaxRestarts) {
    unlink(path.c_str());
    return false;
  }
  write_file(path, std::to_string(restarts + 1) + "\n");
  return true;
}

/** Ask the bus for the daemon without waiting for it. */
void request_daemon(const std::string &device) {
  const Connection connection = connect_bus(device);
  const std::unique_ptr<GDBusMessage, Unref> message(
      g_dbus_message_new_method_call("org.freedesktop.DBus", "/org/freedesktop/DBus",
                                     "org.freedesktop.DBus", "StartServiceByName"));
  g_dbus_message_set_body(message.get(), g_variant_new("(su)", kBusName, 0U));
  g_dbus_message_set_flags(message.get(), G_DBUS_MESSAGE_FLAGS_NO_REPLY_EXPECTED);
  g_dbus_connection_send_message(connection.get(), message.get(), G_DBUS_SEND_MESSAGE_FLAGS_NONE,
                                 nullptr, nullptr);
  // An answer tells that the bus has read this far: it still counts us as the daemon's start then,
  // and one that never took its name is not started again and again.
  GVariant *answer = call_bus(connection.get(), "GetId", nullptr, nullptr);
  if (answer == nullptr) throw Failure("cannot ask the bus for the daemon");
  g_variant_unref(answer);
}

/** Run the daemon to its end. @return its status as waitpid() tells it */
int run_daemon(const std::string &program, const std::string &device) {
  const pid_t self = getpid();
  const pid_t pid = fork();
  if (pid < 0) throw Failure("cannot start the daemon: " + reason());
  if (pid == 0) {
    prctl(PR_SET_PDEATHSIG, SIGTERM);
    if (getppid() != self) _exit(DEVICE_FAILED);
    execl(program.c_str(), "quarnd", nullptr);
    std::fprintf(stderr, "quarn-device: cannot run %s: %s\n", program.c_str(),
                 std::strerror(errno));
    _exit(DEVICE_OK);
  }
  int status = 0;
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  embedded::drop_power_locks(device, pid);
  return status;
}

/** Told to end before it could hear of it: nothing was begun, and nobody was answered. */
bool ended_unprepared(int status) {
  if (!WIFSIGNALED(status)) return false;
  const int number = WTERMSIG(status);
  return number == SIGTERM || number == SIGINT || number == SIGHUP || number == SIGQUIT;
}

}  // namespace

void recover_after_boot() {
  const std::string program = daemon_program();
  if (program.empty()) return;
  const pid_t supervisor = getpid();
  const pid_t pid = fork();
  if (pid < 0) throw Failure("cannot start the recovery: " + reason());
  if (pid == 0) {
    prctl(PR_SET_PDEATHSIG, SIGTERM);
    if (getppid() != supervisor) _exit(DEVICE_FAILED);
    execl(program.c_str(), "quarnd", "--recover", nullptr);
    _exit(DEVICE_FAILED);
  }
  while (waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
  }
}

void forget_restarts(const std::string &device) { unlink((device + "/" + kRestartsFile).c_str()); }

int verb_daemon(const Arguments &arguments) {
  if (arguments.size() != 1) wrong_use();
  const std::string program = daemon_program();
  if (program.empty()) {
    throw Failure("no quarnd beside this program nor in its place of installation");
  }
  const std::string &device = arguments[0];
  set_environment(device);
  int status = run_daemon(program, device);
  // The bus still waits for the name, with the calls that the daemon was started for.
  for (int i = 0; i < kMaxRestarts && ended_unprepared(status); ++i) {
    status = run_daemon(program, device);
  }
  // What a service manager does for a daemon that ends with a failure status. The bus starts it,
  // so that a caller of this very moment does not start another one.
  if (may_restart(device, WIFEXITED(status) && WEXITSTATUS(status) != 0)) request_daemon(device);
  // The bus hears of this only while it waits for the daemon's name: a daemon that ended without
  // taking it (nobody signed in, say) must not keep its callers waiting.
  return DEVICE_FAILED;
}
