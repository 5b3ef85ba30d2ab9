#include "quarn_dbus_filter.h"

#include <gio/gunixfdlist.h>
#include <malloc.h>

#include <algorithm>
#include <iterator>
#include <memory>
#include <string>
#include <utility>

#include "gio_handles.h"
#include "quarn_common.h"
#include "quarn_d_gate.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_methods.h"
#include "quarn_d_packages.h"
#include "quarn_d_status.h"
#include "quarn_d_utils/handles.h"
#include "quarn_dbus_calls.h"
#include "quarn_dbus_dispatch.h"
#include "quarn_dbus_forward.h"
#include "quarn_dbus_limits.h"
#include "quarn_dbus_method_call.h"
#include "thread_annotations.h"

namespace {

using ConnectionPtr = Handle<GDBusConnection, &g_object_unref>;

/* ---- calls that GDBus does not hand over ------------------------------------- */

/** A message on its way from the bus thread to the main thread. */
struct Passed {
  ConnectionPtr connection;
  MessagePtr message;
  quarn_call_form form;
};
/** Held to write what is passed on and to take it: the lock is what orders the two threads. */
Mutex passing_mutex;
using PassedPtr = std::shared_ptr<Passed>;

std::string type_text(const char *signature) { return std::string("(") + signature + ")"; }

/** A call of an admitted caller that GDBus was not given, or has not the words for. */
void serve_raw(RawCall &call, const Passed &passed) {
  switch (passed.form) {
    case quarn_call_form::of_other_object:
      return forward_to_library(passed.connection.get(), passed.message.get());
    case quarn_call_form::too_large:
      cancel_quarn_terminate();
      tell_excess(call, kArgumentsTooLarge);
      return call.refuse(G_DBUS_ERROR_INVALID_ARGS, kArgumentsTooLarge);
    case quarn_call_form::other_arguments:
      cancel_quarn_terminate();
      return call.refuse(G_DBUS_ERROR_INVALID_ARGS,
                         "Arguments of type " +
                             type_text(g_dbus_message_get_signature(passed.message.get())) +
                             " are not those of " + call.method());
    default:
      return dispatch(call, nullptr);
  }
}

gboolean on_passed(gpointer data) {
  PassedPtr passed;
  {
    const MutexLock lock(passing_mutex);
    passed = *static_cast<const PassedPtr *>(data);
  }
  GDBusConnection *const connection = passed->connection.get();
  const char *const sender = g_dbus_message_get_sender(passed->message.get());
  with_caller(connection, sender == nullptr ? "" : sender, [passed](const quarn_caller &caller) {
    RawCall call(passed->connection.get(), passed->message.get(), caller);
    if (admit(call, nullptr)) serve_raw(call, *passed);
  });
  return G_SOURCE_REMOVE;
}

void delete_passed(gpointer data) { delete static_cast<PassedPtr *>(data); }

/** Takes @p message. */
void pass_to_main_thread(GDBusConnection *connection, MessagePtr message, quarn_call_form form) {
  std::unique_ptr<PassedPtr> passed;
  {
    const MutexLock lock(passing_mutex);
    passed = std::make_unique<PassedPtr>(std::make_shared<Passed>());
    Passed &filled = **passed;
    filled.connection.reset(G_DBUS_CONNECTION(g_object_ref(connection)));
    filled.message = std::move(message);
    filled.form = form;
  }
  // The priority of GDBus' own calls, so that all keep the order in which they came.
  g_idle_add_full(G_PRIORITY_DEFAULT, on_passed, passed.release(), delete_passed);
}

/* ---- what a message is ----------------------------------------------------------- */

quarn_call_form form_of(const quarn_method *method, const char *given) {
  if (method == nullptr) return quarn_call_form::unknown_method;
  if (has_signature(*method, given)) return quarn_call_form::right;
  return *given == '\0' ? quarn_call_form::without_arguments : quarn_call_form::other_arguments;
}

/** Whether a call of another object or interface has a handler that asks who calls. */
bool has_own_handler(GDBusMessage *message) {
  struct entry {
    const char *path, *interface_name, *member, *signature;
  };
  static constexpr entry kHandled[] = {
      {kPackagesObjectPath, "org.orvane.Quarn.Packages", "CancelOwn", ""},
      {kStatusObjectPath, "org.freedesktop.DBus.Properties", "Get", "ss"},
      {kStatusObjectPath, "org.freedesktop.DBus.Properties", "GetAll", "s"}};
  return std::any_of(std::begin(kHandled), std::end(kHandled), [message](const entry &handled) {
    return g_strcmp0(g_dbus_message_get_path(message), handled.path) == 0 &&
           g_strcmp0(g_dbus_message_get_interface(message), handled.interface_name) == 0 &&
           g_strcmp0(g_dbus_message_get_member(message), handled.member) == 0 &&
           g_strcmp0(g_dbus_message_get_signature(message), handled.signature) == 0;
  });
}

bool is_own_message(GDBusConnection *connection, GDBusMessage *message) {
  return g_strcmp0(g_dbus_message_get_sender(message),
                   g_dbus_connection_get_unique_name(connection)) == 0;
}

quarn_call_form form_of_call(GDBusMessage *message) {
  GVariant *const body = g_dbus_message_get_body(message);
  if (body != nullptr &&
      g_variant_get_size(body) > most_argument_bytes(g_dbus_message_get_member(message))) {
    return quarn_call_form::too_large;
  }
  if (g_strcmp0(g_dbus_message_get_path(message), kQuarnObjectPath) != 0 ||
      g_strcmp0(g_dbus_message_get_interface(message), kQuarnInterface) != 0) {
    return quarn_call_form::of_other_object;
  }
  return form_of(find_quarn_method(g_dbus_message_get_member(message)),
                 g_dbus_message_get_signature(message));
}

/* ---- what is kept of it ------------------------------------------------------------ */

/** Bytes of what the allocator gives back to the system as soon as it is free. */
constexpr int kGivenBackAtOnce = 131072;

/**
 * The same message without the arguments that nobody is to hold while it waits, and without
 * descriptors: no method of ours takes any, and who sends enough of them would leave the process
 * without.
 * @return null when there are too few descriptors to copy it
 */
MessagePtr lightened(GDBusMessage *message, bool too_large) {
  MessagePtr copy(g_dbus_message_copy(message, nullptr));
  if (!copy) return nullptr;
  g_dbus_message_set_unix_fd_list(copy.get(), nullptr);
  if (!too_large) return copy;
  // Else the allocator takes the size of what it is given back for the measure of what to keep.
  if (g_variant_get_size(g_dbus_message_get_body(message)) > kMostListArgumentBytes) {
    mallopt(M_MMAP_THRESHOLD, kGivenBackAtOnce);
  }
  g_dbus_message_set_body(copy.get(), nullptr);
  return copy;
}

bool has_descriptors(GDBusMessage *message) {
  return g_dbus_message_get_unix_fd_list(message) != nullptr;
}

/** The answer of a client to its callback. */
bool is_answer_of_client(GDBusMessage *message) {
  const GDBusMessageType type = g_dbus_message_get_message_type(message);
  if (type != G_DBUS_MESSAGE_TYPE_METHOD_RETURN && type != G_DBUS_MESSAGE_TYPE_ERROR) return false;
  const char *const sender = g_dbus_message_get_sender(message);
  const quarn_caller caller = known_caller(sender == nullptr ? "" : sender);
  // Root's services are asked for more than an integer.
  return caller.known && caller.uid != 0;
}

/** What is no call, without what nobody wants of a client. */
MessagePtr without_burden(MessagePtr message) {
  GVariant *const body = g_dbus_message_get_body(message.get());
  const bool too_large = body != nullptr && g_variant_get_size(body) > kMostListArgumentBytes;
  const bool burdened = too_large || has_descriptors(message.get());
  if (!burdened || !is_answer_of_client(message.get())) return message;
  MessagePtr light = lightened(message.get(), too_large);
  return light ? std::move(light) : std::move(message);
}

/** A call, on its way to who answers it. @return null when that is not GDBus */
MessagePtr filtered_call(GDBusConnection *connection, MessagePtr message) {
  const quarn_call_form form = form_of_call(message.get());
  const bool too_large = form == quarn_call_form::too_large;
  const bool burdened = too_large || has_descriptors(message.get());
  // What is not taken is answered as it came.
  MessagePtr light = burdened ? lightened(message.get(), too_large) : nullptr;
  MessagePtr &kept = burdened ? light : message;
  if (!kept || !take_quarn_call(kept.get(), form)) {
    refuse_untaken_call(connection, message.get());
    return nullptr;
  }
  note_quarn_call(kept.get(), form);
  const bool of_library = form == quarn_call_form::right ||
                          (form == quarn_call_form::of_other_object && has_own_handler(kept.get()));
  if (of_library) return std::move(kept);
  pass_to_main_thread(connection, std::move(kept), form);
  return nullptr;
}

}  // namespace

GDBusMessage *filter_calls(GDBusConnection *connection, GDBusMessage *message, gboolean incoming,
                           gpointer) {
  if (incoming == FALSE) {
    note_quarn_answer(message);
    return message;
  }
  if (is_own_message(connection, message)) return message;
  MessagePtr owned(message);
  if (g_dbus_message_get_message_type(message) != G_DBUS_MESSAGE_TYPE_METHOD_CALL) {
    return without_burden(std::move(owned)).release();
  }
  return filtered_call(connection, std::move(owned)).release();
}
