#include "state/packages.h"

#include <fcntl.h>
#include <json-c/json.h>
#include <sys/file.h>
#include <unistd.h>

#include <cstdio>
#include <memory>

#include "device.h"
#include "installer.h"
#include "state/printable.h"

namespace {

void send_event(const std::string &device, const embedded::Package &package, const char *action,
                const char *state) {
  embedded::PackageEvent event;
  event.package = package.id;
  event.type = package.type;
  event.action = action;
  event.state = state;
  if (!embedded::add_event(device, event)) throw Failure("cannot send the event: " + reason());
}

/** One installation, update or removal at a time, as a device has one installer. */
class InstallerLock {
 public:
  explicit InstallerLock(const std::string &device)
      : lock_(open(embedded::state_path(device, ".installer").c_str(), O_RDWR | O_CREAT | O_CLOEXEC,
                   kLockMode)) {
    if (lock_.fd < 0 || TEMP_FAILURE_RETRY(flock(lock_.fd, LOCK_EX)) != 0) {
      throw Failure("cannot lock the installer: " + reason());
    }
  }

 private:
  static constexpr mode_t kLockMode = 0600;
  Fd lock_;
};

/** After another failure, which is the one to tell. */
void remove_quietly(Installer *installer, const std::string &id) {
  try {
    installer->remove(id);
  } catch (const Failure &) {
  }
}

/** Applications are looked up by id: two packages cannot share one. */
void check_applications(const std::string &device, const embedded::Package &package) {
  for (const embedded::Application &application : package.applications) {
    embedded::Package owner;
    if (embedded::get_package_of_app(device, application.id, &owner) && owner.id != package.id) {
      throw Failure("application \"" + application.id + "\" belongs to " + owner.id);
    }
  }
}

struct JsonRelease {
  void operator()(json_object *object) const { json_object_put(object); }
};

json_object *package_json(const embedded::Package &package) {
  json_object *object = json_object_new_object();
  const auto put = [object](const char *key, const std::string &text) {
    json_object_object_add(object, key, json_object_new_string(text.c_str()));
  };
  put("id", package.id);
  put("version", package.version);
  put("type", package.type);
  json_object_object_add(object, "preload", json_object_new_boolean(package.preload ? 1 : 0));
  put("storage", package.external ? "external" : "internal");
  put("root", embedded::package_root(package.id));
  json_object_object_add(object, "hidden", json_object_new_boolean(package.hidden ? 1 : 0));
  return object;
}

}  // namespace

int verb_install(const Arguments &arguments) {
  if (arguments.size() != 2) wrong_use();
  const std::string device = open_device(arguments[0]);
  const std::string ini = arguments[1] + "/package.ini";
  const embedded::KeyFilePtr manifest(g_key_file_new());
  GError *error = nullptr;
  if (!g_key_file_load_from_file(manifest.get(), ini.c_str(), G_KEY_FILE_NONE, &error)) {
    const std::string text = error->message;
    g_error_free(error);
    throw Failure(ini + ": " + text);
  }
  embedded::Package package;
  std::string problem;
  if (!embedded::parse_package(manifest.get(), &package, &problem)) {
    throw Failure(ini + ": " + problem);
  }
  const InstallerLock lock(device);
  check_applications(device, package);
  embedded::Package before;
  const bool update = embedded::get_package(device, package.id, &before);
  package.hidden = update && before.hidden;
  const char *action = update ? embedded::kActionUpdate : embedded::kActionInstall;
  send_event(device, package, action, embedded::kStateStarted);
  try {
    Installer installer(device);
    if (update) {
      installer.update(arguments[1], package.id);
    } else {
      installer.install(arguments[1], package.id);
    }
    if (!embedded::put_package(device, package)) {
      const std::string text = "cannot record the package: " + reason();
      if (!update) remove_quietly(&installer, package.id);
      throw Failure(text);
    }
  } catch (...) {
    send_event(device, package, action, embedded::kStateFailed);
    throw;
  }
  send_event(device, package, action, embedded::kStateCompleted);
  return DEVICE_OK;
}

int verb_remove(const Arguments &arguments) {
  if (arguments.size() != 2) wrong_use();
  const std::string device = open_device(arguments[0]);
  const InstallerLock lock(device);
  embedded::Package package;
  if (!embedded::get_package(device, arguments[1], &package)) {
    throw Failure("no package \"" + arguments[1] + "\"");
  }
  send_event(device, package, embedded::kActionUninstall, embedded::kStateStarted);
  if (!embedded::drop_package(device, package.id)) {
    throw Failure("cannot forget the package: " + reason());
  }
  Installer(device).remove(package.id);
  send_event(device, package, embedded::kActionUninstall, embedded::kStateCompleted);
  return DEVICE_OK;
}

int verb_list(const Arguments &arguments) {
  const bool json = arguments.size() == 2 && arguments[1] == "--json";
  if (arguments.empty() || (arguments.size() != 1 && !json)) wrong_use();
  const std::string device = open_device(arguments[0]);
  std::vector<std::string> ids;
  if (!embedded::list_packages(device, &ids)) throw Failure("cannot read the packages");
  const std::unique_ptr<json_object, JsonRelease> array(json_object_new_array());
  for (const std::string &id : ids) {
    embedded::Package package;
    if (!embedded::get_package(device, id, &package)) continue;
    if (json) {
      json_object_array_add(array.get(), package_json(package));
      continue;
    }
    std::printf("%-32s %-10s %-4s%s%s%s\n", embedded::printable(package.id).c_str(),
                embedded::printable(package.version).c_str(),
                embedded::printable(package.type).c_str(), package.preload ? " preloaded" : "",
                package.external ? " external" : "", package.hidden ? " hidden" : "");
  }
  if (json) {
    std::puts(json_object_to_json_string_ext(array.get(), JSON_C_TO_STRING_PLAIN));
  }
  return DEVICE_OK;
}
