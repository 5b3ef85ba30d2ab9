// Loaded into a program: exchanges two names at one moment of it, with an application's rights.
//
// EXCHANGE_AT is the number of that moment, from 1, and EXCHANGE_ONE and EXCHANGE_OTHER are the
// names. How many moments there were is written into the file EXCHANGE_COUNT at the program's end.
#include <fcntl.h>
#include <stdio.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <functional>

#include "each_moment.h"

namespace {

class Exchange {
 public:
  Exchange() {
    const char *at = std::getenv("EXCHANGE_AT");
    if (at == nullptr) return;
    at_ = std::atol(at);
    at_each_moment = &action_;
  }
  ~Exchange() {
    at_each_moment = nullptr;
    if (const char *file = std::getenv("EXCHANGE_COUNT")) std::ofstream(file) << moments_;
  }

 private:
  void look() {
    if (++moments_ != at_) return;
    const AsApplication application;
    syscall(SYS_renameat2, AT_FDCWD, std::getenv("EXCHANGE_ONE"), AT_FDCWD,
            std::getenv("EXCHANGE_OTHER"), RENAME_EXCHANGE);
  }

  long at_ = 0;
  long moments_ = 0;
  std::function<void()> action_ = [this] { look(); };
};

Exchange exchange;

}  // namespace
