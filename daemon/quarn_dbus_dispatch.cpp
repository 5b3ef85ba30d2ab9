#include "quarn_dbus_dispatch.h"

#include <algorithm>
#include <memory>
#include <utility>
#include <vector>

#include "gio_handles.h"
#include "glib_handles.h"
#include "quarn_common.h"
#include "quarn_d_gate.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_turn.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_dbus_acceptance.h"
#include "quarn_dbus_calls.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_limits.h"
#include "quarn_dbus_methods.h"
#include "quarn_log.h"

namespace {

/** What calls wait for that touch what the earlier process may be writing. */
std::vector<GMainLoop *> waits_for_turn;

/** Whether the call has to wait until the earlier process has ended. */
bool must_wait(const MethodCall &call, GVariant *parameters) {
  if (is_quarn_turn() || quarn_dbus_waiting_stopped()) return false;
  const served_method *const method = find_served_method(call.method());
  const auto arguments = read_quarn_arguments(call.method(), parameters);
  if (method == nullptr || !arguments) return false;
  return method->turn == turn_rule::in_turn ||
         (method->turn == turn_rule::in_turn_to_switch_on && arguments->on != 0);
}

/** @return false when the call was refused or is not wanted any more, and is answered */
bool wait_for_turn(MethodCall &call) {
  cancel_quarn_terminate();
  if (refuse_beyond_places(call)) return false;
  const auto counted = count_waiting(call.sender(), parties_of(call));
  const GMainLoopPtr loop(new_wait_loop());
  const PendingWork pending;
  waits_for_turn.push_back(loop.get());
  run_nested_loop(loop.get());
  waits_for_turn.erase(std::find(waits_for_turn.begin(), waits_for_turn.end(), loop.get()));
  return true;
}

void serve_invoked(const quarn_caller &caller, InvocationPtr invocation) {
  InvokedCall call(std::move(invocation), caller);
  GVariant *const parameters = call.parameters();
  if (!admit(call, parameters)) return;
  if (must_wait(call, parameters) && !wait_for_turn(call)) return;
  dispatch(call, parameters);
}

void _dbus_handle_method_call(GDBusConnection *connection, const gchar *sender, const gchar *,
                              const gchar *, const gchar *, GVariant *,
                              GDBusMethodInvocation *invocation, gpointer) {
  const auto held = std::make_shared<InvocationPtr>(invocation);
  with_caller(connection, sender == nullptr ? "" : sender, [held](const quarn_caller &caller) {
    run_on_fiber([caller, held] { serve_invoked(caller, std::move(*held)); });
  });
}

}  // namespace

const GDBusInterfaceVTable kQuarnMethodTable = {_dbus_handle_method_call, nullptr, nullptr, {}};

bool admit(MethodCall &call, GVariant *parameters) {
  const quarn_subject subject = subject_of_call(call.interface_name(), call.method(), parameters);
  const caller_verdict verdict =
      judge_call(call.caller(), call.sender(), subject, cloud_restore_running());
  const std::string excess =
      verdict.allowed ? excess_of_arguments(call.method(), parameters) : std::string();
  if (verdict.allowed && excess.empty()) return true;
  if (call.interface_name() == kQuarnInterface) cancel_quarn_terminate();
  if (!verdict.allowed) {
    call.refuse(G_DBUS_ERROR_ACCESS_DENIED, refusal_text(subject, verdict));
    return false;
  }
  tell_excess(call, excess);
  call.refuse(G_DBUS_ERROR_INVALID_ARGS, excess);
  return false;
}

void dispatch(MethodCall &call, GVariant *given) {
  if (!begin_quarn_call(call.sender(), call.serial())) return;
  cancel_quarn_terminate();

  // A reference of our own: those of the call go with its answer.
  const GVariantPtr owned(given == nullptr ? nullptr : g_variant_ref(given));
  const served_method *const method = find_served_method(call.method());
  if (method == nullptr) {
    call.refuse(G_DBUS_ERROR_UNKNOWN_METHOD,
                unknown_method_text(call.method(), call.interface_name()));
    return;
  }
  serve_method(*method, call, owned.get());
}

void tell_excess(const MethodCall &call, const std::string &excess) {
  if (!tells_of_refusal(call.caller())) return;
  LOGE("refused : %s of (%s) : %s", call.method().c_str(), call.sender().c_str(), excess.c_str());
}

bool calls_wait_for_turn() { return !waits_for_turn.empty(); }

void end_waits_for_turn() {
  for (GMainLoop *loop : waits_for_turn) g_main_loop_quit(loop);
}
