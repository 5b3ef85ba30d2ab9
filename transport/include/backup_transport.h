/**
 * @file backup_transport.h
 * @brief libbackup-transport: the way to the user's cloud storage.
 *
 * The library moves whole objects between the device and one store. Which
 * store that is, is told by a configuration file, never by the caller:
 *
 *     [cloud]
 *     url=file:///PATH            a folder; the embedded device's default
 *     user=NAME                   network stores only
 *     password=TEXT               network stores only
 *     ca-file=PATH                network stores only; PEM
 *     region=NAME                 S3 only
 *     addressing=path|virtual     S3 only
 *
 * The file is found at $QUARN_CLOUD_CONFIG, else at /etc/quarn/cloud.conf. It
 * must be mode 0600 when it holds a password, and it is read again when it
 * changes, so a new store serves the requests made after the change.
 * Credentials are never part of a URL that is logged.
 *
 * ## Promises, the same for every store
 * - An accepted request gets exactly one callback, on the default GLib main
 *   context, never from inside the call that made it. A refused request (any
 *   result but #BACKUP_TRANS_ERROR_NONE) gets none.
 * - Calls may come from any thread. Texts and records given to a callback are
 *   valid during the callback only.
 * - An object is whole or absent, in the store and on the device.
 * - At most #BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS transfers run at a time;
 *   further ones wait in the order in which they were accepted.
 * - Transient failures (connection lost, time-out, HTTP 408, 425, 429 and 500
 *   to 504) are repeated with exponential backoff and jitter within
 *   #BACKUP_TRANS_RETRY_TOTAL_SECONDS; a server's Retry-After is honoured.
 * - Remote paths are absolute ("/a/b.zip"), UTF-8, without ".", ".." or empty
 *   components; folders are named with or without a trailing slash. Any other
 *   path is refused with #BACKUP_TRANS_ERROR_ARGUMENT.
 */
#ifndef BACKUP_TRANSPORT_H
#define BACKUP_TRANSPORT_H

#include <stdbool.h>
#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/** Transfers that run at a time; what is accepted beyond that waits its turn. */
#define BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS 12

/** Seconds after which a transient failure is no longer repeated. */
#define BACKUP_TRANS_RETRY_TOTAL_SECONDS 120

/**
 * Bytes a second that a transfer must move on the average of each
 * #BACKUP_TRANS_LEAST_RATE_SECONDS, both directions counted; a slower one is a
 * network error, which is repeated as others are. 1000 is slow, and no fault.
 * With its limit of the size, or the size of what is sent, that bounds the time
 * of every transfer.
 */
#define BACKUP_TRANS_LEAST_RATE 512
#define BACKUP_TRANS_LEAST_RATE_SECONDS 60

/** Children that one listing answer holds at the most. */
#define BACKUP_TRANS_MAX_LIST_COUNT 100

/**
 * How the temporary files begin that a download makes beside its target on a
 * file system without nameless files. While its transfer lives it is locked
 * with flock(); one that is not was left by a process that has ended.
 */
#define BACKUP_TRANS_TEMPORARY_PREFIX ".quarn-part-"

/**
 * Results. 12 is part of the device's established interface; the others were
 * chosen beside it and do not change.
 */
typedef enum {
  BACKUP_TRANS_ERROR_NONE = 0,
  BACKUP_TRANS_ERROR_ARGUMENT = 1,        /**< a path, pointer or range that cannot be */
  BACKUP_TRANS_ERROR_NOT_INITIALIZED = 2, /**< no session, or no usable configuration */
  BACKUP_TRANS_ERROR_AUTHENTICATION = 10, /**< the store refused the credentials */
  BACKUP_TRANS_ERROR_NETWORK = 11,        /**< not reached, or lost, after all repetitions */
  BACKUP_TRANS_ERROR_NO_SUCH_OBJECT = 12, /**< no object (or folder) at that path */
  BACKUP_TRANS_ERROR_QUOTA = 13,          /**< the store has no room for it */
  BACKUP_TRANS_ERROR_CONFLICT = 14,       /**< the object changed since it was the basis */
  BACKUP_TRANS_ERROR_CANCELLED = 15,      /**< ended by backup_trans_cancel_request() */
  BACKUP_TRANS_ERROR_SERVER = 16,         /**< any other answer of the store */
  BACKUP_TRANS_ERROR_LOCAL_FILE = 17,     /**< a file on the device cannot be read or written */
  BACKUP_TRANS_ERROR_CERTIFICATE = 18,    /**< the server is not the one it says it is */
  BACKUP_TRANS_ERROR_TOO_LARGE = 19       /**< the object is larger than the caller's limit */
} backup_trans_error_code;

/** What a person should look at when a store cannot be used. */
typedef enum {
  BACKUP_TRANS_CAUSE_NONE = 0,        /**< nothing: the store can be used */
  BACKUP_TRANS_CAUSE_ADDRESS = 1,     /**< no such host, or nothing there that is such a store */
  BACKUP_TRANS_CAUSE_CERTIFICATE = 2, /**< the server's certificate is not to be trusted */
  BACKUP_TRANS_CAUSE_PASSWORD = 3,    /**< user name, password or rights */
  BACKUP_TRANS_CAUSE_SPACE = 4,       /**< the store has no room */
  BACKUP_TRANS_CAUSE_NETWORK = 5,     /**< not reached, or lost on the way */
  BACKUP_TRANS_CAUSE_SERVER = 6,      /**< the store answers with errors */
  BACKUP_TRANS_CAUSE_DEVICE = 7       /**< the configuration, or a file of this device */
} backup_trans_cause;

/** Options of a request; combine with |. */
enum {
  BACKUP_TRANS_OPTION_NONE = 0,
  /**
   * On a download: what is found now, an object or its absence, is the basis
   * of the next upload to the same path on the same handle. That upload fails
   * with #BACKUP_TRANS_ERROR_CONFLICT when the store holds something else by
   * then, and the basis is spent with it. Other transfers change no basis.
   */
  BACKUP_TRANS_OPTION_BASIS = 1
};

/** A session with the store; one per process is usual. */
typedef struct backup_trans_handle_s *backup_trans_handle_h;

/** What the store knows of an object; valid during the callback. */
typedef struct {
  const char *path; /**< absolute remote path, folders without a trailing slash */
  bool is_file;     /**< an object, else a folder */
  uint64_t size;    /**< bytes, 0 for a folder */
  int64_t
      timestamp_ms; /**< time given at its upload, milliseconds since the Unix epoch; 0 unknown */
} backup_trans_file_info_s;

/** One answer of a listing; valid during the callback. */
typedef struct {
  const backup_trans_file_info_s *children; /**< in the order of their paths' bytes */
  int count;                                /**< children in this answer */
  bool more; /**< more children follow: list again from start + count */
} backup_trans_child_list_s;

/** Answer to backup_trans_init(). */
typedef void (*backup_trans_init_cb)(backup_trans_error_code error, void *user_data);
/** Answer to a download. @p message is a text for people about an error, else NULL. */
typedef void (*backup_trans_download_cb)(backup_trans_error_code error, void *user_data,
                                         char *message);
/** Answer to an upload. @p info is the stored object's, NULL on an error. */
typedef void (*backup_trans_upload_cb)(backup_trans_error_code error, void *user_data,
                                       const backup_trans_file_info_s *info);
/** Answer to a listing. @p list is NULL on an error. */
typedef void (*backup_trans_child_list_cb)(backup_trans_error_code error, void *user_data,
                                           const backup_trans_child_list_s *list);
/** Answer to a deletion. @p info names the folder, on an error as well. */
typedef void (*backup_trans_delete_cb)(backup_trans_error_code error, void *user_data,
                                       const backup_trans_file_info_s *info);

/**
 * Answer to a check. @p message tells what was found out, for people, with what
 * the server said; it holds no credentials.
 */
typedef void (*backup_trans_check_cb)(backup_trans_error_code error, void *user_data,
                                      backup_trans_cause cause, const char *message);

/**
 * Start the library.
 * @param user_data passed to @p callback, the caller's
 * @param callback  called once, later, with #BACKUP_TRANS_ERROR_NONE when a
 *                  usable configuration was found; reaching the store is not
 *                  part of it
 * @return #BACKUP_TRANS_ERROR_NONE when the callback will come
 */
int backup_trans_init(void *user_data, backup_trans_init_cb callback);

/**
 * End the library: everything in flight ends with #BACKUP_TRANS_ERROR_CANCELLED
 * and its callbacks are still delivered while the main context runs. Handles
 * stay valid as values but refuse requests. Harmless when nothing was started.
 */
void backup_trans_deinit(void);

/** A session; NULL before a successful init. It is never released by the caller. */
backup_trans_handle_h backup_trans_create_handle(void);

/**
 * Download one object into a local file.
 *
 * The bytes go to a temporary file of mode 0600 beside @p local_path, which is
 * renamed over it once length and checksum are right. The folder of
 * @p local_path must exist.
 *
 * @param options #BACKUP_TRANS_OPTION_NONE or #BACKUP_TRANS_OPTION_BASIS
 */
int backup_trans_download_file_ors_async(backup_trans_handle_h handle, const char *remote_path,
                                         const char *local_path, void *user_data,
                                         backup_trans_download_cb callback, int options);

/**
 * The same with a limit: an object of more than @p max_size bytes ends it with
 * #BACKUP_TRANS_ERROR_TOO_LARGE as soon as that is known, is not asked for again,
 * and leaves nothing on the device. A caller that knows what it downloads says
 * so: a server can send what it likes.
 *
 * Libraries of earlier releases have neither this nor the next, nor
 * backup_trans_abort_request(); a caller that is to work with one of them looks
 * them up, or refers to them weakly.
 *
 * @param max_size bytes; 0: any number
 */
int backup_trans_download_limited_ors_async(backup_trans_handle_h handle, const char *remote_path,
                                            const char *local_path, void *user_data,
                                            backup_trans_download_cb callback, int options,
                                            uint64_t max_size);

/** Both: with a limit, and waiting for the result as backup_trans_download_file_ors() does. */
int backup_trans_download_limited_ors(backup_trans_handle_h handle, const char *remote_path,
                                      const char *local_path, int options, uint64_t max_size);

/**
 * The same as backup_trans_download_file_ors_async(), waiting for the result. Not for the main
 * thread of a process whose main loop must go on; it does not depend on the main context.
 */
int backup_trans_download_file_ors(backup_trans_handle_h handle, const char *remote_path,
                                   const char *local_path, int options);

/**
 * Upload one local file.
 *
 * The file is opened before the call returns: replacing or deleting the path
 * later does not change what is sent. It must be a regular file; a symbolic
 * link is refused with #BACKUP_TRANS_ERROR_LOCAL_FILE. The one exception is
 * "/proc/self/fd/N", the name of a descriptor that the caller holds until the
 * call has returned: by it the caller sends the file that it has looked at,
 * whatever lies under the file's own name by then. Opening that path is all
 * that it takes.
 *
 * @param timestamp_ms the object's time, milliseconds since the Unix epoch
 * @param options      #BACKUP_TRANS_OPTION_NONE
 * @param content_type MIME type, or NULL for application/octet-stream
 */
int backup_trans_upload_file_ors_async(backup_trans_handle_h handle, const char *local_path,
                                       const char *remote_path, backup_trans_upload_cb callback,
                                       int64_t timestamp_ms, int options, void *user_data,
                                       const char *content_type);

/**
 * List the direct children of a folder, in the order of their paths' bytes.
 * @param start number of children to leave out, counted from the first
 * @param count children wanted, 1 to #BACKUP_TRANS_MAX_LIST_COUNT
 * @param options #BACKUP_TRANS_OPTION_NONE
 *
 * A folder that does not exist has no children: the answer is an empty list.
 * The page that follows the last one is of the same moment as that, while it is
 * asked for within a minute and this library changed nothing in between.
 */
int backup_trans_get_folder_child_list_async(backup_trans_handle_h handle, const char *folder_path,
                                             int start, int count, int options, void *user_data,
                                             backup_trans_child_list_cb callback);

/**
 * Delete a folder with everything in it. A folder that does not exist is
 * reported with #BACKUP_TRANS_ERROR_NO_SUCH_OBJECT. The root is refused.
 */
int backup_trans_delete_folder_ors_async(backup_trans_handle_h handle, const char *folder_path,
                                         void *user_data, backup_trans_delete_cb callback);

/**
 * Find out whether the store can be used now, and what to look at if not: its
 * top is listed, and an object of a few bytes is put into a folder of its own,
 * read back and removed. Nothing is tried twice.
 */
int backup_trans_check_async(backup_trans_handle_h handle, void *user_data,
                             backup_trans_check_cb callback);

/**
 * What kept the last request, of any handle, from being served. A request that
 * was accepted before that one failed does not make it forgotten when it is
 * served; a later one does. An object that is not there or has changed is no
 * such thing, and what was cancelled or failed on the device does not count.
 * #BACKUP_TRANS_CAUSE_NONE before the first request. Any thread.
 */
backup_trans_cause backup_trans_last_cause(void);

/**
 * End everything in flight on the handle: each request's callback follows with
 * #BACKUP_TRANS_ERROR_CANCELLED within a second, unless it had already ended
 * otherwise. A NULL handle is accepted and nothing happens.
 */
void backup_trans_cancel_request(backup_trans_handle_h handle);

/**
 * The same for one request, or for all that were given this @p user_data, and
 * for no other.
 * @return #BACKUP_TRANS_ERROR_NONE when there was one that had not ended,
 *         #BACKUP_TRANS_ERROR_ARGUMENT otherwise, and where @p user_data is NULL
 */
int backup_trans_abort_request(backup_trans_handle_h handle, void *user_data);

/** A few words for people about a result; static. */
const char *backup_trans_error_text(backup_trans_error_code error);

/** One word for a cause ("password", ...); static. */
const char *backup_trans_cause_word(backup_trans_cause cause);

#ifdef __cplusplus
}
#endif
#endif
