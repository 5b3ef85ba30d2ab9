/**
 * @file quarn_dbus_methods.h
 * @brief What is done for each method of kQuarnMethods: its handler, whether it waits for an
 * earlier process, and what it answers when the process leaves before anyone has looked at the
 * call.
 */
#ifndef QUARN_DBUS_METHODS_H
#define QUARN_DBUS_METHODS_H

#include <glib.h>

#include <string>
#include <variant>

#include "quarn_d_methods.h"
#include "quarn_dbus_acceptance.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_method_call.h"

/** The reply to a call whose arguments are missing. */
inline constexpr int kArgumentsMissing = -1;

/** Is served whatever arguments come, or none. */
struct plain_method {
  void (*serve)(MethodCall &call);
};
/** Needs its arguments; without them the reply is kArgumentsMissing. */
struct method_of_arguments {
  void (*serve)(MethodCall &call, const quarn_arguments &arguments);
};
/** The same, and is accepted: from then on it ends with one last callback, whatever happens. */
struct method_of_request {
  quarn_request kind;
  void (*serve)(MethodCall &call, const quarn_arguments &arguments, RecordPtr record);
};
using method_handler = std::variant<plain_method, method_of_arguments, method_of_request>;

/** Which calls touch what an earlier process may still be writing, and wait for its end. */
enum class turn_rule {
  at_once,
  in_turn,
  in_turn_to_switch_on /**< only where the argument `on` is not 0 */
};

struct served_method {
  const char *name;
  method_handler handler;
  turn_rule turn;
  /**
   * The reply, floating, null for the empty one, of a call that nobody has looked at and whose work
   * does not end or does not begin. Any thread.
   */
  GVariant *(*reply_unlooked)(const quarn_arguments &arguments);
};

/** @return null: the interface has no such method. Any thread. */
[[nodiscard]] const served_method *find_served_method(const std::string &name);

/**
 * Do what the method does, and reply. Main thread; may wait where its fiber can.
 * @param given the call's arguments, which outlive the answer; null: there are none
 */
void serve_method(const served_method &method, MethodCall &call, GVariant *given);

#endif
