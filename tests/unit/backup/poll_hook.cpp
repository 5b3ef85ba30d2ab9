#include "poll_hook.h"

#include <ctime>

namespace {
std::function<void(int)> poll_hook;
int poll_count = 0;
bool only_ten_milliseconds = true;
}  // namespace

void set_poll_hook(std::function<void(int)> hook) {
  poll_hook = std::move(hook);
  poll_count = 0;
}

int polls() { return only_ten_milliseconds ? poll_count : -1; }

extern "C" int nanosleep(const struct timespec *duration, struct timespec *) {
  only_ten_milliseconds =
      only_ten_milliseconds && duration->tv_sec == 0 && duration->tv_nsec == 10000000;
  const int pause = poll_count++;
  if (poll_hook) poll_hook(pause);
  return 0;
}
