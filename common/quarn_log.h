/**
 * @file quarn_log.h
 * @brief The daemon's log lines: tag, source position, message.
 *
 * The macros take a printf format, which must be a literal. Any thread.
 *
 * The message is the daemon's own and appears whole. Its text arguments may
 * come from anywhere (an application's file names, a server's answer, a
 * caller's texts): each is cut at kMaxLoggedArgument bytes, and what would end
 * the line or be obeyed by a terminal is escaped, whatever the platform's
 * logging service makes of it.
 */
#ifndef QUARN_LOG_H
#define QUARN_LOG_H

#include <cstddef>

#include "platform_log.h"

/** Bytes of one text argument that appear in the log; "..." follows where it was longer. */
inline constexpr std::size_t kMaxLoggedArgument = 256;

/** The part of __FILE__ after the last slash, found at compile time. */
constexpr const char *quarn_file_name(const char *path) {
  const char *name = path;
  for (const char *p = path; *p != '\0'; ++p) {
    if (*p == '/') name = p + 1;
  }
  return name;
}

/** Where a message comes from. */
struct quarn_log_place {
  const char *file;
  const char *function;
  int line;
};

/** Log one message; the macros below call it. errno is as before afterwards. */
void quarn_log(log_id_t buffer, log_priority level, const quarn_log_place &place, const char *fmt,
               ...) __attribute__((format(printf, 4, 5)));

#define QUARN_LOG_TO(buffer, level, fmt, ...) \
  quarn_log(buffer, level, {quarn_file_name(__FILE__), __func__, __LINE__}, fmt, ##__VA_ARGS__)

#define LOGD(...) QUARN_LOG_TO(LOG_ID_MAIN, DLOG_DEBUG, __VA_ARGS__)
#define LOGI(...) QUARN_LOG_TO(LOG_ID_MAIN, DLOG_INFO, __VA_ARGS__)
#define LOGW(...) QUARN_LOG_TO(LOG_ID_MAIN, DLOG_WARN, __VA_ARGS__)
#define LOGE(...) QUARN_LOG_TO(LOG_ID_MAIN, DLOG_ERROR, __VA_ARGS__)
/** Information for the system's own buffer. */
#define SLOGI(...) QUARN_LOG_TO(LOG_ID_SYSTEM, DLOG_INFO, __VA_ARGS__)

#endif
