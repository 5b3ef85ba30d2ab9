#include "core/background_thread.h"

#include <pthread.h>
#include <signal.h>
#include <sys/prctl.h>

#include <cstddef>
#include <memory>

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
  pthread_attr_t attributes;
  pthread_attr_init(&attributes);
  pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
  pthread_attr_setstacksize(&attributes, kStackBytes);
  sigset_t all;
  sigset_t before;
  sigfillset(&all);
  pthread_sigmask(SIG_SETMASK, &all, &before);
  pthread_t thread;
  const bool started = pthread_create(&thread, &attributes, &run, start.get()) == 0;
  pthread_sigmask(SIG_SETMASK, &before, nullptr);
  pthread_attr_destroy(&attributes);
  if (started) static_cast<void>(start.release());  // the thread's from now on
  return started;
}

}  // namespace transport
