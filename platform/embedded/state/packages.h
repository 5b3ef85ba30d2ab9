/**
 * @file packages.h
 * @brief An embedded device's package database and its events.
 *
 * packages/PKGID.ini is the manifest of one installed package, apps/APPID a
 * link to the manifest of the package that the application belongs to, and
 * events.ini the last events of installations. Any thread.
 */
#ifndef QUARN_EMBEDDED_PACKAGES_H
#define QUARN_EMBEDDED_PACKAGES_H

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "state/state_file.h"

namespace embedded {

inline constexpr char kEventsFile[] = "events.ini";

struct Application {
  std::string id;
  std::string api_version; /**< empty when the manifest has none */
  std::map<std::string, std::string> metadata;
};

struct Package {
  std::string id;
  std::string version;
  std::string type;
  bool preload = false;
  bool external = false;
  bool hidden = false;
  std::vector<Application> applications; /**< in the order of the manifest */
};

/** Where the package's root is for those inside the device. */
std::string package_root(const std::string &id);

/** True for a text that may be a package or application id, or a version: one plain name. */
bool is_plain_name(const std::string &text);

/** Read a manifest; on failure @p error tells what is wrong with it. */
bool parse_package(GKeyFile *manifest, Package *package, std::string *error);

/** Look a package up; false when it is not installed. */
bool get_package(const std::string &device, const std::string &id, Package *package);

/** The ids of all packages in the order of their bytes; false when they cannot be read. */
bool list_packages(const std::string &device, std::vector<std::string> *ids);

/** Look the package of an application up; false when there is none. */
bool get_package_of_app(const std::string &device, const std::string &app_id, Package *package);

/** Record a package, new or another version of an installed one. */
bool put_package(const std::string &device, const Package &package);

/** Forget a package. */
bool drop_package(const std::string &device, const std::string &id);

/** Hide or show a package's icons; false when it is not installed. */
bool set_hidden(const std::string &device, const std::string &id, bool hidden);

struct PackageEvent {
  std::int64_t number = 0; /**< grows by one with each event of the device */
  std::string package;
  std::string type;   /**< package type, "tpk" */
  std::string action; /**< install, update, uninstall */
  std::string state;  /**< started, completed, failed */
};

inline constexpr char kActionInstall[] = "install";
inline constexpr char kActionUpdate[] = "update";
inline constexpr char kActionUninstall[] = "uninstall";
inline constexpr char kStateStarted[] = "started";
inline constexpr char kStateCompleted[] = "completed";
inline constexpr char kStateFailed[] = "failed";

/** Append an event, whose own number is ignored; the oldest of more than 1024 is dropped. */
bool add_event(const std::string &device, const PackageEvent &event);

/** The number that the next event will have. */
std::int64_t next_event(const std::string &device);

/** The events from number @p first on. */
std::vector<PackageEvent> events_from(const std::string &device, std::int64_t first);

}  // namespace embedded

#endif
