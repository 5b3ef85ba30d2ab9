/**
 * @file icon.h
 * @brief A package's icon, hidden while its data is restored.
 *
 * Every function logs its failures and reports them by its result only.
 * Main thread.
 */
#ifndef QUARN_D_UTILS_ICON_H
#define QUARN_D_UTILS_ICON_H

/** Show a package's icon, or hide it now (delay 0.0) or after @p delay seconds. */
void appear_app_icon(const char *pkg_id, bool show, double delay);
/** Cancel the first pending hide of a package. */
void delete_icon_hide_delay_timer(const char *pkg_id);
/** Drop all pending hides and their timers. */
void init_icon_hide_delay_timer_list();
/** Empty install_complete_pkgs. */
void init_install_complete_pkgs_list();

#endif
