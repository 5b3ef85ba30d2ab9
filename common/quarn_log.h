/**
 * @file quarn_log.h
 * @brief The daemon's log lines: tag, source position, message.
 *
 * The macros take a printf format, which must be a literal. Any thread.
 */
#ifndef QUARN_LOG_H
#define QUARN_LOG_H

#include "platform_log.h"

/** The part of __FILE__ after the last slash, found at compile time. */
constexpr const char *quarn_file_name(const char *path) {
  const char *name = path;
  for (const char *p = path; *p != '\0'; ++p) {
    if (*p == '/') name = p + 1;
  }
  return name;
}

#define QUARN_LOG_TO(buffer, level, fmt, ...)                                                   \
  dlog_print(buffer, level, "QUARND", "%s: %s(%d) > " fmt, quarn_file_name(__FILE__), __func__, \
             __LINE__, ##__VA_ARGS__)

#define LOGD(...) QUARN_LOG_TO(LOG_ID_MAIN, DLOG_DEBUG, __VA_ARGS__)
#define LOGI(...) QUARN_LOG_TO(LOG_ID_MAIN, DLOG_INFO, __VA_ARGS__)
#define LOGW(...) QUARN_LOG_TO(LOG_ID_MAIN, DLOG_WARN, __VA_ARGS__)
#define LOGE(...) QUARN_LOG_TO(LOG_ID_MAIN, DLOG_ERROR, __VA_ARGS__)
/** Information for the system's own buffer. */
#define SLOGI(...) QUARN_LOG_TO(LOG_ID_SYSTEM, DLOG_INFO, __VA_ARGS__)

#endif
