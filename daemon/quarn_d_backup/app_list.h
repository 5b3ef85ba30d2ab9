/**
 * @file app_list.h
 * @brief The application list that a run writes: its document, and its staging.
 *
 * The document belongs to its run; functions without a result log their failures.
 */
#ifndef QUARN_D_BACKUP_APP_LIST_H
#define QUARN_D_BACKUP_APP_LIST_H

#include <json-c/json.h>

#include <string>

#include "quarn_d_utils/handles.h"

struct backup_context;

/** Start the run's document from the cloud's list. @return false when it could not be made */
[[nodiscard]] bool create_app_list_info(backup_context *ctx);
/** Begin this device's entry, without packages, in the document's list of devices. */
void add_model_entry(backup_context *ctx, const char *model_name, const char *serial);
/** Put the present time into an entry. */
void set_timestamp(json_object *backup_info);
/** Add one package to the document, when there is one. */
void add_pkg_info_to_app_list(backup_context *ctx, const char *pkg_id, const char *version,
                              int crc);
/** Write the document and release it. @return true when the file was written */
[[nodiscard]] bool save_app_list_to_file(backup_context *ctx);
/** Release the document and the cloud's text. */
void release_json_resource_of_app_list(backup_context *ctx);
/** The maker is the caller until the object is added to the document. */
[[nodiscard]] json_object *generate_new_json_object(backup_context *ctx);
[[nodiscard]] json_object *generate_new_json_array(backup_context *ctx);
/** Parse a whole text; null when it is not one JSON value or is nested too deeply. */
[[nodiscard]] json_object *generate_new_json_tokener_parser(backup_context *ctx, const char *text);

/** The same id and version as one text, which no other pair has. */
[[nodiscard]] std::string listed_key(const std::string &pkg_id, const std::string &version);
/**
 * Stage the list @p text once more, with the packages that a restore is to have
 * and that it does not name.
 * @return false when there is no such list
 */
[[nodiscard]] bool add_claimed_packages_to_list(backup_context *ctx, CString text);
/** True when one of the cloud's packages is claimed and not in the list that was made. */
[[nodiscard]] bool claimed_package_is_missing(backup_context *ctx);

#endif
