/**
 * @file leftovers.h
 * @brief Temporary objects that could not be deleted when they should have been.
 */
#ifndef BACKUP_TRANSPORT_LEFTOVERS_H
#define BACKUP_TRANSPORT_LEFTOVERS_H

#include <deque>
#include <string>

#include "thread_annotations.h"

namespace transport {

/** The first few. Any thread. */
class Leftovers {
 public:
  /**
   * Remember one, unless there are too many: those of a connection that was just lost come first,
   * and what is tried after that leaves no more.
   */
  void remember(const std::string &temporary);

  /** Forget one, which is for the caller to delete. @return its path; "" when there is none */
  [[nodiscard]] std::string take();

 private:
  Mutex mutex_;
  std::deque<std::string> paths_ QUARN_GUARDED_BY(mutex_);
};

}  // namespace transport

#endif
