/**
 * @file cloud_cleanup.h
 * @brief What a run removes from the cloud: packages that are gone, and old versions.
 *
 * Each request and each answer counts in the run's context; its worker waits for them.
 */
#ifndef QUARN_D_BACKUP_CLOUD_CLEANUP_H
#define QUARN_D_BACKUP_CLOUD_CLEANUP_H

#include <string>

struct backup_context;

/** Delete the folders of packages that the list does not name. */
void delete_other_backup_items_in_cloud(backup_context *ctx);
/** Delete the other versions of every package that was uploaded. */
void delete_other_pkg_version_in_cloud(backup_context *ctx);
/**
 * The same of one package; while it is under way, version_list_pending counts it. Any thread.
 * @return whether it is under way
 */
bool delete_other_version_in_cloud(backup_context *ctx, const std::string &serial,
                                   const std::string &pkg_id, const std::string &version);

#endif
