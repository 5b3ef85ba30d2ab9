/**
 * @file quarn_dbus_calls.h
 * @brief The calls that the bus has delivered and that have no answer yet.
 *
 * The main thread may be in the middle of something long when the process has
 * to go: what it has not answered by then is answered for it.
 */
#ifndef QUARN_DBUS_CALLS_H
#define QUARN_DBUS_CALLS_H

#include <gio/gio.h>

#include <cstddef>
#include <string>

/** What can be said of a call before anyone looks into it. */
enum class quarn_call_form {
  right,             /**< a method of ours with its arguments */
  without_arguments, /**< and it needs some */
  other_arguments,
  unknown_method,
  of_other_object, /**< or of another interface */
  too_large        /**< its arguments were thrown away */
};

/** What calls that nobody has looked at yet may hold of memory, told by what they bring. */
inline constexpr std::size_t kMostBytesOfConnection = 2 * 1024 * 1024;
/** The same of all connections but root's. */
inline constexpr std::size_t kMostBytesOfConnections = 4 * 1024 * 1024;
/** So many small calls of a connection are taken whatever others have sent. */
inline constexpr std::size_t kCallsAlwaysTaken = 4;

/**
 * Count a call that was delivered, until its message goes: the bus library reads
 * as fast as anyone writes, and nobody waits for the main thread. Bus thread.
 * @return false when its connection, or all of them, have sent too much that
 * waits; it is to be kept nowhere then
 */
[[nodiscard]] bool take_quarn_call(GDBusMessage *message, quarn_call_form form);
/** The answer to a call that was not taken; the first of a row is logged. Bus thread. */
void refuse_untaken_call(GDBusConnection *connection, GDBusMessage *message);

/** A call was delivered. Bus thread. */
void note_quarn_call(GDBusMessage *message, quarn_call_form form);
/** A message leaves: an answer, maybe. Bus thread. */
void note_quarn_answer(GDBusMessage *message);

/**
 * A call is about to be served.
 * @return false when answer_quarn_calls() has it: it is to be left alone
 */
[[nodiscard]] bool begin_quarn_call(const std::string &sender, guint32 serial);

/**
 * Answer what has no answer, last callbacks first. Calls that would begin work
 * end cancelled. Nothing is served any more after it. Any thread.
 */
void answer_quarn_calls();

/** The error text for a method that the interface does not have. */
[[nodiscard]] std::string unknown_method_text(const std::string &method,
                                              const std::string &interface_name);

#endif
