/**
 * @file list_rebase.h
 * @brief Reading the cloud's application list, and making this device's document of it.
 */
#ifndef QUARN_D_BACKUP_LIST_REBASE_H
#define QUARN_D_BACKUP_LIST_REBASE_H

#include <string_view>
#include <vector>

struct backup_context;

/**
 * Make the document from cloud_app_list_text. Other devices' entries are kept
 * as they were written, whatever they hold. Without a document afterwards the
 * text was unusable; keep_cloud_list tells that it must not be replaced.
 * @return QUARN_OK
 */
int rebase_app_list_info(backup_context *ctx, const char *model_name, const char *serial);
/** Take over the entries of this device's last list, texts; those not understood are left out. */
void get_previous_package_list_info(backup_context *ctx,
                                    const std::vector<std::string_view> &packages);

#endif
