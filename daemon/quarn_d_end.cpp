#include "quarn_d_end.h"

#include <glib.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cstdlib>

#include "quarn_d_loop.h"
#include "quarn_d_utils/power.h"
#include "quarn_log.h"

namespace {

constexpr unsigned int kIdleCheckMs = 50;
constexpr int kDecimal = 10;

enum class Stage {
  kStaying,
  kDraining,  /**< the name is given up, what has arrived is dispatched */
  kReturning, /**< the name is being asked for again */
  kNameless,  /**< another process has it; this one finishes its work */
  kLeaving    /**< the loop was quit, whatever is still asked for */
};

Stage stage = Stage::kStaying;
bool wanted = false;
bool leave_when_idle = false;
guint idle_check = 0;
quarn_bus_name bus_name{nullptr, nullptr};

std::atomic<bool> answer_expected{false};

/** True for the process that the service manager itself has started. */
bool is_service() {
  const char *process = std::getenv("SYSTEMD_EXEC_PID");
  if (process != nullptr) return std::strtol(process, nullptr, kDecimal) == getpid();
  return std::getenv("INVOCATION_ID") != nullptr && getppid() == 1;
}

void stay() {
  LOGI("termination cancelled");
  stage = Stage::kReturning;
  wanted = false;
  bus_name.take_back();
}

gboolean decide(gpointer) {
  if (stage == Stage::kLeaving) return G_SOURCE_REMOVE;
  // One that has to go anyway has answered what came, and goes.
  if ((wanted || leave_when_idle) && is_idle_status()) {
    quarn_loop_quit();
  } else {
    stay();
  }
  return G_SOURCE_REMOVE;
}

gboolean check_idle(gpointer) {
  if (!is_idle_status()) return G_SOURCE_CONTINUE;
  if (stage == Stage::kNameless) {
    idle_check = 0;
    quarn_loop_quit();
    return G_SOURCE_REMOVE;
  }
  if (stage == Stage::kStaying) begin_quarn_end();
  return G_SOURCE_CONTINUE;
}

void watch_for_idle() {
  // Below everything that may bring work.
  if (idle_check == 0) {
    idle_check = g_timeout_add_full(G_PRIORITY_LOW, kIdleCheckMs, check_idle, nullptr, nullptr);
  }
}

}  // namespace

void set_quarn_bus_name(const quarn_bus_name &name) {
  bus_name = name;
  stage = Stage::kStaying;
  wanted = false;
  leave_when_idle = false;
  if (idle_check != 0) g_source_remove(idle_check);
  idle_check = 0;
  answer_expected = false;
}

void begin_quarn_end() {
  wanted = true;
  if (stage == Stage::kDraining || stage == Stage::kReturning || stage == Stage::kLeaving) return;
  if (stage == Stage::kNameless || bus_name.give_up == nullptr) {
    quarn_loop_quit();
    return;
  }
  stage = Stage::kDraining;
  if (!leave_when_idle) answer_expected = is_service();
  bus_name.give_up();
  // The calls that came before the answer of the bus are waiting with a higher priority.
  g_idle_add_full(G_PRIORITY_LOW, decide, nullptr, nullptr);
}

void withdraw_quarn_end() { wanted = false; }

void note_quarn_name(bool owned) {
  if (stage != Stage::kReturning) return;
  if (owned) {
    stage = Stage::kStaying;
    if (wanted && is_idle_status()) begin_quarn_end();
    return;
  }
  stage = Stage::kNameless;
  watch_for_idle();
}

void end_quarn_when_idle() {
  leave_when_idle = true;
  watch_for_idle();
}

void leave_quarn_for_good() { stage = Stage::kLeaving; }

bool is_answer_to_given_up_name(int signo) {
  return signo == SIGTERM && answer_expected.exchange(false);
}
