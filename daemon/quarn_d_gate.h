/**
 * @file quarn_d_gate.h
 * @brief What the bus tells of the callers, asked for once a connection.
 *
 * A call waits for the answer without holding anything up; calls of one
 * connection keep their order. What is known of a connection is forgotten when
 * it leaves the bus. Main thread, where not told otherwise.
 */
#ifndef QUARN_D_GATE_H
#define QUARN_D_GATE_H

#include <gio/gio.h>

#include <functional>
#include <string>

#include "quarn_d_callers.h"

/** Connections that are remembered at the most. */
inline constexpr std::size_t kMostCallersKnown = 256;

using caller_work = std::function<void(const quarn_caller &caller)>;

/**
 * Do @p work when it is known who @p sender is: at once, or later from the main
 * loop. A caller that the bus does not tell of comes with `known` false.
 */
void with_caller(GDBusConnection *connection, const std::string &sender, caller_work work);

/** True while calls wait to learn who made them: the daemon is not idle then. */
[[nodiscard]] bool callers_are_asked_for();

/** What is known of a connection; `known` is false when nothing is. Any thread. */
[[nodiscard]] quarn_caller known_caller(const std::string &sender);

/**
 * The same, asking the bus in place for what is not known.
 * @param ms how long the bus may take
 */
[[nodiscard]] quarn_caller ask_caller_now(GDBusConnection *connection, const std::string &sender,
                                          int ms);

/** What a call asks for. @param arguments may be null. Any thread. */
[[nodiscard]] quarn_subject subject_of_call(const std::string &interface_name,
                                            const std::string &member, GVariant *arguments);

/**
 * The verdict on a call. A refusal is logged with its caller and method, as tells_of_refusal()
 * says.
 * @param cloud_mode as for may_call()
 */
[[nodiscard]] caller_verdict judge_call(const quarn_caller &caller, const std::string &sender,
                                        const quarn_subject &subject, bool cloud_mode);

/** The error text of a refusal. */
[[nodiscard]] std::string refusal_text(const quarn_subject &subject, const caller_verdict &verdict);

/** Refusals of one caller that are told within kRefusalPeriod, each with its line. */
inline constexpr unsigned int kMostRefusalLines = 60;
/** Microseconds. */
inline constexpr gint64 kRefusalPeriod = 60'000'000;

/**
 * Whether the line about a refusal of @p caller may be written, however many connections it has.
 * What is left out is counted, and told when the period is over or callers are forgotten. Any
 * thread.
 */
[[nodiscard]] bool tells_of_refusal(const quarn_caller &caller);

/** Requests of one application, over all its connections, that are accepted within kRequestPeriod.
 */
inline constexpr unsigned int kMostRequestsOfPeriod = 120;
/** Microseconds. */
inline constexpr gint64 kRequestPeriod = 60'000'000;

/**
 * Count a request that is about to be accepted. Each costs lines of the log, writes and transfers,
 * of which an application may bring about so many and no more; who is trusted is not counted.
 * @return false when it is one too many
 */
[[nodiscard]] bool count_request(const quarn_caller &caller);

/** Forget everything; for a connection that is left. */
void forget_callers();

/** Who is asked instead of the bus, in tests; the answer may come at any time, on the main thread.
 */
using caller_source = std::function<void(const std::string &sender, caller_work answer)>;
/** @param source null: the bus */
void set_caller_source(caller_source source);
/** @param clock microseconds that only grow; null: the system's, of refusals and requests. For
 * tests. */
void set_refusal_clock(gint64 (*clock)());

#endif
