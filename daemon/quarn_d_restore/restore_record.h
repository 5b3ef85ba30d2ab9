/**
 * @file restore_record.h
 * @brief The client that switched restore mode on, and the end of its messages.
 *
 * Main thread only.
 */
#ifndef QUARN_D_RESTORE_RESTORE_RECORD_H
#define QUARN_D_RESTORE_RESTORE_RECORD_H

#include <string>

/** Whether the client that is kept for "restore_stop" is @p sender, a unique bus name. */
bool restore_record_is_of(const std::string &sender);
/** The "restore_stop" of the kept client will carry @p result in place of 0. */
void set_restore_stop_result(int result);
/**
 * Send a client that is not kept its "restore_stop", from the main loop.
 * @param record is deleted with it
 */
void send_restore_stop(void *record, int result);

#endif
