/**
 * @file quarn_dbus_method_call.h
 * @brief One call of a method, and the way its one answer goes. Main thread only.
 */
#ifndef QUARN_DBUS_METHOD_CALL_H
#define QUARN_DBUS_METHOD_CALL_H

#include <gio/gio.h>

#include <string>

#include "gio_handles.h"
#include "quarn_d_callers.h"

class MethodCall {
 public:
  MethodCall(const char *sender, const char *interface_name, const char *method_name,
             guint32 serial, quarn_caller caller);
  MethodCall(const MethodCall &) = delete;
  MethodCall &operator=(const MethodCall &) = delete;
  virtual ~MethodCall() = default;

  /** @p value is a tuple, floating; null is the empty one. */
  virtual void reply(GVariant *value) = 0;
  virtual void refuse(int dbus_error, const std::string &text) = 0;

  void reply_int(int value) { reply(g_variant_new("(i)", value)); }
  const std::string &sender() const { return sender_; }
  const std::string &interface_name() const { return interface_; }
  const std::string &method() const { return method_; }
  /** The number that the sender has given it. */
  guint32 serial() const { return serial_; }
  const quarn_caller &caller() const { return caller_; }

 private:
  std::string sender_;
  std::string interface_;
  std::string method_;
  guint32 serial_;
  quarn_caller caller_;
};

/** A call that GDBus handed over. */
class InvokedCall : public MethodCall {
 public:
  InvokedCall(InvocationPtr invocation, const quarn_caller &caller);
  /** The invocation's; they go with the answer. */
  GVariant *parameters() const;
  void reply(GVariant *value) override;
  void refuse(int dbus_error, const std::string &text) override;

 private:
  InvocationPtr invocation_;
};

/** A call that GDBus would have answered by itself, without telling anyone. */
class RawCall : public MethodCall {
 public:
  /** Both are the caller's, and outlive this. */
  RawCall(GDBusConnection *connection, GDBusMessage *message, const quarn_caller &caller);
  void reply(GVariant *value) override;
  void refuse(int dbus_error, const std::string &text) override;

 private:
  void send(GDBusMessage *answer);

  GDBusConnection *connection_;
  GDBusMessage *message_;
};

/** Whether who has sent @p message wants no answer. Any thread. */
[[nodiscard]] bool wants_no_reply(GDBusMessage *message);

#endif
