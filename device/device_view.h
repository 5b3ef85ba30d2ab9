/**
 * @file device_view.h
 * @brief What a process inside the device sees: its mount namespace, and its environment.
 *
 * The device's own /tmp and applications cover the host's. Failures are thrown as Failure.
 */
#ifndef QUARN_DEVICE_VIEW_H
#define QUARN_DEVICE_VIEW_H

#include <string>

/** Where applications lie inside. */
inline constexpr char kAppsPath[] = "/opt/usr/apps";
/** What the daemon makes below /tmp: it is the device's own, whatever the host has there. */
inline constexpr char kDaemonTmpEntry[] = "quarn";
/** The supervisor keeps the host's own /tmp open under this number. */
inline constexpr int kHostTmpFd = 100;

/** First component below /tmp of a path, empty when it does not lie there. */
std::string tmp_entry(const std::string &path);
/**
 * Make an entry of the host's /tmp visible in the device's, which covers it: checkouts and test
 * directories often lie there. What the device has under that name already goes first.
 */
void show_tmp_entry(const std::string &device, int host_tmp, const std::string &name);
/** Remove the empty places where entries of the host's /tmp were shown. */
void forget_tmp_entries(const std::string &device);
/** A mount namespace of the device's own. False when this process may not make one. */
bool enter_own_namespace(const std::string &device);
/** Without a namespace the host's own path leads to the device; one device at a time. */
void map_apps_path(const std::string &device);
/** Take that away again; what leads elsewhere stays. */
void unmap_apps_path(const std::string &device);
/** What tells a process which device it runs on. */
void set_environment(const std::string &device);

#endif
