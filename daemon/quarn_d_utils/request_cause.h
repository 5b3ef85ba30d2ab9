/**
 * @file request_cause.h
 * @brief Why a request or a run could not be served, for people.
 *
 * Result codes say what came of a request; one of them stands for many causes.
 * Any thread.
 */
#ifndef QUARN_D_UTILS_REQUEST_CAUSE_H
#define QUARN_D_UTILS_REQUEST_CAUSE_H

#include <string>

#include "backup_transport.h"

enum class request_cause {
  none,
  // of the cloud, as the transport tells them
  address,
  certificate,
  password,
  space,
  network,
  server,
  // of this device
  wifi,        /**< Wi-Fi was lost */
  device_full, /**< no room for a file that the request needs */
  device_file, /**< a file that the request needs could not be read or written */
  removed,     /**< the package was removed meanwhile */
  // of the application list
  list_foreign,    /**< written in a form that is not understood */
  list_too_large,  /**< larger than what is read */
  list_unreadable, /**< it arrived, but could not be read */
  list_changed     /**< another device wrote it meanwhile */
};

/** One word for a cause, static; empty for none. */
[[nodiscard]] const char *request_cause_word(request_cause cause);

/**
 * The cause behind the transport's answer @p code.
 * @param local_path the file on this device that it was about
 */
[[nodiscard]] request_cause cause_of_transfer(int code, const std::string &local_path);
/** The cause behind a file of ours that could not be written: is there room beside it? */
[[nodiscard]] request_cause cause_of_local_file(const std::string &local_path);

/** Remember what the request that ended last failed of, none when it was served. */
void note_request_end(request_cause cause);
/** What was remembered; none at first. */
[[nodiscard]] request_cause last_request_cause();

#endif
