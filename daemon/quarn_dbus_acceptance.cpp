#include "quarn_dbus_acceptance.h"

#include "quarn_common.h"
#include "quarn_d_gate.h"
#include "quarn_log.h"

namespace {

void refuse_for_number(MethodCall &call, const char *which, const std::string &text) {
  if (tells_of_refusal(call.caller())) {
    LOGE("refused : too many requests of (%s) %s", call.sender().c_str(), which);
  }
  call.refuse(G_DBUS_ERROR_LIMITS_EXCEEDED, text);
}

}  // namespace

waiting_parties parties_of(const MethodCall &call) {
  const quarn_caller &caller = call.caller();
  if (!caller.known || caller.uid == 0) return {};
  const std::string user = "user " + std::to_string(caller.uid);
  if (caller.uid != kAppUid) return {user, false};
  return {user + ", label " + caller.label, true};
}

bool refuse_beyond_places(MethodCall &call) {
  if (may_wait(call.sender(), parties_of(call))) return false;
  refuse_for_number(call, "wait", "Too many requests are waiting");
  return true;
}

bool refuse_beyond_bounds(MethodCall &call) {
  if (refuse_beyond_places(call)) return true;
  if (count_request(call.caller())) return false;
  refuse_for_number(call, "within a minute", "Too many requests within a minute");
  return true;
}

RecordPtr make_record(const MethodCall &call, guint32 req_id) {
  return RecordPtr(
      new client_cb_data{req_id, call.sender(), count_waiting(call.sender(), parties_of(call))});
}

RecordPtr make_uncounted_record(const MethodCall &call, guint32 req_id) {
  return RecordPtr(new client_cb_data{req_id, call.sender(), nullptr});
}

RecordPtr accept_request(const MethodCall &call, guint32 req_id, quarn_request kind,
                         const std::string &text) {
  RecordPtr record = kind == quarn_request::cancel ? make_uncounted_record(call, req_id)
                                                   : make_record(call, req_id);
  quarn_dbus_accept_request(kind, text, record.get());
  return record;
}
