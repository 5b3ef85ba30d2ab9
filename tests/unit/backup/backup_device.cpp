#include "backup_device.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <set>
#include <sstream>

#include "quarn_d_backup/archive_hold.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/package_lock.h"

using ::testing::_;

namespace {

std::mutex status_mutex;
std::vector<SentStatus> statuses;
std::function<void(int, int)> status_hook;

FakePackage *as_package(package_info_h info) { return reinterpret_cast<FakePackage *>(info); }

const char *op_name(Op op) {
  switch (op) {
    case Op::download:
      return "download ";
    case Op::upload:
      return "upload ";
    case Op::list:
      return "list ";
    default:
      return "delete ";
  }
}

int give_text(int result, bool null, const std::string &text, char **out) {
  if (result != 0) return result;
  *out = null ? nullptr : strdup(text.c_str());
  return 0;
}

}  // namespace

std::atomic<int> fake_wifi{1};

namespace {
std::atomic<int (*)()> wifi_hook{nullptr};
}

void set_wifi_hook(int (*hook)()) { wifi_hook = hook; }

int wifi_connected() {
  const auto hook = wifi_hook.load();
  return hook != nullptr ? hook() : fake_wifi.load();
}

std::ostream &operator<<(std::ostream &stream, const SentStatus &status) {
  return stream << "(" << status.err << ", " << status.status << ", " << status.req_id << ")";
}

std::vector<SentStatus> sent_statuses() {
  const std::lock_guard<std::mutex> lock(status_mutex);
  return statuses;
}

void clear_sent_statuses() {
  const std::lock_guard<std::mutex> lock(status_mutex);
  statuses.clear();
}

void set_status_hook(std::function<void(int, int)> hook) { status_hook = std::move(hook); }

client_cb_data *new_client(std::uint32_t req_id, const std::string &sender) {
  return new client_cb_data{req_id, sender};
}

/* The calls back to clients: no bus in these tests. */

int quarn_dbus_manual_backup_status(int err, int status, void *record) {
  if (status_hook) status_hook(err, status);
  auto *client = static_cast<client_cb_data *>(record);
  const std::lock_guard<std::mutex> lock(status_mutex);
  statuses.push_back({err, status, client->req_id});
  if (status != QUARN_BACKUP_RUNNING) delete client;
  return 0;
}

std::atomic<std::int64_t> time_waited_for_clients{0};
std::int64_t quarn_dbus_time_waited() { return time_waited_for_clients; }

/* ---- cloud ---- */

FakeCloud::FakeCloud() {
  ON_CALL(transport, backup_trans_download_file_ors_async)
      .WillByDefault([this](backup_trans_handle_h, const char *remote, const char *local,
                            void *user_data, backup_trans_download_cb callback, int options) {
        int result = 0;
        if (!accept(Op::download, remote, &result)) return result;
        download_options.push_back(options);
        const std::string from = remote;
        const std::string to = local;
        answer_later([this, from, to, user_data, callback] {
          int error = outcome(Op::download, from);
          if (error == 0 && objects.count(from) == 0) error = BACKUP_TRANS_ERROR_NO_SUCH_OBJECT;
          if (error == 0 && !lose_downloads) write_text(to, objects[from]);
          callback(static_cast<backup_trans_error_code>(error), user_data, nullptr);
        });
        return 0;
      });
  ON_CALL(transport, backup_trans_download_file_ors)
      .WillByDefault(
          [this](backup_trans_handle_h, const char *remote, const char *local, int options) {
            int result = 0;
            if (!accept(Op::download, remote, &result)) return result;
            download_options.push_back(options);
            const int error = outcome(Op::download, remote);
            if (error != 0) return error;
            if (objects.count(remote) == 0)
              return static_cast<int>(BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
            if (!lose_downloads) write_text(local, objects[remote]);
            last_download_local = local;
            return 0;
          });
  ON_CALL(transport, backup_trans_upload_file_ors_async)
      .WillByDefault([this](backup_trans_handle_h, const char *local, const char *remote,
                            backup_trans_upload_cb callback, std::int64_t, int, void *user_data,
                            const char *) {
        int result = 0;
        if (!accept(Op::upload, remote, &result)) return result;
        // an archive is named by the descriptor that holds it
        const bool held = std::string(local).rfind("/proc/self/fd/", 0) == 0;
        last_upload_local = held ? std::filesystem::read_symlink(local).string() : local;
        if (!exists(local)) return static_cast<int>(BACKUP_TRANS_ERROR_LOCAL_FILE);
        // the file is opened with the request
        const std::string content = read_text(local);
        const std::string to = remote;
        answer_later([this, to, content, user_data, callback] {
          const int error = outcome(Op::upload, to);
          if (error == 0) objects[to] = content;
          const backup_trans_file_info_s info = {to.c_str(), true, content.size(), 0};
          callback(static_cast<backup_trans_error_code>(error), user_data,
                   error == 0 ? &info : nullptr);
        });
        return 0;
      });
  ON_CALL(transport, backup_trans_get_folder_child_list_async)
      .WillByDefault([this](backup_trans_handle_h, const char *folder, int start, int count, int,
                            void *user_data, backup_trans_child_list_cb callback) {
        int result = 0;
        const std::string at = folder;
        if (!accept(Op::list, at + " " + std::to_string(start), &result)) return result;
        EXPECT_EQ(count, BACKUP_TRANS_MAX_LIST_COUNT);
        answer_later([this, at, start, user_data, callback] {
          const int error = outcome(Op::list, at);
          if (error != 0) {
            callback(static_cast<backup_trans_error_code>(error), user_data, nullptr);
            return;
          }
          std::list<std::string> paths;
          const auto all = children(at, &paths);
          const int total = static_cast<int>(all.size());
          const int end = std::min(total, start + page);
          const backup_trans_child_list_s list = {all.data() + start, end - start, end < total};
          callback(BACKUP_TRANS_ERROR_NONE, user_data, &list);
        });
        return 0;
      });
  ON_CALL(transport, backup_trans_delete_folder_ors_async)
      .WillByDefault([this](backup_trans_handle_h, const char *folder, void *user_data,
                            backup_trans_delete_cb callback) {
        int result = 0;
        if (!accept(Op::remove, folder, &result)) return result;
        const std::string at = folder;
        answer_later([this, at, user_data, callback] {
          const int error = outcome(Op::remove, at);
          for (auto object = objects.begin(); error == 0 && object != objects.end();) {
            object = object->first.compare(0, at.size() + 1, at + "/") == 0 ? objects.erase(object)
                                                                            : std::next(object);
          }
          const backup_trans_file_info_s info = {at.c_str(), false, 0, 0};
          callback(static_cast<backup_trans_error_code>(error), user_data, &info);
        });
        return 0;
      });
  ON_CALL(transport, backup_trans_cancel_request).WillByDefault([this](backup_trans_handle_h) {
    const std::lock_guard<std::recursive_mutex> lock(mutex_);
    ++cancels;
    if (aborts) aborted_ = answers_.size();
  });
}

bool FakeCloud::accept(Op op, const std::string &path, int *result) {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  requests_.push_back(op_name(op) + path);
  if (refuse) *result = refuse(op, path);
  return *result == 0;
}

int FakeCloud::outcome(Op op, const std::string &path) {
  if (aborting_) return BACKUP_TRANS_ERROR_CANCELLED;
  return fail ? fail(op, path) : 0;
}

void FakeCloud::answer_later(std::function<void()> answer) {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  answers_.push_back(std::move(answer));
}

bool FakeCloud::answer_next() {
  std::function<void()> answer;
  {
    const std::lock_guard<std::recursive_mutex> lock(mutex_);
    if (answers_.empty()) return false;
    answer = std::move(answers_.front());
    answers_.pop_front();
    aborting_ = aborted_ > 0;
    if (aborting_) --aborted_;
  }
  answer();
  aborting_ = false;
  return true;
}

void FakeCloud::answer_all() {
  while (answer_next()) {
  }
}

std::size_t FakeCloud::waiting() {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  return answers_.size();
}

std::vector<std::string> FakeCloud::requests() {
  const std::lock_guard<std::recursive_mutex> lock(mutex_);
  return requests_;
}

int FakeCloud::count_requests(const std::string &request) {
  const auto all = requests();
  return static_cast<int>(std::count(all.begin(), all.end(), request));
}

std::vector<std::string> FakeCloud::paths() {
  std::vector<std::string> all;
  for (const auto &object : objects) all.push_back(object.first);
  return all;
}

std::vector<backup_trans_file_info_s> FakeCloud::children(const std::string &folder,
                                                          std::list<std::string> *paths) {
  std::vector<backup_trans_file_info_s> result;
  for (const auto &object : objects) {
    if (object.first.compare(0, folder.size(), folder) != 0) continue;
    const std::size_t slash = object.first.find('/', folder.size());
    std::string child = object.first.substr(0, slash);
    if (!paths->empty() && paths->back() == child) continue;
    paths->push_back(std::move(child));
    const bool is_file = slash == std::string::npos;
    result.push_back({paths->back().c_str(), is_file, is_file ? object.second.size() : 0, 0});
  }
  return result;
}

/* ---- device ---- */

BackupDevice::BackupDevice() {
  std::filesystem::remove_all("/tmp/quarn");
  fake_wifi = 1;
  set_wifi_hook(nullptr);
  manual_backup_canceled = false;
  set_status_hook(nullptr);
  clear_sent_statuses();
  set_packing_ended_hook(note_packing_ended);
  script_packages();
  clear_captured_log();
}

BackupDevice::~BackupDevice() {
  set_backup_progress_sink(nullptr);
  await_no_archives();
  std::filesystem::remove_all("/tmp/quarn");
}

FakePackage &BackupDevice::install(const std::string &id, const std::string &version,
                                   const std::string &content) {
  packages_.emplace_back();
  FakePackage &package = packages_.back();
  package.id = id;
  package.version = version;
  package.type = "tpk";
  package.root = path(id);
  package.apps.push_back({id});
  for (const char *dir : {"/data", "/shared/data", "/shared/trusted"}) {
    std::filesystem::create_directories(package.root + dir);
  }
  write_text(package.root + "/data/file.txt", content);
  return package;
}

FakePackage &BackupDevice::package(const std::string &id) {
  for (auto &package : packages_) {
    if (package.id == id) return package;
  }
  ADD_FAILURE() << "no package " << id;
  return packages_.front();
}

void BackupDevice::remove(const std::string &id) {
  packages_.remove_if([&](const FakePackage &package) { return package.id == id; });
}

void BackupDevice::script_packages() {
  ON_CALL(platform_, package_manager_foreach_package_info)
      .WillByDefault([this](package_manager_package_info_cb callback, void *user_data) {
        for (auto &package : packages_) {
          if (!callback(reinterpret_cast<package_info_h>(&package), user_data)) break;
        }
        return package_walk_result_;
      });
  ON_CALL(platform_, package_info_is_preload_package)
      .WillByDefault([](package_info_h info, bool *preload) {
        *preload = as_package(info)->preload;
        return as_package(info)->preload_result;
      });
  ON_CALL(platform_, package_info_get_package).WillByDefault([](package_info_h info, char **text) {
    const FakePackage &p = *as_package(info);
    return give_text(p.id_result, p.null_id, p.id, text);
  });
  ON_CALL(platform_, package_info_get_version).WillByDefault([](package_info_h info, char **text) {
    const FakePackage &p = *as_package(info);
    return give_text(p.version_result, p.null_version, p.version, text);
  });
  ON_CALL(platform_, package_info_get_type).WillByDefault([](package_info_h info, char **text) {
    const FakePackage &p = *as_package(info);
    return give_text(p.type_result, p.null_type, p.type, text);
  });
  ON_CALL(platform_, package_info_get_root_path)
      .WillByDefault([](package_info_h info, char **text) {
        const FakePackage &p = *as_package(info);
        return give_text(p.root_result, p.null_root, p.root, text);
      });
  ON_CALL(platform_, package_info_foreach_app_from_package)
      .WillByDefault([](package_info_h info, package_info_app_component_type_e type,
                        package_info_app_cb callback, void *user_data) {
        EXPECT_EQ(type, PACKAGE_INFO_ALLAPP);
        FakePackage &package = *as_package(info);
        for (const auto &app : package.apps) {
          if (!callback(PACKAGE_INFO_UIAPP, app.id.c_str(), user_data)) break;
        }
        if (package.walk_results.empty()) return 0;
        const int result = package.walk_results.front();
        package.walk_results.pop_front();
        return result;
      });
  ON_CALL(platform_, pkgmgrinfo_pkginfo_get_pkginfo)
      .WillByDefault([this](const char *id, pkgmgrinfo_pkginfo_h *handle) {
        *handle = &package(id);
        return PMINFO_R_OK;
      });
  ON_CALL(platform_, pkgmgrinfo_pkginfo_get_installed_storage)
      .WillByDefault([](pkgmgrinfo_pkginfo_h handle, pkgmgrinfo_installed_storage *storage) {
        *storage = static_cast<FakePackage *>(handle)->external ? PMINFO_EXTERNAL_STORAGE
                                                                : PMINFO_INTERNAL_STORAGE;
        return PMINFO_R_OK;
      });
  ON_CALL(platform_, pkgmgrinfo_appinfo_get_appinfo)
      .WillByDefault([this](const char *id, pkgmgrinfo_appinfo_h *handle) {
        for (auto &package : packages_) {
          for (auto &app : package.apps) {
            if (app.id != id) continue;
            *handle = &app;
            return PMINFO_R_OK;
          }
        }
        return PMINFO_R_ENOENT;
      });
  ON_CALL(platform_, pkgmgrinfo_appinfo_get_api_version)
      .WillByDefault([](pkgmgrinfo_appinfo_h, char **version) {
        static char four[] = "4.0";
        *version = four;
        return PMINFO_R_OK;
      });
  ON_CALL(platform_, pkgmgrinfo_appinfo_get_metadata_value)
      .WillByDefault([](pkgmgrinfo_appinfo_h handle, const char *, char **value) {
        static char disable[] = "disable";
        if (!static_cast<FakeApp *>(handle)->disabled) return PMINFO_R_ENOENT;
        *value = disable;
        return PMINFO_R_OK;
      });
  ON_CALL(platform_, package_manager_get_package_info)
      .WillByDefault([this](const char *id, package_info_h *info) {
        for (auto &package : packages_) {
          if (package.id != id) continue;
          *info = reinterpret_cast<package_info_h>(&package);
          return 0;
        }
        return unknown_package_result_;
      });
  ON_CALL(platform_, vconf_set_int).WillByDefault([this](const char *key, int value) {
    if (!settings_work_) return VCONF_ERROR;
    settings_[key] = value;
    return VCONF_OK;
  });
  ON_CALL(platform_, vconf_get_int).WillByDefault([this](const char *key, int *value) {
    if (settings_.count(key) == 0) return VCONF_ERROR;
    *value = static_cast<int>(settings_[key]);
    return VCONF_OK;
  });
  ON_CALL(platform_, vconf_set_dbl).WillByDefault([this](const char *key, double value) {
    if (!settings_work_) return VCONF_ERROR;
    settings_[key] = value;
    return VCONF_OK;
  });
  ON_CALL(platform_, vconf_get_dbl).WillByDefault([this](const char *key, double *value) {
    if (settings_.count(key) == 0) return VCONF_ERROR;
    *value = settings_[key];
    return VCONF_OK;
  });
}

void write_sparse(const std::string &path, std::uint64_t size) {
  write_text(path, "");
  EXPECT_EQ(truncate(path.c_str(), static_cast<off_t>(size)), 0);
}

/* ---- lists ---- */

AppList::AppList(const std::string &text) : root_(json_tokener_parse(text.c_str())) {
  EXPECT_NE(root_, nullptr) << text;
}

std::size_t AppList::models() const {
  return json_object_array_length(json_object_object_get(root_, "model_list"));
}

json_object *AppList::model(std::size_t index) const {
  return json_object_array_get_idx(json_object_object_get(root_, "model_list"), index);
}

std::vector<std::string> AppList::packages(std::size_t index) const {
  std::vector<std::string> all;
  json_object *list = json_object_object_get(model(index), "pkg_list");
  for (std::size_t i = 0; i < json_object_array_length(list); ++i) {
    json_object *package = json_object_array_get_idx(list, i);
    all.push_back(std::string(json_object_get_string(json_object_object_get(package, "pkg_id"))) +
                  " " + json_object_get_string(json_object_object_get(package, "version")) + " " +
                  json_object_get_string(json_object_object_get(package, "crc")));
  }
  return all;
}

std::vector<std::string> AppList::package_ids(std::size_t index) const {
  std::vector<std::string> ids;
  for (const auto &package : packages(index)) ids.push_back(package.substr(0, package.find(' ')));
  return ids;
}

std::string AppList::info(std::size_t index, const char *key) const {
  json_object *info = json_object_object_get(model(index), "backup_info");
  const char *text = json_object_get_string(json_object_object_get(info, key));
  return text != nullptr ? text : "(none)";
}
