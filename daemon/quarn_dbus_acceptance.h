/**
 * @file quarn_dbus_acceptance.h
 * @brief Taking a request on: within the bounds of its caller, with the record that it is answered
 * by. Main thread only.
 */
#ifndef QUARN_DBUS_ACCEPTANCE_H
#define QUARN_DBUS_ACCEPTANCE_H

#include <memory>
#include <string>

#include "quarn_d_utils/admission.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_method_call.h"

/** A request's record, until a handler takes it. */
using RecordPtr = std::unique_ptr<client_cb_data>;

/**
 * Whose bounds a call counts against, beside its connection's, of which one caller may have many.
 * Applications are one user, and callers by their labels.
 */
[[nodiscard]] waiting_parties parties_of(const MethodCall &call);

/** Refuse a request that may wait where too many do. @return whether it is refused */
[[nodiscard]] bool refuse_beyond_places(MethodCall &call);
/**
 * Refuse a request beyond what its caller may have waiting or may ask for in a minute.
 * @return whether it is refused
 */
[[nodiscard]] bool refuse_beyond_bounds(MethodCall &call);

/** A record that counts among what waits. */
[[nodiscard]] RecordPtr make_record(const MethodCall &call, guint32 req_id);
/** A request that ends what others wait for is accepted however many wait. */
[[nodiscard]] RecordPtr make_uncounted_record(const MethodCall &call, guint32 req_id);

/**
 * The record of a request that ends with a last callback, whatever happens.
 * @param text as for quarn_dbus_accept_request()
 */
[[nodiscard]] RecordPtr accept_request(const MethodCall &call, guint32 req_id, quarn_request kind,
                                       const std::string &text);

#endif
