/**
 * @file quarn_d_turn.h
 * @brief Whose turn it is to write, when the bus has started a process while its predecessor
 * still finishes its work.
 *
 * The turn is a lock on a file that the process keeps for its life. Without
 * begin_quarn_turn(), or where the file cannot be had, it is always one's turn.
 */
#ifndef QUARN_D_TURN_H
#define QUARN_D_TURN_H

#include <csignal>
#include <string>
#include <vector>

/** What a process sends its predecessor to cancel the backups that run there. */
inline constexpr int kCancelSignal = SIGUSR1;
/** And to withdraw what the callers have asked for whose names it has left. */
inline constexpr int kWithdrawSignal = SIGUSR2;
/** What it leaves in place of a caller's name when requests wait for its predecessor's end. */
inline constexpr char kLeaveLine[] = "leave";

/**
 * Ask for the turn without waiting for it. Once, on the main thread.
 * @param lock_file a file in a folder that only the daemon's user can enter; borrowed for good
 * @param prepare   makes that folder; any thread
 * @param on_turn   called once on the main thread when the turn comes later; not when it is there
 */
void begin_quarn_turn(const char *lock_file, bool (*prepare)(), void (*on_turn)());

/** The last thing that a process does: what it has made for its turn is removed. */
void end_quarn_turn();

/** Any thread. */
[[nodiscard]] bool is_quarn_turn();

/** Wait up to @p ms. @return is_quarn_turn(). Any thread but the main one. */
[[nodiscard]] bool wait_for_quarn_turn(int ms);

/**
 * Leave a line for the process whose turn it is, and send it a signal.
 * @return false when it is one's own. Main thread.
 */
bool tell_quarn_predecessor(const std::string &line, int signo);

/** The lines that later processes have left since the last look, or since the start. Main thread.
 */
[[nodiscard]] std::vector<std::string> take_quarn_turn_lines();

/** Send a signal to the process whose turn it is. @return false when it is one's own. Any thread.
 */
bool signal_quarn_predecessor(int signo);

#endif
