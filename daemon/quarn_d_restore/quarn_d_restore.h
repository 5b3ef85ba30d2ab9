/**
 * @file quarn_d_restore.h
 * @brief What others ask the restore engine for. Main thread only.
 *
 * One package's restore is app_restore.h, what an ended process has left recovery.h, and what is
 * told of restores under way restore_progress.h.
 */
#ifndef QUARN_D_RESTORE_H
#define QUARN_D_RESTORE_H

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "quarn_common.h"

struct client_cb_data;

/** Whether packages are restored as they are installed, and for whom. */
enum class restore_mode { off, cloud, companion };
[[nodiscard]] restore_mode current_restore_mode();
/** Restore mode of the phone-transfer companion is active. No part of the daemon calls it. */
[[nodiscard]] bool pellix_restore_running();
/** Restore mode was enabled by the cloud client. */
[[nodiscard]] bool cloud_restore_running();
/** Packages that are waited for, in the order given; none while the mode is off. */
[[nodiscard]] std::vector<std::string> restore_candidates();
/** True when a restore takes the companion's archive, at once, and not the cloud's. */
[[nodiscard]] bool restores_from_companion();

/**
 * Switch restore mode on, in place of an earlier one. Waits for the cloud's session where it is
 * @p client's.
 * @param serial_num the device whose archives are wanted
 * @param pkg_list JSON array of package ids; with none of them nothing is switched on
 * @param record kept while the mode lasts, for "restore_stop"
 * @return #QUARN_OK, #QUARN_REFUSED for the cloud while the companion's mode is on, or for a
 *         serial number that is none, #QUARN_CANCELLED when it was withdrawn meanwhile
 */
[[nodiscard]] int enable_restore_mode(quarn_client_kind client, const std::string &serial_num,
                                      const char *pkg_list, std::unique_ptr<client_cb_data> record);
/** Restore mode off: it has served its purpose, or its client says that it has. */
void disable_restore_mode();
/**
 * Restore mode off, with its downloads, because its client does not want it any more: it was not
 * used.
 * @param sender whose mode, a unique bus name
 * @return false when there is none of that client
 */
[[nodiscard]] bool withdraw_restore_mode(const std::string &sender);
/** Who is told that restore mode or its candidates may have changed; set once at start. */
void set_restore_mode_observer(void (*observer)());

/**
 * Answer a client's request for the application list: the cloud's, or the companion's of this
 * device.
 * @param record of the client; its answer is its last callback
 * @return #QUARN_OK, or #QUARN_FAILED when it could not be had
 */
int get_app_list(quarn_client_kind client, std::unique_ptr<client_cb_data> record);
/** Answer @p sender's requests for the cloud's list as cancelled. @return how many */
std::uint32_t withdraw_app_lists(const std::string &sender);

#endif
