#include "device_bus.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <unistd.h>

#include "device.h"
#include "state/state_file.h"

pid_t start_bus(const std::string &device) {
  const std::string config = write_bus_files(device);
  unlink((device + "/run/bus").c_str());
  int address[2];
  if (pipe2(address, O_CLOEXEC) != 0) throw Failure("cannot make a pipe: " + reason());
  const pid_t supervisor = getpid();
  const pid_t pid = fork();
  if (pid < 0) throw Failure("cannot start the bus: " + reason());
  if (pid == 0) {
    prctl(PR_SET_PDEATHSIG, SIGTERM);
    if (getppid() != supervisor) _exit(1);
    const int out = dup(address[1]);  // without close-on-exec
    execlp("dbus-daemon", "dbus-daemon", ("--config-file=" + config).c_str(), "--nofork",
           "--nopidfile", "--nosyslog", ("--print-address=" + std::to_string(out)).c_str(),
           nullptr);
    _exit(127);
  }
  close(address[1]);
  const Fd in(address[0]);
  char text[512];
  const ssize_t length = TEMP_FAILURE_RETRY(read(in.fd, text, sizeof text));
  if (length <= 0) throw Failure("the bus did not start; see " + device + "/log/device.log");
  return pid;
}

Connection connect_bus(const std::string &device) {
  GError *error = nullptr;
  Connection connection(g_dbus_connection_new_for_address_sync(
      bus_address(device).c_str(),
      static_cast<GDBusConnectionFlags>(G_DBUS_CONNECTION_FLAGS_AUTHENTICATION_CLIENT |
                                        G_DBUS_CONNECTION_FLAGS_MESSAGE_BUS_CONNECTION),
      nullptr, nullptr, &error));
  if (!connection) {
    const std::string text = error->message;
    g_error_free(error);
    throw Failure("the device's bus does not answer: " + text);
  }
  return connection;
}

GVariant *call_bus(GDBusConnection *connection, const char *method, GVariant *arguments,
                   GError **error) {
  return g_dbus_connection_call_sync(connection, "org.freedesktop.DBus", "/org/freedesktop/DBus",
                                     "org.freedesktop.DBus", method, arguments, nullptr,
                                     G_DBUS_CALL_FLAGS_NONE, -1, nullptr, error);
}

std::string bus_address(const std::string &device) {
  const embedded::GText escaped(g_dbus_address_escape_value((device + "/run/bus").c_str()));
  return std::string("unix:path=") + escaped.get();
}
