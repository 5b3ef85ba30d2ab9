/**
 * @file quarn_d_end.h
 * @brief The step before the process leaves, in which no call and no request is lost.
 *
 * The bus name is given up first, so that the bus starts a new process for
 * every later call. What it had delivered until then is dispatched. If that
 * brought work, or a call that wants the daemon to stay, the name is taken
 * back where nobody has it yet; otherwise the work is finished without it.
 * Only then the main loop is quit.
 *
 * Main thread only, except is_answer_to_given_up_name().
 */
#ifndef QUARN_D_END_H
#define QUARN_D_END_H

/** What the end asks of the bus. Set once at start; without it the end is immediate. */
struct quarn_bus_name {
  /** Returns once the bus has answered: what it delivers later goes to another process. */
  void (*give_up)();
  /** Ends in note_quarn_name(). */
  void (*take_back)();
};
void set_quarn_bus_name(const quarn_bus_name &name);

/** The end was asked for and the daemon is idle. */
void begin_quarn_end();
/** A call came, and every call keeps the daemon. */
void withdraw_quarn_end();
/** The answer of the bus to a request for the name. */
void note_quarn_name(bool owned);

/** End as soon as the daemon is idle, without anyone asking for it. */
void end_quarn_when_idle();

/**
 * The process leaves whatever comes: an end that has begun is not taken back
 * any more, for a name that it got then would bring calls that nobody answers.
 */
void leave_quarn_for_good();

/**
 * Whether a signal is what the service manager sends a service for giving its
 * bus name up: it is no wish that the process should end. True once. Any thread.
 */
[[nodiscard]] bool is_answer_to_given_up_name(int signo);

#endif
