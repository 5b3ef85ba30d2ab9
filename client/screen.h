/**
 * @file screen.h
 * @brief Standard output and error of quarnctl: lines, a bar that is redrawn, or nothing for JSON.
 */
#ifndef QUARN_CLIENT_SCREEN_H
#define QUARN_CLIENT_SCREEN_H

#include <cstdint>
#include <string>

namespace quarn_client {

class Screen {
 public:
  /** @param quiet nothing but the final document goes to standard output */
  explicit Screen(bool quiet);

  /** Whether a line can be redrawn: standard output is a terminal. */
  bool redraws() const { return redraws_; }
  std::size_t columns() const;

  /** A line of text, which must be printable already. */
  void line(const std::string &text);
  /** Text that ends its own lines. */
  void text(const std::string &text);
  /** Replaces the line that is redrawn; calls in quick succession are left out. */
  void bar(const std::string &text);
  /** Takes the bar away. */
  void clear_bar();
  /** One line on standard error. */
  void error(const std::string &message);
  /** The final document. */
  void document(const std::string &text);

 private:
  bool quiet_;
  bool redraws_;
  bool bar_shown_ = false;
  std::int64_t bar_time_us_ = 0;
};

}  // namespace quarn_client

#endif
