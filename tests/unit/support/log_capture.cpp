#include "log_capture.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <mutex>

namespace {
std::mutex log_mutex;
std::vector<LogLine> &lines() {
  static auto *all = new std::vector<LogLine>;
  return *all;
}
}  // namespace

extern "C" int dlog_print(log_id_t id, log_priority prio, const char *tag, const char *fmt, ...) {
  va_list args;
  va_start(args, fmt);
  char *text = nullptr;
  const int length = vasprintf(&text, fmt, args);
  va_end(args);
  LogLine line{id, prio, tag, "", "", 0, text};
  std::free(text);
  const auto file_end = line.text.find(": ");
  const auto message = line.text.find(" > ");
  const auto paren = line.text.rfind('(', message);
  if (file_end != std::string::npos && message != std::string::npos && paren != std::string::npos) {
    line.file = line.text.substr(0, file_end);
    line.function = line.text.substr(file_end + 2, paren - file_end - 2);
    line.line = std::atoi(line.text.c_str() + paren + 1);
    line.text.erase(0, message + 3);
  }
  const std::lock_guard<std::mutex> lock(log_mutex);
  lines().push_back(std::move(line));
  return length;
}

std::vector<LogLine> captured_log() {
  const std::lock_guard<std::mutex> lock(log_mutex);
  return lines();
}

std::vector<std::string> captured_texts() {
  std::vector<std::string> texts;
  for (const auto &line : captured_log()) texts.push_back(line.text);
  return texts;
}

int count_logged(log_priority level, const std::string &text) {
  int count = 0;
  for (const auto &line : captured_log()) count += line.level == level && line.text == text;
  return count;
}

void clear_captured_log() {
  const std::lock_guard<std::mutex> lock(log_mutex);
  lines().clear();
}
