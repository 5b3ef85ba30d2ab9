#include "webdav/leftovers.h"

#include <utility>

namespace transport {
namespace {

constexpr std::size_t kMaxLeftovers = 64;

}  // namespace

void Leftovers::remember(const std::string &temporary) {
  const MutexLock lock(mutex_);
  if (paths_.size() < kMaxLeftovers) paths_.push_back(temporary);
}

std::string Leftovers::take() {
  const MutexLock lock(mutex_);
  if (paths_.empty()) return "";
  std::string temporary = std::move(paths_.front());
  paths_.pop_front();
  return temporary;
}

}  // namespace transport
