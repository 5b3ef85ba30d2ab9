// Starting and stopping a device: its mount namespace, its bus, its supervisor.
#include <dirent.h>
#include <fcntl.h>
#include <gio/gio.h>
#include <glib-unix.h>
#include <grp.h>
#include <poll.h>
#include <pwd.h>
#include <sched.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/timerfd.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <set>
#include <sstream>

#include "device.h"
#include "state/alarms.h"
#include "state/clock.h"
#include "state/power.h"
#include "state/state_file.h"
#include "state/watch.h"

namespace {

namespace fs = std::filesystem;

constexpr char kAppsPath[] = "/opt/usr/apps";
constexpr char kTmpPath[] = "/tmp";
/** What the daemon makes below /tmp: it is the device's own, whatever the host has there. */
constexpr char kDaemonTmpEntry[] = "quarn";
constexpr char kSupervisorFile[] = "run/supervisor";
constexpr char kMountsFile[] = "run/tmp-mounts";
constexpr char kRestartsFile[] = "run/restarts";
/** The supervisor keeps the host's own /tmp open under this number. */
constexpr int kHostTmpFd = 100;
/** A daemon that is told to end tells its clients first; a stop waits longer than it for that. */
constexpr int kDaemonSeconds = 8;
constexpr int kStopSeconds = 12;
constexpr int kStartMilliseconds = 20000;
constexpr int kMillisInSecond = 1000;
constexpr char kReady = 'R';
/** A daemon that asks for its restart gets it this often in a row. */
constexpr int kMaxRestarts = 5;

/* ---- the supervisor's record: its process and when that began -------------------------------- */

/** Start time of a process in clock ticks, empty when there is none: a number is used again. */
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

struct Supervisor {
  pid_t pid = 0;
  bool own_namespace = false;
};

bool find_supervisor(const std::string &device, Supervisor *supervisor) {
  std::ifstream file(device + "/" + kSupervisorFile);
  std::string birth;
  if (!(file >> supervisor->pid >> birth >> supervisor->own_namespace)) return false;
  return birth == birth_of(supervisor->pid);
}

/* ---- the view from inside ---------------------------------------------------------------------
 */

/** First component below /tmp of a path, empty when it does not lie there. */
std::string tmp_entry(const std::string &path) {
  const std::string start = std::string(kTmpPath) + "/";
  if (path.compare(0, start.size(), start) != 0) return "";
  const std::string rest = path.substr(start.size());
  return rest.substr(0, rest.find('/'));
}

/**
 * Make an entry of the host's /tmp visible in the device's, which covers it: checkouts and test
 * directories often lie there. What the device has under that name already goes first.
 */
void show_tmp_entry(const std::string &device, int host_tmp, const std::string &name) {
  if (name.empty() || name == "." || name == "..") return;
  const std::string inside = std::string(kTmpPath) + "/" + name;
  struct stat present {};
  if (lstat(inside.c_str(), &present) == 0) return;
  struct stat original {};
  if (fstatat(host_tmp, name.c_str(), &original, AT_SYMLINK_NOFOLLOW) != 0) return;
  if (S_ISDIR(original.st_mode)) {
    if (mkdir(inside.c_str(), 0700) != 0) return;
  } else if (S_ISREG(original.st_mode)) {
    const Fd made(open(inside.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    if (made.fd < 0) return;
  } else {
    return;
  }
  const std::string source = "/proc/self/fd/" + std::to_string(host_tmp) + "/" + name;
  if (mount(source.c_str(), inside.c_str(), nullptr, MS_BIND | MS_REC, nullptr) != 0) {
    throw Failure("cannot show " + inside + " inside the device: " + reason());
  }
  std::ofstream(device + "/" + kMountsFile, std::ios::app) << name << "\n";
}

/** Remove the empty places where entries of the host's /tmp were shown. */
void forget_tmp_entries(const std::string &device) {
  std::ifstream file(device + "/" + kMountsFile);
  const fs::path places = device + "/root/tmp";
  std::string name;
  while (std::getline(file, name)) {
    const fs::path place = places / name;
    struct stat status {};
    if (lstat(place.c_str(), &status) != 0) continue;
    if (S_ISDIR(status.st_mode)) {
      rmdir(place.c_str());
    } else if (S_ISREG(status.st_mode) && status.st_size == 0) {
      unlink(place.c_str());
    }
  }
  unlink((device + "/" + kMountsFile).c_str());
}

void make_apps_path() {
  std::error_code error;
  fs::create_directories(kAppsPath, error);
  if (error && !fs::is_directory(kAppsPath)) {
    throw Failure(std::string("cannot make ") + kAppsPath + ": " + error.message());
  }
}

void bind_over(const std::string &source, const char *target) {
  if (mount(source.c_str(), target, nullptr, MS_BIND, nullptr) != 0) {
    throw Failure("cannot mount " + source + " on " + target + ": " + reason());
  }
}

/** Inside, the text @p added is at the end of the machine's file @p path, which stays as it is. */
void show_with(const std::string &device, const char *path, const std::string &added) {
  std::ifstream present(path);
  std::string text((std::istreambuf_iterator<char>(present)), {});
  if (!text.empty() && text.back() != '\n') text += '\n';
  const std::string file = device + "/run/" + fs::path(path).filename().string();
  write_file(file, text + added);
  bind_over(file, path);
}

/**
 * The bus serves only users and groups that the machine knows: inside, the applications' user and
 * the clients' group are known.
 */
void show_users(const std::string &device) {
  constexpr uid_t kAppUser = 5000;
  constexpr char kClientGroup[] = "quarn";
  constexpr gid_t kClientGroupNumber = 5999;
  if (getpwuid(kAppUser) == nullptr) {
    const std::string id = std::to_string(kAppUser);
    show_with(device, "/etc/passwd",
              "quarn-app:x:" + id + ":" + id + "::/nonexistent:/usr/sbin/nologin\n");
  }
  if (getgrnam(kClientGroup) == nullptr) {
    show_with(device, "/etc/group",
              std::string(kClientGroup) + ":x:" + std::to_string(kClientGroupNumber) + ":\n");
  }
}

/** A mount namespace of the device's own. False when this process may not make one. */
bool enter_own_namespace(const std::string &device) {
  if (unshare(CLONE_NEWNS) != 0) {
    if (errno == EPERM || errno == ENOSYS) return false;
    throw Failure("cannot make a mount namespace: " + reason());
  }
  if (mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
    if (errno == EPERM || errno == EACCES) return false;
    throw Failure("cannot make the mounts private: " + reason());
  }
  make_apps_path();
  const int host_tmp = open(kTmpPath, O_PATH | O_DIRECTORY | O_CLOEXEC);
  if (host_tmp < 0 || dup3(host_tmp, kHostTmpFd, O_CLOEXEC) < 0) {
    throw Failure(std::string("cannot open ") + kTmpPath + ": " + reason());
  }
  close(host_tmp);
  bind_over(device + "/root/opt/usr/apps", kAppsPath);
  bind_over(device + "/root/tmp", kTmpPath);
  show_tmp_entry(device, kHostTmpFd, tmp_entry(device));
  show_tmp_entry(device, kHostTmpFd, tmp_entry(program_directory()));
  show_users(device);
  return true;
}

/** Without a namespace the host's own path leads to the device; one device at a time. */
void map_apps_path(const std::string &device) {
  const std::string target = device + "/root/opt/usr/apps";
  std::error_code error;
  fs::create_directories(fs::path(kAppsPath).parent_path(), error);
  if (fs::is_symlink(kAppsPath, error)) {
    const std::string present = fs::read_symlink(kAppsPath, error).string();
    if (present == target) return;
    // A link that a device left behind which was not stopped is in nobody's way.
    const std::string below = "/root/opt/usr/apps";
    const bool of_device = present.size() > below.size() &&
                           present.compare(present.size() - below.size(), below.size(), below) == 0;
    if (fs::exists(kAppsPath, error) &&
        (!of_device || is_started(present.substr(0, present.size() - below.size())))) {
      throw Failure(std::string(kAppsPath) + " is mapped to another device: stop that one first");
    }
    fs::remove(kAppsPath, error);
  } else if (fs::exists(kAppsPath, error) && rmdir(kAppsPath) != 0) {
    throw Failure(std::string(kAppsPath) +
                  " is in use on this machine, and mount namespaces are "
                  "not permitted");
  }
  if (symlink(target.c_str(), kAppsPath) != 0) {
    throw Failure(std::string("cannot map ") + kAppsPath + ": " + reason());
  }
}

void unmap_apps_path(const std::string &device) {
  std::error_code error;
  if (fs::is_symlink(kAppsPath, error) &&
      fs::read_symlink(kAppsPath, error) == device + "/root/opt/usr/apps") {
    fs::remove(kAppsPath, error);
  }
}

void set_environment(const std::string &device) {
  setenv(embedded::kDeviceVariable, device.c_str(), 1);
  setenv("QUARN_CLOUD_CONFIG", embedded::state_path(device, "cloud.conf").c_str(), 1);
  setenv("DBUS_SYSTEM_BUS_ADDRESS", bus_address(device).c_str(), 1);
}

/* ---- the bus ----------------------------------------------------------------------------------
 */

/** Start the bus daemon; returns once it listens. */
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

struct Unref {
  void operator()(gpointer object) const { g_object_unref(object); }
};
using Connection = std::unique_ptr<GDBusConnection, Unref>;

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

/* ---- the supervisor ---------------------------------------------------------------------------
 */

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

/** The daemon beside this program, or an installed one; empty when there is none. */
std::string daemon_program() {
  const std::string beside = program_directory() + "/quarnd";
  for (const char *program : {beside.c_str(), QUARN_INSTALLED_DAEMON, "/usr/sbin/quarnd"}) {
    if (access(program, X_OK) == 0) return program;
  }
  return "";
}

/** What a device does once after it has booted, before anybody may use its bus. */
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

/** @param lock of the start, held until the supervisor can be found: a start may be killed */
[[noreturn]] void supervise(const std::string &device, int tell, int lock) {
  int status = DEVICE_FAILED;
  try {
    signal(SIGHUP, SIG_IGN);
    signal(SIGPIPE, SIG_IGN);
    Running self;
    self.device = device;
    self.own_namespace = enter_own_namespace(device);
    if (!self.own_namespace) map_apps_path(device);
    set_environment(device);
    recover_after_boot();
    self.bus = start_bus(device);
    write_file(device + "/" + kSupervisorFile, std::to_string(getpid()) + " " + birth_of(getpid()) +
                                                   " " + (self.own_namespace ? "1" : "0") + "\n");
    close(lock);
    // From here on GLib may have threads of its own.
    self.connection = connect_bus(device);
    GVariant *hello = call_bus(self.connection.get(), "GetId", nullptr, nullptr);
    if (hello == nullptr) throw Failure("the device's bus does not answer");
    g_variant_unref(hello);
    g_dbus_connection_set_exit_on_close(self.connection.get(), FALSE);
    self.loop = g_main_loop_new(nullptr, FALSE);
    g_unix_signal_add(SIGTERM, on_stop, &self);
    g_unix_signal_add(SIGINT, on_stop, &self);
    g_child_watch_add(self.bus, on_bus_exit, &self);
    g_dbus_connection_signal_subscribe(self.connection.get(), "org.freedesktop.DBus",
                                       "org.freedesktop.DBus", "NameOwnerChanged",
                                       "/org/freedesktop/DBus", kBusName, G_DBUS_SIGNAL_FLAGS_NONE,
                                       on_owner_changed, &self, nullptr);
    self.timer = timerfd_create(CLOCK_REALTIME, TFD_NONBLOCK | TFD_CLOEXEC);
    g_unix_fd_add(self.timer, G_IO_IN, on_timer, &self);
    self.alarms = std::make_unique<embedded::StateWatch>(device, embedded::kAlarmsFile,
                                                         [&self] { look_at_alarms(&self); });
    self.clock = std::make_unique<embedded::StateWatch>(device, embedded::kClockFile,
                                                        [&self] { look_at_alarms(&self); });
    const std::string note = self.own_namespace
                                 ? std::string()
                                 : std::string("mount namespaces are not permitted here: ") +
                                       kAppsPath + " is mapped to this device";
    const std::string message = kReady + note;
    if (write(tell, message.data(), message.size()) < 0) std::perror("quarn-device");
    close(tell);
    look_at_alarms(&self);
    g_main_loop_run(self.loop);

    if (self.bus != 0) {
      stop_daemon(&self);
      kill(self.bus, SIGTERM);
      waitpid(self.bus, nullptr, 0);
    }
    if (!self.own_namespace) unmap_apps_path(device);
    unlink((device + "/run/bus").c_str());
    status = DEVICE_OK;
  } catch (const std::exception &error) {
    std::fprintf(stderr, "quarn-device: %s\n", error.what());
    if (write(tell, error.what(), std::strlen(error.what())) < 0) std::perror("quarn-device");
  }
  std::fflush(nullptr);
  _exit(status);
}

/* ---- what is left ------------------------------------------------------------------------------
 */

/** Which mount namespace a process is in, empty when it cannot be told. */
std::string namespace_of(const std::string &pid) {
  std::error_code error;
  return fs::read_symlink("/proc/" + pid + "/ns/mnt", error).string();
}

/**
 * Processes in the device's mount namespace, or whose environment says that they run inside the
 * device, but for our own ancestors.
 */
std::set<pid_t> processes_inside(const std::string &device, const std::string &space) {
  std::set<pid_t> ancestors;
  for (pid_t pid = getpid(); pid > 1;) {
    ancestors.insert(pid);
    std::ifstream file("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    pid = 0;
    while (std::getline(file, line)) {
      if (line.compare(0, 5, "PPid:") == 0) pid = std::atoi(line.c_str() + 5);
    }
  }
  const std::string wanted = std::string(embedded::kDeviceVariable) + "=" + device;
  std::set<pid_t> found;
  DIR *proc = opendir("/proc");
  if (proc == nullptr) return found;
  while (const dirent *entry = readdir(proc)) {
    const pid_t pid = std::atoi(entry->d_name);
    if (pid <= 0 || ancestors.count(pid) != 0) continue;
    if (!space.empty() && namespace_of(entry->d_name) == space) {
      if (!birth_of(pid).empty()) found.insert(pid);
      continue;
    }
    std::ifstream file(std::string("/proc/") + entry->d_name + "/environ", std::ios::binary);
    std::string variable;
    while (std::getline(file, variable, '\0')) {
      if (variable != wanted) continue;
      if (!birth_of(pid).empty()) found.insert(pid);
      break;
    }
  }
  closedir(proc);
  return found;
}

/** Wait for a process to end. False when it has not within the time. */
bool wait_for_end(pid_t pid, int seconds) {
  const Fd process(static_cast<int>(syscall(SYS_pidfd_open, pid, 0)));
  if (process.fd < 0) return true;
  pollfd ended{process.fd, POLLIN, 0};
  return poll(&ended, 1, seconds * kMillisInSecond) != 0;
}

void end_leftovers(const std::string &device, const std::string &space) {
  for (const int signal_number : {SIGTERM, SIGKILL}) {
    const std::set<pid_t> left = processes_inside(device, space);
    for (const pid_t pid : left) kill(pid, signal_number);
    for (const pid_t pid : left) wait_for_end(pid, signal_number == SIGTERM ? 2 : kStopSeconds);
  }
}

class StartLock {
 public:
  explicit StartLock(const std::string &device)
      : lock_(open((device + "/run/.start").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600)) {
    if (lock_.fd < 0 || TEMP_FAILURE_RETRY(flock(lock_.fd, LOCK_EX)) != 0) {
      throw Failure("cannot lock the device: " + reason());
    }
  }

  int fd() const { return lock_.fd; }

 private:
  Fd lock_;
};

/** Fork the supervisor. @return the end of the pipe on which it tells how it went */
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

std::string read_all(int fd) {
  std::string text;
  char buffer[512];
  pollfd ready{fd, POLLIN, 0};
  while (poll(&ready, 1, kStartMilliseconds) > 0) {
    const ssize_t length = TEMP_FAILURE_RETRY(read(fd, buffer, sizeof buffer));
    if (length <= 0) break;
    text.append(buffer, static_cast<std::size_t>(length));
  }
  return text;
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

void write_file(const std::string &path, const std::string &text) {
  std::ofstream file(path, std::ios::trunc);
  file << text;
  file.close();
  if (!file) throw Failure("cannot write " + path + ": " + reason());
}

std::string bus_address(const std::string &device) {
  const embedded::GText escaped(g_dbus_address_escape_value((device + "/run/bus").c_str()));
  return std::string("unix:path=") + escaped.get();
}

bool is_started(const std::string &device) {
  Supervisor supervisor;
  return find_supervisor(device, &supervisor);
}

int verb_start(const Arguments &arguments) {
  if (arguments.size() != 1) wrong_use();
  const std::string device = open_device(arguments[0]);
  if ((device + "/run/bus").size() >= sizeof(sockaddr_un{}.sun_path)) {
    throw Failure("the path of the device is too long for its bus socket");
  }
  const StartLock lock(device);
  if (is_started(device)) return DEVICE_OK;
  if ((device + "/").compare(0, sizeof kAppsPath, std::string(kAppsPath) + "/") == 0) {
    throw Failure(std::string("a device cannot lie below ") + kAppsPath + ", which it covers");
  }
  close_folders(device);
  end_leftovers(device, "");
  forget_tmp_entries(device);
  embedded::sweep_state(device);
  unlink((device + "/" + kRestartsFile).c_str());
  const Fd told(fork_supervisor(device, lock.fd()));
  const std::string answer = read_all(told.fd);
  if (answer.empty() || answer[0] != kReady) {
    end_leftovers(device, "");
    throw Failure(answer.empty() ? "the device did not start; see " + device + "/log/device.log"
                                 : answer);
  }
  if (answer.size() > 1) std::fprintf(stderr, "quarn-device: %s\n", answer.c_str() + 1);
  return DEVICE_OK;
}

int verb_stop(const Arguments &arguments) {
  if (arguments.size() != 1) wrong_use();
  const std::string device = open_device(arguments[0]);
  const StartLock lock(device);
  Supervisor supervisor;
  std::string space;
  // Held open, the namespace's number is not given to another one meanwhile.
  Fd held;
  if (find_supervisor(device, &supervisor)) {
    const std::string process = std::to_string(supervisor.pid);
    held.fd = open(("/proc/" + process + "/ns/mnt").c_str(), O_RDONLY | O_CLOEXEC);
    if (supervisor.own_namespace && held.fd >= 0) space = namespace_of(process);
    kill(supervisor.pid, SIGTERM);
    if (!wait_for_end(supervisor.pid, kStopSeconds)) {
      kill(supervisor.pid, SIGKILL);
      wait_for_end(supervisor.pid, kStopSeconds);
    }
  }
  end_leftovers(device, space);
  unmap_apps_path(device);
  forget_tmp_entries(device);
  unlink((device + "/" + kSupervisorFile).c_str());
  unlink((device + "/run/bus").c_str());
  return DEVICE_OK;
}

int verb_exec(const Arguments &arguments) {
  if (arguments.size() < 3 || arguments[1] != "--") wrong_use();
  const std::string device = open_device(arguments[0]);
  Supervisor supervisor;
  if (!find_supervisor(device, &supervisor)) throw Failure("the device is not started");
  const std::string programs = program_directory();
  std::error_code error;
  const std::string here = fs::current_path(error).string();
  if (supervisor.own_namespace) {
    const std::string process = "/proc/" + std::to_string(supervisor.pid);
    const Fd space(open((process + "/ns/mnt").c_str(), O_RDONLY | O_CLOEXEC));
    // A process with threads may only move with a view of the file system of its own.
    if (space.fd < 0 || unshare(CLONE_FS) != 0 || setns(space.fd, CLONE_NEWNS) != 0) {
      throw Failure("cannot enter the device: " + reason());
    }
    const Fd mounts_lock(
        open((device + "/run/.mounts").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
    if (mounts_lock.fd >= 0) flock(mounts_lock.fd, LOCK_EX);
    const Fd host_tmp(open((process + "/fd/" + std::to_string(kHostTmpFd)).c_str(),
                           O_PATH | O_DIRECTORY | O_CLOEXEC));
    std::set<std::string> wanted{tmp_entry(here + "/"), tmp_entry(programs)};
    for (std::size_t i = 2; i < arguments.size(); ++i) {
      const std::string &argument = arguments[i];
      const auto value = argument[0] == '-' ? argument.find('=') : std::string::npos;
      const std::string entry =
          tmp_entry(value == std::string::npos ? argument : argument.substr(value + 1));
      if (entry != kDaemonTmpEntry) wanted.insert(entry);
    }
    for (const std::string &name : wanted) show_tmp_entry(device, host_tmp.fd, name);
    if (chdir(here.c_str()) != 0 && chdir("/") != 0) {
      throw Failure("cannot change the directory: " + reason());
    }
  }
  set_environment(device);
  const char *path = std::getenv("PATH");
  setenv("PATH",
         (programs + ":" + (path == nullptr ? "/usr/sbin:/usr/bin:/sbin:/bin" : path)).c_str(), 1);
  std::vector<char *> command;
  for (std::size_t i = 2; i < arguments.size(); ++i) {
    command.push_back(const_cast<char *>(arguments[i].c_str()));
  }
  command.push_back(nullptr);
  execvp(command[0], command.data());
  constexpr int kNotFound = 127;
  constexpr int kNotRun = 126;
  throw Failure("cannot run " + arguments[2] + ": " + reason(),
                errno == ENOENT ? kNotFound : kNotRun);
}

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
