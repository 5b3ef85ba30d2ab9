#include "quarn_d_lifecycle.h"

#include "quarn_d_end.h"
#include "quarn_d_loop.h"
#include "quarn_d_utils/power.h"
#include "quarn_log.h"

int quarn_exit_code = 0;

namespace {

constexpr int kRestartWanted = -1;
constexpr double kAtOnce = 0.0;
/** What an Ecore timer's callback returns to be the last of it. */
constexpr unsigned char kDoNotRepeat = 0;

void *quarn_terminate_timer = nullptr;

/** A request at once, kept back while the bus name is being asked for. */
struct held_request {
  bool holding = false;
  bool pending = false;
  bool restart = false;
} held;

}  // namespace

unsigned char terminate_cb(void *) {
  quarn_terminate_timer = nullptr;  // Ecore deletes it with this return
  LOGI("terminate quarn");
  begin_quarn_end();
  return kDoNotRepeat;
}

void request_quarn_terminate(double delay, bool restart) {
  if (!is_idle_status()) {
    LOGI("Not in idle state");
    return;
  }
  quarn_exit_code = restart ? kRestartWanted : 0;
  if (delay == 0.0) {
    if (held.holding) {
      held.pending = true;
      held.restart = restart;
      return;
    }
    LOGI("terminate quarn");
    begin_quarn_end();
    return;
  }
  cancel_quarn_terminate();
  quarn_terminate_timer = quarn_loop_timer_add(delay, terminate_cb, nullptr);
}

void hold_quarn_terminate() { held.holding = true; }

void release_quarn_terminate() {
  held.holding = false;
  if (!held.pending) return;
  held.pending = false;
  request_quarn_terminate(kAtOnce, held.restart);
}

void cancel_quarn_terminate() {
  withdraw_quarn_end();
  held.pending = false;
  if (quarn_terminate_timer == nullptr) return;
  quarn_loop_timer_del(quarn_terminate_timer);
  quarn_terminate_timer = nullptr;
}
