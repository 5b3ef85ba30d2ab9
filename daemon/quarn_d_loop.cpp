#include "quarn_d_loop.h"

#include <Ecore.h>
#include <fcntl.h>
#include <glib.h>
#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <limits>
#include <vector>

#include "detached_thread.h"
#include "quarn_log.h"

namespace {

constexpr int kMillisecondsPerSecond = 1000;
constexpr int kMicrosecondsPerMillisecond = 1000;
constexpr long kNanosecondsPerMillisecond = 1000000;
constexpr int kForever = -1;
/** The watching thread does next to nothing. */
constexpr std::size_t kWatcherStackSize = 131072;

bool initialised = false;
bool running = false;
bool shutdown_deferred = false;

/* ---- GLib inside Ecore's select ------------------------------------------- */

int to_milliseconds(const timeval *timeout) {
  if (timeout == nullptr) return kForever;
  // Rounded up: waking early would make Ecore spin until its timer is due.
  const long long ms =
      static_cast<long long>(timeout->tv_sec) * kMillisecondsPerSecond +
      (timeout->tv_usec + kMicrosecondsPerMillisecond - 1) / kMicrosecondsPerMillisecond;
  return static_cast<int>(std::clamp<long long>(ms, 0, std::numeric_limits<int>::max()));
}

int earlier(int a, int b) {
  if (a == kForever) return b;
  if (b == kForever) return a;
  return std::min(a, b);
}

struct FdSets {
  fd_set *read;
  fd_set *write;
  fd_set *except;
};

/** Take Ecore's descriptors out of their sets, which are left empty for the answer. */
void take_descriptors(int count, const FdSets &sets, std::vector<GPollFD> &polled) {
  for (int fd = 0; fd < count; ++fd) {
    gushort events = 0;
    if (sets.read != nullptr && FD_ISSET(fd, sets.read)) events |= G_IO_IN;
    if (sets.write != nullptr && FD_ISSET(fd, sets.write)) events |= G_IO_OUT;
    if (sets.except != nullptr && FD_ISSET(fd, sets.except)) events |= G_IO_PRI;
    if (events != 0) polled.push_back({fd, events, 0});
  }
  if (sets.read != nullptr) FD_ZERO(sets.read);
  if (sets.write != nullptr) FD_ZERO(sets.write);
  if (sets.except != nullptr) FD_ZERO(sets.except);
}

/** Answer as select() would. @return number of bits set */
int give_descriptors(const GPollFD *begin, const GPollFD *end, const FdSets &sets) {
  int set = 0;
  const auto answer = [&set](int fd, fd_set *into) {
    FD_SET(fd, into);
    ++set;
  };
  for (const GPollFD *entry = begin; entry != end; ++entry) {
    const int broken = entry->revents & (G_IO_ERR | G_IO_HUP | G_IO_NVAL);
    const int readable = (entry->revents & G_IO_IN) | broken;
    const int writable = (entry->revents & G_IO_OUT) | broken;
    if ((entry->events & G_IO_IN) != 0 && readable != 0) answer(entry->fd, sets.read);
    if ((entry->events & G_IO_OUT) != 0 && writable != 0) answer(entry->fd, sets.write);
    if ((entry->events & G_IO_PRI) != 0 && (entry->revents & G_IO_PRI) != 0) {
      answer(entry->fd, sets.except);
    }
  }
  return set;
}

/**
 * Ecore's wait, GLib's sources merged in. poll() is used because a descriptor
 * of a GLib source may not fit into an fd_set. Dispatching may nest a GLib
 * loop and may come back here, so everything lives on the stack.
 */
int select_with_glib(int count, fd_set *read, fd_set *write, fd_set *except, timeval *timeout) {
  GMainContext *context = g_main_context_default();
  const FdSets sets{read, write, except};
  std::vector<GPollFD> polled;
  take_descriptors(count, sets, polled);
  const std::size_t own = polled.size();

  gint priority = 0;
  gint glib_timeout = kForever;
  g_main_context_prepare(context, &priority);
  int room = 0;
  int wanted = 0;
  while ((wanted = g_main_context_query(context, priority, &glib_timeout, polled.data() + own,
                                        room)) > room) {
    room = wanted;
    polled.resize(own + static_cast<std::size_t>(room));
  }
  polled.resize(own + static_cast<std::size_t>(wanted));

  const int result = g_poll(polled.data(), static_cast<guint>(polled.size()),
                            earlier(to_milliseconds(timeout), glib_timeout));
  const int poll_error = errno;
  if (result < 0) {
    for (GPollFD &entry : polled) entry.revents = 0;
  }
  const int set = give_descriptors(polled.data(), polled.data() + own, sets);
  if (g_main_context_check(context, priority, polled.data() + own, wanted) != FALSE) {
    g_main_context_dispatch(context);
  }
  if (result < 0) {
    errno = poll_error;
    return result;
  }
  return set;
}

/** Integrate as Ecore can do it; its complaint when it cannot is no news to anyone. */
bool integrate_quietly() {
  static constexpr char kDomain[] = "ecore";
  const int level = eina_log_domain_level_get(kDomain);
  eina_log_domain_level_set(kDomain, EINA_LOG_LEVEL_CRITICAL);
  const bool integrated = ecore_main_loop_glib_integrate() != EINA_FALSE;
  eina_log_domain_level_set(kDomain, level);
  return integrated;
}

void shut_down() {
  initialised = false;
  shutdown_deferred = false;
  ecore_main_loop_select_func_set(nullptr);
  ecore_shutdown();
  g_main_context_release(g_main_context_default());
}

/* ---- signals ---------------------------------------------------------------- */

struct SignalWatch {
  quarn_signal_watch hooks;
  int read_fd;
  std::atomic<int> received; /**< hands the signal, and all above, to the main thread */
};

/** Written by handlers; -1 while nobody watches. */
std::atomic<int> signal_write_fd{-1};
static_assert(std::atomic<int>::is_always_lock_free, "used in signal context");

gboolean end_on_main_thread(gpointer data) {
  const auto *watch = static_cast<const SignalWatch *>(data);
  const int signo = watch->received.load(std::memory_order_acquire);
  watch->hooks.end(signo);
  return G_SOURCE_REMOVE;
}

void sleep_ms(int ms) {
  timespec left{ms / kMillisecondsPerSecond,
                (ms % kMillisecondsPerSecond) * kNanosecondsPerMillisecond};
  while (clock_nanosleep(CLOCK_MONOTONIC, 0, &left, &left) == EINTR) {
  }
}

/** The next signal; 0 when none came in @p timeout_ms, which may be #kForever. */
int read_signal(int fd, int timeout_ms) {
  pollfd readable{fd, POLLIN, 0};
  int ready = 0;
  while ((ready = poll(&readable, 1, timeout_ms)) < 0 && errno == EINTR) {
  }
  int signo = 0;
  if (ready <= 0) return 0;
  while (read(fd, &signo, sizeof signo) < 0 && errno == EINTR) {
  }
  return signo;
}

/** Returns with the signal that ends the process, when it is to end. */
int wait_for_end(const SignalWatch &watch) {
  int put_off = 0;
  gint64 due = 0;
  for (;;) {
    const gint64 left = due - g_get_monotonic_time();
    const int timeout =
        put_off == 0 ? kForever
                     : static_cast<int>(std::max<gint64>(left, 0) / kMicrosecondsPerMillisecond);
    const int signo = read_signal(watch.read_fd, timeout);
    if (signo == 0) return put_off;
    const int delay_ms = watch.hooks.take(signo);
    if (delay_ms == 0) return signo;
    if (delay_ms < 0) continue;
    put_off = signo;
    due = g_get_monotonic_time() + static_cast<gint64>(delay_ms) * kMicrosecondsPerMillisecond;
  }
}

/** A thread, not a source: the main thread may be blocked in a call to a client. */
void *watch_signals(void *data) {
  auto *watch = static_cast<SignalWatch *>(data);
  const int signo = wait_for_end(*watch);
  watch->hooks.begin_end();
  watch->received.store(signo, std::memory_order_release);
  g_idle_add_full(G_PRIORITY_HIGH, end_on_main_thread, watch, nullptr);
  sleep_ms(watch->hooks.grace_ms);
  watch->hooks.last();
  _exit(EXIT_SUCCESS);
}

}  // namespace

void quarn_loop_init() {
  if (initialised) return;
  // The modules would connect to the system bus on their own.
  setenv("ECORE_NO_SYSTEM_MODULES", "1", 1);
  ecore_init();
  g_main_context_acquire(g_main_context_default());
  if (!integrate_quietly()) ecore_main_loop_select_func_set(select_with_glib);
  initialised = true;
}

void quarn_loop_shutdown() {
  if (!initialised) return;
  if (running) {
    shutdown_deferred = true;
  } else {
    shut_down();
  }
}

void quarn_loop_begin() {
  running = true;
  ecore_main_loop_begin();
  running = false;
  if (shutdown_deferred) shut_down();
}

void quarn_loop_quit() { ecore_main_loop_quit(); }

void *quarn_loop_timer_add(double seconds, unsigned char (*callback)(void *), void *data) {
  return ecore_timer_add(seconds, callback, data);
}

void quarn_loop_timer_del(void *timer) { ecore_timer_del(static_cast<Ecore_Timer *>(timer)); }

bool quarn_loop_watch_signals(const quarn_signal_watch &hooks) {
  int ends[2];
  if (pipe2(ends, O_CLOEXEC) != 0) {
    LOGE("pipe2() failed : %d", errno);
    return false;
  }
  // A handler must never wait for room.
  fcntl(ends[1], F_SETFL, O_NONBLOCK);

  // The thread lives as long as the process does.
  static SignalWatch watch{};
  watch.hooks = hooks;
  watch.read_fd = ends[0];

  const int error = start_detached_thread(kWatcherStackSize, watch_signals, &watch);
  if (error != 0) {
    LOGE("pthread_create() failed : %d", error);
    close(ends[0]);
    close(ends[1]);
    return false;
  }
  signal_write_fd.store(ends[1]);
  return true;
}

void quarn_loop_wake_from_signal(int signo) {
  const int saved = errno;
  const int fd = signal_write_fd.load();
  if (fd >= 0) static_cast<void>(!write(fd, &signo, sizeof signo));
  errno = saved;
}
