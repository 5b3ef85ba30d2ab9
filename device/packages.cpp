#include "state/packages.h"

#include <fcntl.h>
#include <json-c/json.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <memory>

#include "device.h"
#include "state/labels.h"
#include "state/printable.h"

namespace {

namespace fs = std::filesystem;

constexpr uid_t kAppUser = 5000;
constexpr gid_t kAppGroup = 5000;
constexpr mode_t kModeBits = 07777;
constexpr const char *kDataFolders[] = {"data", "shared/data", "shared/trusted"};

/** Owner, mode and label of an installed object; a link has no mode of its own. */
void dress(const fs::path &path, mode_t mode, bool link, const std::string &label) {
  if (lchown(path.c_str(), kAppUser, kAppGroup) != 0) {
    throw Failure("cannot give " + path.string() + " to the application: " + reason());
  }
  // After the owner: a change of owner takes set-id bits away.
  if (!link && chmod(path.c_str(), mode & kModeBits) != 0) {
    throw Failure("cannot set the mode of " + path.string() + ": " + reason());
  }
  if (embedded::write_label(path.c_str(), embedded::Links::kKeep, embedded::LabelKind::kAccess,
                            label) != 0 &&
      !link) {
    throw Failure("cannot label " + path.string() + ": " + reason());
  }
}

struct CopyRules {
  std::string label;
  bool keep_existing; /**< leave what is there: an application's data survives its update */
};

void copy_object(const fs::path &from, const fs::path &to, const CopyRules &rules) {
  struct stat source {};
  if (lstat(from.c_str(), &source) != 0) {
    throw Failure("cannot read " + from.string() + ": " + reason());
  }
  struct stat present {};
  const bool exists = lstat(to.c_str(), &present) == 0;
  if (S_ISDIR(source.st_mode)) {
    if (exists && !S_ISDIR(present.st_mode)) {
      if (rules.keep_existing) return;
      throw Failure(to.string() + " is in the way");
    }
    if (!exists && mkdir(to.c_str(), 0700) != 0 && !(rules.keep_existing && errno == EEXIST)) {
      throw Failure("cannot make " + to.string() + ": " + reason());
    }
    for (const fs::directory_entry &entry : fs::directory_iterator(from)) {
      copy_object(entry.path(), to / entry.path().filename(), rules);
    }
    if (!exists) dress(to, source.st_mode, false, rules.label);
    return;
  }
  if (exists && rules.keep_existing) return;
  const bool link = S_ISLNK(source.st_mode);
  if (!link && !S_ISREG(source.st_mode)) {
    throw Failure(from.string() + " is neither file, directory nor link");
  }
  std::error_code error;
  if (link) {
    fs::copy_symlink(from, to, error);
  } else {
    fs::copy_file(from, to, error);
  }
  // A restore may have put it there since the look.
  if (error == std::errc::file_exists && rules.keep_existing) return;
  if (error) throw Failure("cannot make " + to.string() + ": " + error.message());
  dress(to, source.st_mode, link, rules.label);
}

/** The folders above an application's data belong to it as well. */
void make_folder(const fs::path &path, const std::string &label) {
  constexpr mode_t kFolderMode = 0755;
  if (mkdir(path.c_str(), kFolderMode) == 0) {
    dress(path, kFolderMode, false, label);
  } else if (errno == EEXIST) {
    // The folder above is the application's: what it has put there may be a link to anywhere.
    struct stat present {};
    if (lstat(path.c_str(), &present) != 0 || !S_ISDIR(present.st_mode)) {
      throw Failure(path.string() + " is no directory");
    }
  } else {
    throw Failure("cannot make " + path.string() + ": " + reason());
  }
}

void copy_tree(const fs::path &source, const fs::path &root, const embedded::Package &package,
               bool update) {
  make_folder(root, package.id);
  make_folder(root / "shared", package.id);
  for (const char *folder : kDataFolders) {
    make_folder(root / folder, package.id);
    if (!fs::is_directory(source / folder)) continue;
    struct stat status {};
    stat((source / folder).c_str(), &status);
    for (const fs::directory_entry &entry : fs::directory_iterator(source / folder)) {
      copy_object(entry.path(), root / folder / entry.path().filename(), {package.id, update});
    }
    if (!update) dress(root / folder, status.st_mode, false, package.id);
  }
  fs::remove_all(root / "res");
  if (fs::is_directory(source / "res")) {
    copy_object(source / "res", root / "res", {package.id, false});
  }
}

void send_event(const std::string &device, const embedded::Package &package, const char *action,
                const char *state) {
  embedded::PackageEvent event;
  event.package = package.id;
  event.type = package.type;
  event.action = action;
  event.state = state;
  if (!embedded::add_event(device, event)) throw Failure("cannot send the event: " + reason());
}

fs::path outside_root(const std::string &device, const std::string &id) {
  return fs::path(device) / "root/opt/usr/apps" / id;
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

/** Where a package goes at once, whoever still works in it; empty again when its removal ends. */
fs::path removed_folder(const std::string &device) {
  return fs::path(device) / "root/opt/usr/.removed";
}

/** Delete what was removed, also by a removal that was killed. Others may still write below it. */
void empty_removed_folder(const std::string &device) {
  constexpr int kTries = 1000;
  std::error_code error;
  for (int i = 0; i < kTries; ++i) {
    fs::remove_all(removed_folder(device), error);
    if (!error) return;
  }
  throw Failure("cannot remove the package's files: " + error.message());
}

/** Take a package's files away in one step. */
void take_away(const std::string &device, const std::string &id) {
  empty_removed_folder(device);
  const fs::path folder = removed_folder(device);
  constexpr mode_t kPrivateFolder = 0700;
  if (mkdir(folder.c_str(), kPrivateFolder) != 0) {
    throw Failure("cannot make " + folder.string() + ": " + reason());
  }
  if (rename(outside_root(device, id).c_str(), (folder / id).c_str()) != 0 && errno != ENOENT) {
    throw Failure("cannot remove the package's files: " + reason());
  }
  empty_removed_folder(device);
}

/** The same after another failure, which is the one to tell. */
void take_away_quietly(const std::string &device, const std::string &id) {
  try {
    take_away(device, id);
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
  const fs::path root = outside_root(device, package.id);
  try {
    // What an installation or a removal that was killed has left is nobody's.
    if (!update) take_away(device, package.id);
    copy_tree(arguments[1], root, package, update);
    if (!embedded::put_package(device, package)) {
      throw Failure("cannot record the package: " + reason());
    }
  } catch (...) {
    if (!update) take_away_quietly(device, package.id);
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
  take_away(device, package.id);
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
