#include "session_run.h"

#include <algorithm>

#include "json_ptr.h"
#include "json_read.h"
#include "text.h"

namespace quarn_client {

void Session::restore_on(const BackupSets &sets) {
  const BackupSet *set = find_set(sets, command_.serial);
  if (set == nullptr) {
    return finish(QUARN_BAD_ARGUMENT, "the cloud holds no backup of a device " + command_.serial +
                                          "; quarnctl sets shows the devices");
  }
  set_ = *set;
  std::vector<std::string> wanted = command_.packages;
  if (wanted.empty()) {
    for (const SetPackage &package : set_.packages) wanted.push_back(package.id);
  }
  for (const std::string &package : wanted) {
    if (find_package(set_, package) == nullptr) {
      return finish(QUARN_BAD_ARGUMENT,
                    "the backup of " + set_.serial + " holds no package " + package);
    }
    expect(package);
  }
  if (expected_.empty()) {
    return finish(QUARN_BAD_ARGUMENT, "the backup of " + set_.serial + " holds no packages");
  }
  switch_restore_on(QUARN_CLIENT_CLOUD);
}

void Session::restore_transferred() {
  set_.serial = command_.serial;
  for (const std::string &package : command_.packages) expect(package);
  switch_restore_on(QUARN_CLIENT_COMPANION);
}

void Session::expect(const std::string &package) {
  if (std::find(expected_.begin(), expected_.end(), package) == expected_.end()) {
    expected_.push_back(package);
  }
}

void Session::switch_restore_on(quarn_client_kind client) {
  const JsonPtr list(json_object_new_array());
  for (const std::string &package : expected_) {
    json_object_array_add(
        list.get(), json_object_new_string_len(package.data(), static_cast<int>(package.size())));
  }
  json_add(document_.get(), "serial", set_.serial);
  json_object_object_add(document_.get(), "expected", json_object_get(list.get()));
  reply_.reset();
  callback_.reset();
  on_answer_ = nullptr;
  board_ = ProgressBoard(expected_.size());
  call_for_result("restore_enable",
                  g_variant_new("(iissu)", kOn, client, set_.serial.c_str(),
                                json_text(list.get()).c_str(), req_id_),
                  [this](int result) {
                    if (result != QUARN_OK) return finish_with(result, "restore on", "");
                    const std::string on =
                        "restore mode is on for " + std::to_string(expected_.size()) + " packages" +
                        (command_.transfer ? std::string(" in the companion's directory")
                                           : " of " + printable(set_.serial));
                    if (!command_.watch) return finish_with(QUARN_OK, "", on);
                    screen_.line(on);
                    watch();
                  });
}

void Session::show_transfer() {
  const JsonPtr root = json_parse(callback_->text);
  json_object *models = json_member(root.get(), "model_list", json_type_array);
  json_object *own =
      json_object_array_length(models) == 0 ? nullptr : json_object_array_get_idx(models, 0);
  json_object *archives = json_member(own, "app_data_path", json_type_array);
  const std::size_t count = archives == nullptr ? 0 : json_object_array_length(archives);
  json_object *paths = json_object_new_array();
  for (std::size_t i = 0; i < count; ++i) {
    json_object *path = json_object_array_get_idx(archives, i);
    if (!json_object_is_type(path, json_type_string)) continue;
    json_object_array_add(paths, json_object_get(path));
    screen_.line(printable(json_object_get_string(path)));
  }
  json_object_object_add(document_.get(), "archives", paths);
  finish(QUARN_OK);
}

void Session::restore_off() {
  call_for_result(
      "restore_enable", g_variant_new("(iissu)", kOff, QUARN_CLIENT_CLOUD, "", "[]", req_id_),
      [this](int result) { finish_with(result, "restore off", "restore mode is off"); });
}

}  // namespace quarn_client
