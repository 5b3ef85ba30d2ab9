#include "quarn_d_utils/fiber.h"

#include <sys/mman.h>
#include <ucontext.h>
#include <unistd.h>

#include <atomic>
#include <memory>
#include <utility>
#include <vector>

#include "quarn_log.h"

#if defined(__SANITIZE_ADDRESS__)
#include <sanitizer/common_interface_defs.h>
#include <sanitizer/lsan_interface.h>
#endif
#if defined(__SANITIZE_THREAD__)
#include <sanitizer/tsan_interface.h>
#endif

namespace {

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr std::size_t kStackSize = 1048576;  // their frames are larger
#else
constexpr std::size_t kStackSize = 262144;
#endif
/** Stacks that are kept for the next fibers: most calls never wait. */
constexpr std::size_t kSpareStacks = 2;
/** What a fiber may still use of its stack below the frame that it was left in. */
constexpr std::size_t kLeavingRoom = 4096;

std::size_t page_size() {
  static const auto size = static_cast<std::size_t>(sysconf(_SC_PAGESIZE));
  return size;
}

/** A mapped stack whose lowest page cannot be touched. */
class Stack {
 public:
  Stack() {
    void *const mapped = mmap(nullptr, kStackSize, PROT_READ | PROT_WRITE,
                              MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE | MAP_STACK, -1, 0);
    if (mapped == MAP_FAILED) return;
    base_ = static_cast<char *>(mapped);
    mprotect(base_, page_size(), PROT_NONE);
#if defined(__SANITIZE_ADDRESS__)
    __lsan_register_root_region(bottom(), size());
#endif
  }
  ~Stack() {
    if (base_ == nullptr) return;
#if defined(__SANITIZE_ADDRESS__)
    __lsan_unregister_root_region(bottom(), size());
#endif
    munmap(base_, kStackSize);
  }
  Stack(const Stack &) = delete;
  Stack &operator=(const Stack &) = delete;

  explicit operator bool() const { return base_ != nullptr; }
  char *bottom() const { return base_ + page_size(); }
  std::size_t size() const { return kStackSize - page_size(); }

  /** Give back the memory below @p used. */
  void trim(const char *used) const {
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
    const auto distance = static_cast<std::size_t>(used - bottom());
    if (distance <= kLeavingRoom) return;
    const std::size_t unused = (distance - kLeavingRoom) / page_size() * page_size();
    if (unused > 0) madvise(bottom(), unused, MADV_DONTNEED);
#else
    static_cast<void>(used);
#endif
  }

 private:
  char *base_ = nullptr;
};

/** Whatever has a stack: a thread or a fiber. */
struct strand {
  ucontext_t context = {};
  const void *bottom = nullptr;
  std::size_t size = 0;
  void *fake_stack = nullptr; /**< the address sanitizer's */
  void *tsan_fiber = nullptr;
};

}  // namespace

const std::size_t kFiberStackSize = kStackSize;

struct quarn_fiber {
  strand self;
  std::unique_ptr<Stack> stack;
  std::uint64_t id = 0;
  std::function<void()> work;
  strand *outside = nullptr;                     /**< who goes on when it is left */
  quarn_fiber *outside_fiber = nullptr;          /**< the same, null for the thread */
  const std::function<void()> *errand = nullptr; /**< to be run outside */
  const char *left_at = nullptr;
  bool ended = false;
  bool withdrawn = false;
};

namespace {

thread_local quarn_fiber *running_fiber = nullptr;
thread_local strand thread_strand;
std::atomic<std::uint64_t> last_fiber_id{0};

thread_local std::vector<std::unique_ptr<Stack>> spare_stacks;

std::unique_ptr<Stack> take_stack() {
  if (spare_stacks.empty()) return std::make_unique<Stack>();
  std::unique_ptr<Stack> stack = std::move(spare_stacks.back());
  spare_stacks.pop_back();
  return stack;
}

void give_stack(std::unique_ptr<Stack> stack) {
  if (spare_stacks.size() >= kSpareStacks) return;
  stack->trim(stack->bottom() + stack->size());
  spare_stacks.push_back(std::move(stack));
}

/** Come back when somebody switches to @p from again. */
void switch_strand(strand *from, strand *to, bool for_good) {
#if defined(__SANITIZE_ADDRESS__)
  __sanitizer_start_switch_fiber(for_good ? nullptr : &from->fake_stack, to->bottom, to->size);
#endif
#if defined(__SANITIZE_THREAD__)
  if (from->tsan_fiber == nullptr) from->tsan_fiber = __tsan_get_current_fiber();
  __tsan_switch_to_fiber(to->tsan_fiber, 0);
#endif
  static_cast<void>(for_good);
  swapcontext(&from->context, &to->context);
#if defined(__SANITIZE_ADDRESS__)
  __sanitizer_finish_switch_fiber(from->fake_stack, nullptr, nullptr);
#endif
}

void enter_fiber() {
  quarn_fiber *const fiber = running_fiber;
#if defined(__SANITIZE_ADDRESS__)
  __sanitizer_finish_switch_fiber(nullptr, &fiber->outside->bottom, &fiber->outside->size);
#endif
  fiber->work();
  fiber->work = nullptr;
  fiber->ended = true;
  switch_strand(&fiber->self, fiber->outside, true);
}

/** Go into @p fiber, and come back when it is left. */
void visit_fiber(quarn_fiber *fiber) {
  fiber->outside_fiber = running_fiber;
  fiber->outside = running_fiber != nullptr ? &running_fiber->self : &thread_strand;
  running_fiber = fiber;
  switch_strand(fiber->outside, &fiber->self, false);
  running_fiber = fiber->outside_fiber;
}

void delete_fiber(quarn_fiber *fiber) {
#if defined(__SANITIZE_THREAD__)
  __tsan_destroy_fiber(fiber->self.tsan_fiber);
#endif
  give_stack(std::move(fiber->stack));
  delete fiber;
}

bool prepare(quarn_fiber *fiber) {
  fiber->stack = take_stack();
  if (!*fiber->stack) {
    LOGE("no memory for a stack");
    return false;
  }
  fiber->self.bottom = fiber->stack->bottom();
  fiber->self.size = fiber->stack->size();
  getcontext(&fiber->self.context);
  fiber->self.context.uc_stack.ss_sp = fiber->stack->bottom();
  fiber->self.context.uc_stack.ss_size = fiber->stack->size();
  fiber->self.context.uc_link = nullptr;
  makecontext(&fiber->self.context, enter_fiber, 0);
#if defined(__SANITIZE_THREAD__)
  fiber->self.tsan_fiber = __tsan_create_fiber(0);
#endif
  return true;
}

}  // namespace

void run_on_fiber(std::function<void()> work) {
  auto fiber = std::make_unique<quarn_fiber>();
  fiber->id = ++last_fiber_id;
  if (!prepare(fiber.get())) {
    work();
    return;
  }
  fiber->work = std::move(work);
  resume_fiber(fiber.release());
}

quarn_fiber *current_fiber() { return running_fiber; }

std::uint64_t fiber_id(const quarn_fiber *fiber) { return fiber == nullptr ? 0 : fiber->id; }

void withdraw_fiber(quarn_fiber *fiber) { fiber->withdrawn = true; }

bool fiber_is_withdrawn(const quarn_fiber *fiber) { return fiber != nullptr && fiber->withdrawn; }

void suspend_fiber() {
  quarn_fiber *const fiber = running_fiber;
  fiber->left_at = static_cast<const char *>(__builtin_frame_address(0));
  switch_strand(&fiber->self, fiber->outside, false);
}

void resume_fiber(quarn_fiber *fiber) {
  visit_fiber(fiber);
  while (!fiber->ended && fiber->errand != nullptr) {
    run_on_thread_stack(*std::exchange(fiber->errand, nullptr));
    visit_fiber(fiber);
  }
  if (fiber->ended) {
    delete_fiber(fiber);
  } else {
    fiber->stack->trim(fiber->left_at);
  }
}

void run_on_thread_stack(const std::function<void()> &work) {
  if (running_fiber == nullptr) {
    work();
    return;
  }
  running_fiber->errand = &work;
  suspend_fiber();
}
