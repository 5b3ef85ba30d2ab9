/**
 * @file quarn_d_utils.h
 * @brief Files, archives, packages, the cloud session and the small platform services.
 *
 * Every function logs its failures and reports them by its result only.
 * Paths are absolute. Whatever lies below a package root is reached without
 * following a symbolic link that an application could have made.
 */
#ifndef QUARN_D_UTILS_H
#define QUARN_D_UTILS_H

#include <glib.h>
#include <json-c/json.h>
#include <sys/stat.h>
#include <unzip.h>
#include <zip.h>

#include <atomic>
#include <cstdint>
#include <map>
#include <mutex>
#include <string>
#include <tuple>
#include <vector>

#include "backup_transport.h"
#include "files/package_files.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/handles.h"
#include "rules/path_matcher.h"
#include "rules/rules_file.h"

/* ---- file.cpp: any thread ------------------------------------------------ */

/** True for a regular file; a link is neither file nor directory. */
bool file_exist(const char *path);
/** True for a directory. */
bool is_directory(const char *path);
/** True when a regular file lies anywhere below @p dir. */
bool file_exist_in_directory(const char *dir);
/** The negation of file_exist_in_directory(). */
bool is_empty_directory(const char *dir);
/** Size in bytes, -1 on failure. */
int get_file_size(const char *path);
/** Read a whole file; @p buffer is malloc'd, NUL-terminated and the caller's. */
bool read_data_from_file(const char *path, char **buffer);
/** CRC-32 (IEEE 802.3) of the content; 0 on failure. */
std::uint32_t get_file_crc(const char *path);
/** Remove a regular file. */
bool delete_file(const char *path);
/** Remove a directory with everything in it; links are refused and stay. */
bool delete_directory_util(const char *dir);
/** Empty a directory, and remove it too when @p remove_directory is set. */
bool clear_directory(const char *dir, bool remove_directory);
/** Empty a directory but for the entry whose full path is @p keep. */
bool clear_shared_data_dir_except_temp_backup(const char *dir, const char *keep);
/** Free bytes of the file system, those reserved for the super-user included; 0 on failure. */
std::uint64_t get_dir_available_size(const char *path);
/** Make the parent directory of a file, with its ancestors. */
bool create_directory_of_file(const char *file);
/** Replace a file's content. @return 0, 1 for empty data or path, 36 when writing failed */
int write_string_to_file(std::string data, std::string path);
/** Copy a regular file's content. */
bool copy_file(const char *src, const char *dst);

/* ---- file_info_table.cpp: one table, one thread -------------------------- */

/** Table of the modes, owners, labels and links of one archive. */
struct file_info_table_h {
  json_object *root = nullptr;          /**< the document; owns everything below */
  json_object *symbolic_list = nullptr; /**< "quarn_symbolic_info", borrowed */
  using Attributes = std::map<std::tuple<int, unsigned int, unsigned int, std::string>, JsonPtr>;
  /** Attribute objects by permission, owner, group and label: entries with the same share one. */
  Attributes attributes;
  Attributes::iterator used = attributes.end(); /**< the last one: the next entry's as a rule */
  std::uint64_t members = 0;                    /**< files, directories and links that were added */
  std::uint64_t names = 0;                      /**< bytes of their names */
  std::uint64_t text = 0; /**< bytes of the document's text with them, or a few less */
};

/** Make an empty table; *@p table is null on failure. Released with release_file_info_table(). */
void ready_file_info_table(file_info_table_h **table);
/** Release a table; null is accepted. */
void release_file_info_table(file_info_table_h *table);
/**
 * Attributes of one entry; @p label is malloc'd, null when it could not be read.
 * @param fd the entry's descriptor, borrowed, when it is open: its label is then the label of what
 *           was opened, found without another walk along the path; else negative
 */
bool get_file_info_from_file(const char *path, const struct stat &stat, int *permission,
                             unsigned int *uid, unsigned int *gid, char **label, int fd = -1);
/**
 * Add a directory or a regular file. *@p error becomes 36 on failure, else stays.
 * @param fd as for get_file_info_from_file()
 */
void add_to_file_info_table(file_info_table_h *table, const char *root, const char *path,
                            const struct stat &stat, int *error, int fd = -1);
/**
 * Add a symbolic link. *@p error becomes 36 on failure, else stays.
 * @param dir the directory that the link is in, borrowed, when it is open: the link is then found
 *            without another walk along the path; else negative
 */
void add_sym_info_to_file_info_table(file_info_table_h *table, const char *root, const char *path,
                                     const struct stat &stat, int *error, int dir = -1);
/** Write the table's JSON text and release its root. @return as write_string_to_file() */
int save_file_info_table(file_info_table_h *table, const char *path);

/* ---- path_rules.cpp: rules of the calling thread ------------------------- */

extern thread_local std::vector<std::string> backup_include_list;
extern thread_local std::vector<std::string> backup_exclude_list;
extern thread_local bool xml_has_include_field;

/** Forget the calling thread's rules: everything is backed up. */
void reset_backup_path_info();
/** Load a package's rules file, if it has one, in place of the thread's rules. */
void parse_backup_path_xml(const char *pkg_id, const char *pkg_type, const char *root);
/** What the last parse_backup_path_xml() of the calling thread found; none after a reset. */
rules_state backup_rules_state();
/** rules_usable() of that. */
bool backup_rules_usable();
/** Append @p path when something lies there. */
void add_to_path_info_list(const char *path, std::vector<std::string> *list);
/** Whether the thread's rules take the file or link at @p path. */
bool is_backup_file(const char *path);
/** Bytes that an archive would take from @p dir; 26214401 for an unreadable directory. */
std::uint64_t get_dir_backup_size(const char *dir, const char *pkg_id, const char *root);

/* ---- zip_writer.cpp, zip_reader.cpp -------------------------------------- */

/**
 * Pack one package's data. Takes its PackageDataLock. The rules of the calling
 * thread apply. Nothing is made below a root that has gone, and a package that
 * goes meanwhile fails. The first member beyond one of @p bounds ends the work.
 * @param[out] error  set on failure only: 31 archive not opened, 36 any entry failed
 * @param[out] excess when not null: the bound that was met
 * @param stop        when not null: once it is true the work ends with 36; any thread sets it
 */
void make_zip_data(const char *pkg_id, const char *root, const char *zip_path, int *error,
                   const archive_bounds &bounds = kNoBounds, archive_excess *excess = nullptr,
                   const std::atomic<bool> *stop = nullptr);
/** Walk one directory into the archive. @return true when anything was recorded */
bool parse_app_dir_for_zip(const char *pkg_id, const char *root, zipFile zip, const char *dir,
                           file_info_table_h *table, int *error);
/** Add one file's bytes as one entry. */
bool add_file_to_zip(const char *root, zipFile zip, const char *file, int *error);
/** Add the table's text as the last entry. */
void insert_file_info_table_to_zip(file_info_table_h *table, zipFile zip, const char *pkg_id,
                                   const char *root, int *error);

/** What became of an archive's entries. */
struct unzip_report {
  unsigned int extracted = 0; /**< files; folder entries count nowhere */
  unsigned int refused = 0;   /**< hostile: nothing of them lies below the destination */
  unsigned int failed = 0;    /**< corrupt, or not to be written; a part may lie there */
  /** True when the destination holds everything that the archive had. */
  bool complete() const { return refused == 0 && failed == 0; }
};

/**
 * Unpack an archive below @p destination: files are created new, the
 * package's own and as unpacked_file.h says, whatever lay in their place; the table is
 * root's, mode 0600. Takes no PackageDataLock. Entries that
 * are refused or fail are logged and left out; @p report tells how many.
 * Entries that name a folder make it, and cost nothing where that is refused.
 * @return 0, 14, or 31 for an archive that cannot be opened, is empty, or
 *         announces more than bounds.h lets it: of such a one nothing is unpacked
 */
int unzip_data(const char *pkg_id, const char *destination, const char *zip_path,
               unzip_report *report);
/** The same without a report. */
int unzip_data(const char *pkg_id, const char *destination, const char *zip_path);
/** Write the archive's current entry, opened raw, below @p destination. */
bool extract_file_from_zip(const char *pkg_id, const char *destination, unzFile archive,
                           const char *name);

/* ---- package.cpp: any thread --------------------------------------------- */

/** Packages whose installation completed since the list was last cleared. */
extern std::vector<std::string> install_complete_pkgs;
extern std::mutex installed_check_mutex;

/** True when the application's API version is at least @p version, compared as bytes. */
bool app_support_api_version(const char *appid, const char *version);
/** True when the application takes part in backup. */
bool backup_enabled_app(const char *appid);
/** True when the package is in install_complete_pkgs. */
bool already_installed_package(const char *pkgid);
/** True when the package lies on external storage. */
bool app_data_storage_is_external(const char *pkgid);
/** Package id and version of an application, malloc'd. @return 0 or 42 */
int get_pkg_info(const char *appid, char **pkgid, char **version);
/** Root path of a package, malloc'd; null on failure. */
char *get_app_root_path(const char *pkgid);
/** The same into a string. @return 0 or 36 */
int get_string_app_root_path(const char *pkgid, std::string &root);

/* ---- device_info.cpp: any thread ----------------------------------------- */

/** Model name and serial number (IMEI), malloc'd; null where unknown. */
void get_device_info(char **model, char **serial);
/** Milliseconds since the Unix epoch. */
std::int64_t _get_current_timestamp();

/* ---- account.cpp: main thread -------------------------------------------- */

/** True when a user is signed in. */
bool server_util_is_account_exist();

/* ---- cloud_session.cpp ---------------------------------------------------- */

/**
 * True when the transport is ready; starts it when needed and waits up to 60
 * seconds: the main thread in a nested loop, other threads on a condition.
 */
bool cloud_initialized();
/** The transport handle; null before cloud_initialized() was true. Any thread. */
backup_trans_handle_h cloud_handler();

/* ---- nested_loop.cpp: main thread ----------------------------------------- */

/**
 * Wait until @p loop, one of new_wait_loop(), is quit; quit_nested_loops() and
 * withdraw_waits() end the wait as well. On a fiber everything else goes on
 * meanwhile; off it, GLib's sources do, and later waits end first.
 */
void run_nested_loop(GMainLoop *loop);
/** End every wait, the longest first, and refuse further ones. Returns when nobody waits. */
void quit_nested_loops();

/* ---- power.cpp: any thread ------------------------------------------------ */

/**
 * Take (true) or release (false) the CPU lock. Every taker counts: the device
 * lock is released with the last of them.
 */
void request_power_lock(bool lock);
/** True when nobody holds the CPU lock and no request is about to. */
bool is_idle_status();
/** Tells of requests that are queued and have not taken the lock yet. Set once at start. */
void set_pending_request_probe(bool (*probe)());

/* ---- boot_cleanup.cpp: backup worker -------------------------------------- */

/** Delete archives that an interrupted run left behind; once per process. */
void boot_cleanup_backup_items();
/** One package of that sweep. */
bool boot_foreach_package_info_callback(package_info_h info, void *user_data);
/** What else an earlier process may have left is mended after the sweep. Set once at start. */
void set_boot_recovery(void (*recover)());

/* ---- icon.cpp: main thread ------------------------------------------------- */

/** Show a package's icon, or hide it now (delay 0.0) or after @p delay seconds. */
void appear_app_icon(const char *pkg_id, bool show, double delay);
/** Cancel the first pending hide of a package. */
void delete_icon_hide_delay_timer(const char *pkg_id);
/** Drop all pending hides and their timers. */
void init_icon_hide_delay_timer_list();
/** Empty install_complete_pkgs. */
void init_install_complete_pkgs_list();

#endif
