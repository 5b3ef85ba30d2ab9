#include "quarn_d_utils/nested_loop.h"

#include <glib.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <vector>

#include "quarn_d_utils/fiber.h"

namespace {

/** A fiber that waits for its loop to be quit; it lives on that fiber's stack. */
struct fiber_wait {
  GMainLoop *loop;
  quarn_fiber *fiber;
  bool withdrawable;
  bool ended = false; /**< its loop was not quit, but nobody waits for that any more */
};

/** In the order in which they began. */
std::vector<fiber_wait *> waits;
std::atomic<bool> refuse_nested_loops{false};
GSource *wait_source = nullptr;

bool is_over(const fiber_wait *wait) {
  return wait->ended || g_main_loop_is_running(wait->loop) == FALSE;
}

gboolean any_wait_over() { return std::any_of(waits.begin(), waits.end(), is_over) ? TRUE : FALSE; }

gboolean prepare_waits(GSource *, gint *timeout) {
  // whoever quits a loop wakes the context
  *timeout = -1;
  return any_wait_over();
}

gboolean check_waits(GSource *) { return any_wait_over(); }

gboolean resume_waits(GSource *, GSourceFunc, gpointer) {
  std::vector<quarn_fiber *> over;
  for (const fiber_wait *wait : waits) {
    if (is_over(wait)) over.push_back(wait->fiber);
  }
  for (quarn_fiber *fiber : over) {
    // what ran before may have ended others
    const bool waiting = std::any_of(waits.begin(), waits.end(), [fiber](const fiber_wait *wait) {
      return wait->fiber == fiber && is_over(wait);
    });
    if (waiting) resume_fiber(fiber);
  }
  return G_SOURCE_CONTINUE;
}

void watch_waits() {
  static GSourceFuncs functions{prepare_waits, check_waits, resume_waits,
                                nullptr,       nullptr,     nullptr};
  if (wait_source != nullptr) return;
  wait_source = g_source_new(&functions, sizeof(GSource));
  g_source_set_can_recurse(wait_source, TRUE);
  g_source_attach(wait_source, nullptr);
}

void unwatch_waits() {
  if (!waits.empty() || wait_source == nullptr) return;
  g_source_destroy(wait_source);
  g_source_unref(wait_source);
  wait_source = nullptr;
}

void wait_on_fiber(GMainLoop *loop, bool withdrawable) {
  fiber_wait wait{loop, current_fiber(), withdrawable};
  waits.push_back(&wait);
  watch_waits();
  while (!is_over(&wait)) suspend_fiber();
  waits.erase(std::find(waits.begin(), waits.end(), &wait));
  unwatch_waits();
}

}  // namespace

GMainLoop *new_wait_loop() { return g_main_loop_new(nullptr, TRUE); }

void run_nested_loop(GMainLoop *loop) {
  if (waits_are_ended()) return;
  if (current_fiber() != nullptr) {
    wait_on_fiber(loop, true);
    return;
  }
  while (!refuse_nested_loops && g_main_loop_is_running(loop) != FALSE) {
    g_main_context_iteration(nullptr, TRUE);
  }
}

void wait_for_answer(GMainLoop *loop) {
  if (!refuse_nested_loops && current_fiber() != nullptr) wait_on_fiber(loop, false);
}

bool waits_are_ended() { return refuse_nested_loops || fiber_is_withdrawn(current_fiber()); }

bool withdraw_waits(std::uint64_t fiber) {
  const auto found = std::find_if(waits.begin(), waits.end(), [fiber](const fiber_wait *wait) {
    return fiber_id(wait->fiber) == fiber && wait->withdrawable;
  });
  if (found == waits.end() || is_over(*found)) return false;
  (*found)->ended = true;
  withdraw_fiber((*found)->fiber);
  g_main_context_wakeup(nullptr);
  return true;
}

void quit_nested_loops() {
  refuse_nested_loops = true;
  const std::vector<fiber_wait *> standing = waits;
  for (fiber_wait *wait : standing) wait->ended = true;
  while (!waits.empty()) {
    const auto next = std::find_if(waits.begin(), waits.end(), [](const fiber_wait *wait) {
      return wait->fiber != current_fiber();
    });
    if (next == waits.end()) break;
    resume_fiber((*next)->fiber);
  }
}
