#include "quarn_dbus_methods.h"

#include <iterator>
#include <utility>

#include "quarn_common.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_credentials.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_turn.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_log.h"

namespace {

/** Do a request's work, unless the process ends: then it has its last callback here. */
template <typename Work>
void serve_waiting(MethodCall &call, RecordPtr record, int reply_at_end, Work work) {
  if (!quarn_dbus_waiting_stopped()) {
    call.reply_int(work(record.release()));
    return;
  }
  quarn_dbus_end_requests();
  record.reset();
  call.reply_int(reply_at_end);
}

void on_set_activation(MethodCall &call, const quarn_arguments &arguments) {
  if (arguments.activation == 0) {
    LOGI("try to terminate quarn");
    init_last_backup_time();
    request_quarn_terminate(0.0, false);
  } else {
    LOGI("quarn activated successfully!");
  }
  call.reply_int(QUARN_OK);
}

void on_backup_enable(MethodCall &call, const quarn_arguments &arguments) {
  call.reply_int(quarnd_backup_enable(arguments.on));
}

void on_restore_enable(MethodCall &call, const quarn_arguments &arguments) {
  const bool on = arguments.on != 0;
  if (on && quarn_dbus_waiting_stopped()) {
    call.reply_int(QUARN_REFUSED);
    return;
  }
  if (on && waits_are_ended()) {
    call.reply_int(QUARN_CANCELLED);
    return;
  }
  if (on && refuse_beyond_bounds(call)) return;
  RecordPtr record =
      on ? make_record(call, arguments.req_id) : make_uncounted_record(call, arguments.req_id);
  call.reply_int(quarnd_restore_enable(arguments.on, arguments.client, arguments.serial_num,
                                       arguments.pkg_list, record.release()));
}

GVariant *present_time() {
  unsigned long long timestamp = 0;
  quarnd_get_last_backed_up_time(&timestamp);
  return g_variant_new("(t)", static_cast<guint64>(timestamp));
}

void on_last_bu_time(MethodCall &call) { call.reply(present_time()); }

void on_get_app_list(MethodCall &call, const quarn_arguments &arguments, RecordPtr record) {
  serve_waiting(call, std::move(record), QUARN_CANCELLED, [client = arguments.client](void *taken) {
    return quarnd_get_app_list(client, taken);
  });
}

/** Accepted and ignored. */
void on_auto_backup_start(MethodCall &call) { call.reply(nullptr); }

void on_manual_backup_start(MethodCall &call, const quarn_arguments &, RecordPtr record) {
  call.reply_int(quarnd_manual_backup(record.release()));
}

void on_manual_backup_cancel(MethodCall &call, const quarn_arguments &, RecordPtr record) {
  // What runs may be an earlier process's.
  if (signal_quarn_predecessor(kCancelSignal)) LOGI("cancel passed on");
  call.reply_int(quarnd_manual_backup_cancel(record.release()));
}

void on_app_data_backup_start(MethodCall &call, const quarn_arguments &arguments,
                              RecordPtr record) {
  serve_waiting(call, std::move(record), QUARN_OK, [pkg_id = arguments.pkg_id](void *taken) {
    return quarnd_backup_app_data(pkg_id, taken);
  });
}

void on_app_data_restore_start(MethodCall &call, const quarn_arguments &arguments,
                               RecordPtr record) {
  serve_waiting(call, std::move(record), QUARN_OK, [pkg_id = arguments.pkg_id](void *taken) {
    return quarnd_restore_app_data(pkg_id, taken);
  });
}

void on_make_app_data(MethodCall &call, const quarn_arguments &arguments) {
  if (quarn_dbus_waiting_stopped() || waits_are_ended()) {
    call.reply_int(QUARN_CANCELLED);
    return;
  }
  if (refuse_beyond_bounds(call)) return;
  const auto counted = count_waiting(call.sender(), parties_of(call));
  const quarn_caller &caller = call.caller();
  const bool trusted =
      caller.uid == 0 || kind_of_caller(caller, client_group()) == caller_kind::trusted;
  // All applications have one user, and what an application asks for is for it alone.
  call.reply_int(quarnd_make_app_data(arguments.pkg_id, caller.uid, trusted ? "" : caller.label));
}

GVariant *with_result(int result) { return g_variant_new("(i)", result); }

GVariant *reply_cancelled(const quarn_arguments &) { return with_result(QUARN_CANCELLED); }
/** The callback tells. */
GVariant *reply_taken(const quarn_arguments &) { return with_result(QUARN_OK); }
GVariant *reply_nothing(const quarn_arguments &) { return nullptr; }
GVariant *reply_present_time(const quarn_arguments &) { return present_time(); }
GVariant *reply_no_mode(const quarn_arguments &arguments) {
  // Without this process there is no restore mode.
  return with_result(arguments.on != 0 ? QUARN_REFUSED : QUARN_OK);
}

constexpr served_method kServedMethods[] = {
    {"set_activation", method_of_arguments{on_set_activation}, turn_rule::at_once, reply_cancelled},
    {"backup_enable", method_of_arguments{on_backup_enable}, turn_rule::at_once, reply_cancelled},
    {"restore_enable", method_of_arguments{on_restore_enable}, turn_rule::in_turn_to_switch_on,
     reply_no_mode},
    {"last_bu_time", plain_method{on_last_bu_time}, turn_rule::at_once, reply_present_time},
    {"get_app_list", method_of_request{quarn_request::app_list, on_get_app_list},
     turn_rule::in_turn, reply_cancelled},
    {"auto_backup_start", plain_method{on_auto_backup_start}, turn_rule::at_once, reply_nothing},
    {"manual_backup_start", method_of_request{quarn_request::manual_backup, on_manual_backup_start},
     turn_rule::at_once, reply_taken},
    {"manual_backup_cancel", method_of_request{quarn_request::cancel, on_manual_backup_cancel},
     turn_rule::at_once, reply_taken},
    {"app_data_backup_start",
     method_of_request{quarn_request::app_backup, on_app_data_backup_start}, turn_rule::in_turn,
     reply_taken},
    {"app_data_restore_start",
     method_of_request{quarn_request::app_restore, on_app_data_restore_start}, turn_rule::in_turn,
     reply_taken},
    {"make_app_data", method_of_arguments{on_make_app_data}, turn_rule::in_turn, reply_cancelled},
};

constexpr bool same_text(const char *one, const char *other) {
  while (*one != '\0' && *one == *other) {
    ++one;
    ++other;
  }
  return *one == *other;
}

constexpr bool serves_each_method() {
  if (std::size(kServedMethods) != std::size(kQuarnMethods)) return false;
  for (std::size_t i = 0; i < std::size(kQuarnMethods); ++i) {
    if (!same_text(kServedMethods[i].name, kQuarnMethods[i].name)) return false;
  }
  return true;
}
static_assert(serves_each_method(), "a row for each method, in the order of kQuarnMethods");

/** Serves a call by what its method needs. */
struct Server {
  const served_method &method;
  MethodCall &call;
  GVariant *given;

  void operator()(const plain_method &handler) const { handler.serve(call); }
  void operator()(const method_of_arguments &handler) const {
    const auto arguments = read_quarn_arguments(method.name, given);
    if (!arguments) return call.reply_int(kArgumentsMissing);
    handler.serve(call, *arguments);
  }
  void operator()(const method_of_request &handler) const {
    const auto arguments = read_quarn_arguments(method.name, given);
    if (!arguments) return call.reply_int(kArgumentsMissing);
    if (handler.kind != quarn_request::cancel && refuse_beyond_bounds(call)) return;
    const char *const package = arguments->pkg_id == nullptr ? "" : arguments->pkg_id;
    handler.serve(call, *arguments, accept_request(call, arguments->req_id, handler.kind, package));
  }
};

}  // namespace

const served_method *find_served_method(const std::string &name) {
  const quarn_method *const method = find_quarn_method(name.c_str());
  return method == nullptr ? nullptr : &kServedMethods[method - std::begin(kQuarnMethods)];
}

void serve_method(const served_method &method, MethodCall &call, GVariant *given) {
  std::visit(Server{method, call, given}, method.handler);
}
