/**
 * @file quarn_d_restore.h
 * @brief The restore engine. Main thread only.
 */
#ifndef QUARN_D_RESTORE_H
#define QUARN_D_RESTORE_H

#include <glib.h>
#include <json-c/json.h>

#include <string>
#include <vector>

#include "platform_package_manager.h"
#include "quarn_d_utils/quarn_d_utils.h"

/** The state of one package's restore; freed by the engine or by the waiting request. */
struct pkg_restore_context {
  int result = 0;
  std::string serial;
  int reserved = 0;
  bool wait_for_result = false;
  GMainLoop *main_loop = nullptr;
  bool reserved_flag = false;
  bool restore_started = false;
  int pending = 0;
  std::string pkgid;
  std::string version;
  std::string root;
  bool backup_enabled = true;
  void *client = nullptr; /**< client_cb_data of a waiting request */
};

/** Restore candidates still expected, in the order given. */
extern std::vector<std::string> pkg_list_to_be_restored;
/** Client of the current restore mode: 0 cloud, 1 phone-transfer companion. */
extern int current_restore_client;
/** Backup set chosen by the user. */
extern std::string serial_num_user_select;
/** Record of the client that switched restore mode on. */
extern void *g_restore_cb_data;

/* ---- attributes.cpp ---- */
int get_file_info_from_backup(json_object *table, const char *pkgid, const char *root,
                              const char *path, int *mode, unsigned int *uid, unsigned int *gid,
                              char **label);
int restore_file_info(const char *path, const char *pkgid, const char *root, json_object *table);
int is_known_exception_label(const char *path, const char *label, const char *pkgid);

/* ---- walk.cpp ---- */
int restore_app_info(const char *pkgid, const char *root);
int parse_app_dir_for_restore(const char *dir, const char *pkgid, const char *root,
                              json_object *table);
int restore_symlnk(const char *pkgid, const char *root, json_object *table);
void clear_app_dir(const char *pkgid, const char *root);

/* ---- snapshot.cpp ---- */
int temp_backup_initial_app_data(const char *pkgid, const char *root);
int parse_dir_for_copy(const char *dir, const char *temp_dir, const char *pkgid, const char *root,
                       file_info_table_h *table);
int rollback_to_initial_app_data(const char *pkgid, const char *root);
int parse_dir_for_rollback(const char *dir, const char *pkgid, const char *root);

/* ---- pipeline.cpp ---- */
int restore_app_data(const char *appid, pkg_restore_context *ctx);
void check_package_restore_complete(pkg_restore_context *ctx);

/* ---- install_monitor.cpp ---- */
int start_install_monitor();
int stop_install_monitor();
int package_to_be_restored(const char *pkgid);
/** How the engine ends restore mode; set once at start. */
void set_restore_disable(int (*disable)());

/* ---- app_list.cpp ---- */
int get_app_list(int client, void *invocation);

#endif
