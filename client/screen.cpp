#include "screen.h"

#include <glib.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "text.h"

namespace quarn_client {

namespace {

constexpr std::size_t kDefaultColumns = 80;
constexpr std::int64_t kRedrawEveryUs = 50000;
constexpr char kEraseLine[] = "\r\033[K";

bool can_redraw() {
  const char *term = std::getenv("TERM");
  return isatty(STDOUT_FILENO) != 0 && term != nullptr && std::strcmp(term, "dumb") != 0;
}

}  // namespace

Screen::Screen(bool quiet) : quiet_(quiet), redraws_(!quiet && can_redraw()) {}

std::size_t Screen::columns() const {
  winsize size = {};
  if (ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) != 0 || size.ws_col == 0) return kDefaultColumns;
  // The last column stays free: a terminal would wrap there.
  return size.ws_col - 1U;
}

void Screen::line(const std::string &text) { this->text(text + "\n"); }

void Screen::text(const std::string &text) {
  if (quiet_) return;
  clear_bar();
  std::fputs(text.c_str(), stdout);
  std::fflush(stdout);
}

void Screen::bar(const std::string &text) {
  if (!redraws_) return;
  const std::int64_t now = g_get_monotonic_time();
  if (bar_shown_ && now - bar_time_us_ < kRedrawEveryUs) return;
  std::fputs(kEraseLine, stdout);
  std::fputs(text.c_str(), stdout);
  std::fflush(stdout);
  bar_shown_ = true;
  bar_time_us_ = now;
}

void Screen::clear_bar() {
  if (!bar_shown_) return;
  std::fputs(kEraseLine, stdout);
  std::fflush(stdout);
  bar_shown_ = false;
}

void Screen::error(const std::string &message) {
  clear_bar();
  std::fprintf(stderr, "quarnctl: %s\n", printable(message).c_str());
}

void Screen::document(const std::string &text) {
  std::fputs(text.c_str(), stdout);
  std::fputc('\n', stdout);
  std::fflush(stdout);
}

}  // namespace quarn_client
