#include "platform_log.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <string>

#include "state/clock.h"
#include "state/printable.h"
#include "state/state_file.h"
#include "thread_annotations.h"

namespace {

constexpr std::int64_t kMillisInSecond = 1000;
constexpr long kNanosInMilli = 1000000;
constexpr mode_t kLogMode = 0644;

char letter_of(log_priority level) {
  switch (level) {
    case DLOG_DEBUG:
      return 'D';
    case DLOG_WARN:
      return 'W';
    case DLOG_ERROR:
      return 'E';
    case DLOG_INFO:
      break;
  }
  return 'I';
}

/** syslog's number of a severity, as the journal keeps it. */
int journal_priority(log_priority level) {
  switch (level) {
    case DLOG_DEBUG:
      return 7;
    case DLOG_WARN:
      return 4;
    case DLOG_ERROR:
      return 3;
    case DLOG_INFO:
      break;
  }
  return 6;
}

std::string stamp() {
  timespec now{};
  clock_gettime(CLOCK_REALTIME, &now);
  const std::int64_t ms = now.tv_sec * kMillisInSecond + now.tv_nsec / kNanosInMilli +
                          embedded::clock_offset_ms(embedded::current_device());
  const auto seconds = static_cast<time_t>(ms / kMillisInSecond);
  tm parts{};
  gmtime_r(&seconds, &parts);
  char date[32];
  std::strftime(date, sizeof date, "%Y-%m-%dT%H:%M:%S", &parts);
  char text[48];
  std::snprintf(text, sizeof text, "%s.%03dZ", date, static_cast<int>(ms % kMillisInSecond));
  return text;
}

/** The log file of the device, opened at the first message to it. */
class LogFile {
 public:
  void append(const std::string &line) {
    const std::string device = embedded::current_device();
    const MutexLock lock(mutex_);
    if (device != device_) {
      if (fd_ >= 0) close(fd_);
      fd_ = -1;
      device_ = device;
    }
    if (fd_ < 0 && !device.empty()) {
      fd_ = open((device + "/log/quarnd.log").c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC,
                 kLogMode);
    }
    if (fd_ >= 0) static_cast<void>(!write(fd_, line.data(), line.size()));
  }

 private:
  Mutex mutex_;
  std::string device_ QUARN_GUARDED_BY(mutex_);
  int fd_ QUARN_GUARDED_BY(mutex_) = -1;
};

// Never destroyed: threads may log until the process is gone.
LogFile &log_file() {
  static auto *file = new LogFile;
  return *file;
}

/** Under systemd standard error is the journal's stream, named by device and inode. */
bool stderr_is_journal() {
  static const bool is_journal = [] {
    const char *stream = std::getenv("JOURNAL_STREAM");
    struct stat status {};
    unsigned long device = 0;
    unsigned long inode = 0;
    return stream != nullptr && std::sscanf(stream, "%lu:%lu", &device, &inode) == 2 &&
           fstat(STDERR_FILENO, &status) == 0 && status.st_dev == device && status.st_ino == inode;
  }();
  return is_journal;
}

using journal_sendv = int (*)(const iovec *, int);

/** The journal's library is loaded only where there is a journal. */
journal_sendv journal() {
  static const auto send = [] {
    void *library = dlopen("libsystemd.so.0", RTLD_NOW);
    return library == nullptr ? nullptr
                              : reinterpret_cast<journal_sendv>(dlsym(library, "sd_journal_sendv"));
  }();
  return send;
}

iovec field(std::string &text) { return {text.data(), text.size()}; }

/** "file: function(line) > message" taken apart for the journal's fields. */
bool send_to_journal(log_priority level, const char *tag, const std::string &text) {
  if (journal() == nullptr) return false;
  const auto file_end = text.find(": ");
  const auto message = text.find(" > ");
  std::string fields[] = {"MESSAGE=" + text,
                          "PRIORITY=" + std::to_string(journal_priority(level)),
                          std::string("SYSLOG_IDENTIFIER=") + tag,
                          "CODE_FILE=",
                          "CODE_FUNC=",
                          "CODE_LINE="};
  int count = 3;
  if (file_end != std::string::npos && message != std::string::npos && file_end < message) {
    const auto bracket = text.rfind('(', message);
    if (bracket != std::string::npos && bracket > file_end) {
      fields[0] = "MESSAGE=" + text.substr(message + 3);
      fields[3] += text.substr(0, file_end);
      fields[4] += text.substr(file_end + 2, bracket - file_end - 2);
      fields[5] += std::to_string(std::atoi(text.c_str() + bracket + 1));
      count = 6;
    }
  }
  iovec vectors[6];
  for (int i = 0; i < count; ++i) vectors[i] = field(fields[i]);
  return journal()(vectors, count) >= 0;
}

}  // namespace

extern "C" int dlog_print(log_id_t, log_priority prio, const char *tag, const char *fmt, ...) {
  if (tag == nullptr || fmt == nullptr) return -EINVAL;
  const int saved_errno = errno;
  va_list args;
  va_start(args, fmt);
  char *text = nullptr;
  const int length = vasprintf(&text, fmt, args);
  va_end(args);
  if (length < 0) return length;
  // Whatever a file name in it holds: one line, and nothing that a terminal obeys.
  const std::string message = embedded::printable(text);
  std::free(text);
  if (stderr_is_journal() && send_to_journal(prio, tag, message)) {
    errno = saved_errno;
    return length;
  }

  std::string line = stamp();
  line += ' ';
  line += letter_of(prio);
  line += '/';
  line += tag;
  line += '(' + std::to_string(getpid()) + "): " + message + '\n';
  // One write a line: lines of several threads or processes never mix.
  const ssize_t written = write(STDERR_FILENO, line.data(), line.size());
  log_file().append(line);
  errno = saved_errno;
  return static_cast<int>(written);
}
