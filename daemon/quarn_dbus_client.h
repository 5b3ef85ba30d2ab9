/**
 * @file quarn_dbus_client.h
 * @brief Calls back to clients, and published signals.
 *
 * Any thread: every call keeps its caller until the client has answered or
 * the time-out has passed, or until quarn_dbus_stop_waiting(). On the main
 * thread that is its fiber only, while the loop goes on; what calls from no
 * fiber there goes on at once, with #QUARN_FAILED, and the answer is taken when
 * it comes. On another thread a callback patience may end the wait. Callbacks
 * leave in the order of the calls. Failures are logged and end in
 * #QUARN_FAILED.
 */
#ifndef QUARN_DBUS_CLIENT_H
#define QUARN_DBUS_CLIENT_H

#include <gio/gio.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

/**
 * One pending client request. The dispatcher makes it; the sender of the
 * request's last callback deletes it.
 */
struct client_cb_data {
  std::uint32_t req_id = 0; /**< chosen by the client, echoed in every callback */
  std::string sender;       /**< the client's unique bus name */
  /** Counts among the waiting requests while this record lives; null: does not count. */
  std::shared_ptr<const void> counted = nullptr;
};

/** The connection that the bus-acquired callback was given; null before. */
extern GDBusConnection *quarn_dbus_connection;

/** What a request is, and with it which callback is its last. */
enum class quarn_request { restore_mode, app_list, manual_backup, cancel, app_backup, app_restore };

/**
 * A request is accepted: from now on it ends with exactly one last callback,
 * that of its sender below or that of quarn_dbus_end_requests(). Nothing of the
 * record is read after its last callback.
 * @param text what the last callback carries beside the result: a package id
 */
void quarn_dbus_accept_request(quarn_request kind, const std::string &text,
                               const client_cb_data *record);

/**
 * The process ends: whoever waits for a client goes on at once, and callbacks
 * are sent without waiting for their answers from now on. Not to be undone.
 */
void quarn_dbus_stop_waiting();
/** True after quarn_dbus_stop_waiting(). */
[[nodiscard]] bool quarn_dbus_waiting_stopped();

/** The calling thread is the one whose loop must never stand still. */
void quarn_dbus_note_main_thread();
/** Answers that are awaited on the main thread at the most; beyond it a callback is only sent. */
inline constexpr std::size_t kMostAnswersAwaited = 512;
/** Of these, one client's. */
inline constexpr std::size_t kMostAnswersOfClient = 64;

/**
 * Asked every second off the main thread while a client does not answer.
 * @return true when others have waited for long enough: the wait then ends
 */
using callback_patience = bool (*)(const std::string &sender);
/** @param exhausted null: as long as the time-out */
void quarn_dbus_set_patience(callback_patience exhausted);
/** Microseconds that were spent off the main thread on waiting for answers. Any thread. */
[[nodiscard]] std::int64_t quarn_dbus_time_waited();

/** Tell each accepted request that has not had its last callback that it is cancelled. */
void quarn_dbus_end_requests();
/** Returns when everything is written, or when @p ms have passed. */
void quarn_dbus_flush(unsigned int ms);

/** "restore_enable_cb"; the record is deleted when @p msg is "restore_stop". */
int quarn_dbus_restore_enable_cb(int err, const char *msg, void *record);
/** "get_app_list_cb"; the record is deleted. */
int quarn_dbus_get_app_list_cb(int err, const char *msg, void *record);
/** "manual_backup_status"; the record is deleted unless @p status is 2 (in progress). */
int quarn_dbus_manual_backup_status(int err, int status, void *record);
/** "manual_backup_cancel_result"; the record is deleted. */
int quarn_dbus_manual_backup_cancel_result(int err, void *record);
/** "app_data_backup_complete"; the record is deleted. */
int quarn_dbus_app_backup_complete(int err, const char *msg, void *record);
/** "app_data_restore_complete"; the record is deleted. */
int quarn_dbus_app_restore_complete(int err, const char *msg, void *record);

/**
 * Broadcast a signal with one text.
 * @return 0, or -1 when it could not be emitted
 */
int quarnd_dbus_publish(const char *signal_name, const char *value);

#endif
