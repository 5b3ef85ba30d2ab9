/**
 * @file quarn_common.h
 * @brief Names, paths, result codes and the key helper, shared with client code.
 */
#ifndef QUARN_COMMON_H
#define QUARN_COMMON_H

#include <cstdint>

/** Well-known bus name of the daemon. */
inline constexpr char kQuarnBusName[] = "org.orvane.Quarn";
/** The one object the daemon serves, and the one that clients export for its callbacks. */
inline constexpr char kQuarnObjectPath[] = "/org/orvane/Quarn/GDBus";
/** Interface of both objects. */
inline constexpr char kQuarnInterface[] = "org.orvane.Quarn";

/** Setting: automatic backup on (1) or off (0), an integer. */
inline constexpr char kBackupStatusKey[] = "db/private/quarn/backup_status";
/** Setting: last successful backup, milliseconds since the Unix epoch, a double. */
inline constexpr char kLastTimeKey[] = "db/private/quarn/last_time";

/** Package of the account that a user signs in with. */
inline constexpr char kAccountPackage[] = "com.velmor.velmoraccount";
/** Package of the phone-transfer companion. */
inline constexpr char kPellixPackage[] = "com.velmor.pellix-efl";
/** Where packages are installed. */
inline constexpr char kAppsDir[] = "/opt/usr/apps/";
/** Staged application list, below /tmp/. */
inline constexpr char kLocalAppListPath[] = "/tmp/quarn/app_list.txt";
/** The application list in the cloud. */
inline constexpr char kCloudAppListPath[] = "/app_list/app_list.txt";

/** Largest backup of one package, bytes (25 MiB). */
inline constexpr std::uint64_t kMaxBackupSize = 26214400;
/** Size reported for a directory that cannot be measured: just over the cap. */
inline constexpr std::uint64_t kUnmeasurableSize = kMaxBackupSize + 1;
/** User and group that own application data on the device. */
inline constexpr unsigned int kAppUid = 5000;
inline constexpr unsigned int kAppGid = 5000;

/** Result codes of the whole system; they reach clients unchanged. */
enum quarn_result : int {
  QUARN_OK = 0,
  QUARN_BAD_ARGUMENT = 1,       /**< bad argument or unknown package */
  QUARN_TRANSFER_FAILED = 12,   /**< transfer failed or Wi-Fi lost */
  QUARN_LIST_CHECK_FAILED = 13, /**< cloud list not checked, or a request not accepted */
  QUARN_OUT_OF_MEMORY = 14,     /**< out of memory while unpacking */
  QUARN_CANCELLED = 17,         /**< cancelled */
  QUARN_NO_FILE_INFO = 19,      /**< no file-info table */
  QUARN_PRELOADED = 27,         /**< preloaded package */
  QUARN_UNREADABLE = 31,        /**< archive or table entry unreadable */
  QUARN_UNCHANGED = 32,         /**< archive unchanged */
  QUARN_NO_SESSION = 33,        /**< cloud session or Wi-Fi unavailable */
  QUARN_SKIPPED = 34,           /**< external storage, no space, over the cap */
  QUARN_REFUSED = 36,           /**< refused, missing information or file-level failure */
  QUARN_DISABLED = 41,          /**< backup disabled by the package */
  QUARN_FAILED = 42             /**< generic failure; callback not delivered */
};

/** States of a manual backup, as sent with "manual_backup_status". */
enum quarn_backup_state : int {
  QUARN_BACKUP_RUNNING = 2,
  QUARN_BACKUP_SUCCEEDED = 4,
  QUARN_BACKUP_FAILED = 5,
  QUARN_BACKUP_CANCELLED = 6
};

/** For whom an application list is made and packages are restored, as calls name it. */
enum quarn_client_kind : int {
  QUARN_CLIENT_CLOUD = 0,    /**< a screen for what lies in the cloud */
  QUARN_CLIENT_COMPANION = 1 /**< the phone-transfer companion */
};

/** Words for a result code; static, never null. */
[[nodiscard]] const char *quarn_result_text(int result);

/**
 * The object path of a signal: "/" and @p key.
 * @return malloc'd text that the caller frees, null when @p key is null
 */
[[nodiscard]] char *quarn_utils_parse_key(const char *key);

#endif
