/**
 * @file log_capture.h
 * @brief Collects the log lines of the code under test.
 *
 * The unit tests' dlog_print() keeps every message here. Any thread may log.
 */
#ifndef LOG_CAPTURE_H
#define LOG_CAPTURE_H

#include <string>
#include <vector>

#include "platform_log.h"

/** One message: its text is what follows "file: function(line) > ". */
struct LogLine {
  log_id_t buffer;
  log_priority level;
  std::string tag;
  std::string file;
  std::string function;
  int line;
  std::string text;
};

/** All lines since the last clear, in order. */
std::vector<LogLine> captured_log();
/** The texts alone. */
std::vector<std::string> captured_texts();
/** Number of lines with this level and exactly this text. */
int count_logged(log_priority level, const std::string &text);
/** Forget everything. */
void clear_captured_log();

#endif
