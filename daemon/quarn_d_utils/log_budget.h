/**
 * @file log_budget.h
 * @brief Lines about an application's files, of which it may have any number.
 */
#ifndef QUARN_D_UTILS_LOG_BUDGET_H
#define QUARN_D_UTILS_LOG_BUDGET_H

#include <string>
#include <utility>

#include "quarn_log.h"

/** How many files of one kind a walk tells by name. */
inline constexpr unsigned int kMaxFileLines = 100;

/**
 * The lines that one walk may write about one kind of file; what is left out
 * is counted and told at the walk's end. One thread.
 */
class LogBudget {
 public:
  /** @param walk what is walked over, for the line at the end */
  explicit LogBudget(std::string walk) : walk_(std::move(walk)) {}
  ~LogBudget() {
    if (left_out_ > 0) LOGW("%u more such lines on %s are left out", left_out_, walk_.c_str());
  }
  LogBudget(const LogBudget &) = delete;
  LogBudget &operator=(const LogBudget &) = delete;

  /** Whether this line may be written. */
  bool take() {
    if (written_ < kMaxFileLines) {
      ++written_;
      return true;
    }
    ++left_out_;
    return false;
  }

 private:
  std::string walk_;
  unsigned int written_ = 0;
  unsigned int left_out_ = 0;
};

#endif
