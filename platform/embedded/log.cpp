#include "platform_log.h"

#include <cstdarg>
#include <cstdio>

extern "C" int dlog_print(log_id_t, log_priority, const char *, const char *fmt, ...) {
  va_list args;
  va_start(args, fmt);
  const int length = std::vfprintf(stderr, fmt, args);
  va_end(args);
  std::fputc('\n', stderr);
  return length;
}
