#include "core/background_thread.h"

#include <sys/prctl.h>

#include <cstddef>
#include <memory>

#include "detached_thread.h"

namespace transport {
namespace {

constexpr std::size_t kStackBytes = 1024 * 1024;

struct Start {
  const char *name;
  void (*body)(void *data);
  void *data;
};

void *run(void *start) {
  const Start own = *std::unique_ptr<Start>(static_cast<Start *>(start));
  prctl(PR_SET_NAME, own.name);
  own.body(own.data);
  return nullptr;
}

}  // namespace

bool start_background_thread(const char *name, void (*body)(void *data), void *data) {
  auto start = std::make_unique<Start>(Start{name, body, data});
  const bool started = start_detached_thread(kStackBytes, &run, start.get()) == 0;
  if (started) static_cast<void>(start.release());  // the thread's from now on
  return started;
}

}  // namespace transport
