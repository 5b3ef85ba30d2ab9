/**
 * @file log_scope.h
 * @brief A bound on the lines of one piece of work over entries that somebody else has made.
 */
#ifndef LOG_SCOPE_H
#define LOG_SCOPE_H

#include <string>
#include <vector>

struct quarn_log_place;

/** How many lines one place in the code may write within a scope. */
inline constexpr unsigned int kMaxLinesOfAPlace = 100;

/**
 * While it lives, each place in the code writes its first lines of this thread
 * only: an archive, or an application's tree, may have any number of entries
 * that something is wrong with. What is left out is counted and told when it
 * ends. Within another scope of the thread it is part of that one. The thread
 * does nothing for anybody else meanwhile: nothing that waits may lie within.
 */
class LogScope {
 public:
  /** @param subject what is worked through, for the line at the end */
  explicit LogScope(std::string subject);
  ~LogScope();
  LogScope(const LogScope &) = delete;
  LogScope &operator=(const LogScope &) = delete;

  /** Whether a line from there may be written; for the log function. */
  [[nodiscard]] static bool admits(const quarn_log_place &place);

 private:
  struct Written {
    const char *file;
    int line;
    unsigned int count;
  };

  bool take(const quarn_log_place &place);

  std::string subject_;
  std::vector<Written> written_;
  unsigned int left_out_ = 0;
};

#endif
