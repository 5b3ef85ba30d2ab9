#include "session_run.h"

#include <utility>

#include "json_ptr.h"
#include "json_read.h"
#include "platform_clock.h"
#include "status.h"
#include "text.h"

namespace quarn_client {

namespace {

constexpr std::int64_t kUsPerMs = 1000;

std::string packages_table(const BackupSet &set) {
  std::vector<std::vector<std::string>> rows;
  for (const SetPackage &package : set.packages) {
    rows.push_back({package.id, package.version, crc_text(package.crc)});
  }
  return table_text({"PACKAGE", "VERSION", "CRC"}, rows);
}

}  // namespace

void Session::last_time() {
  client_->call(
      "last_bu_time", nullptr, "(t)",
      [this](GVariant *value) {
        if (done_) return;
        guint64 ms = 0;
        g_variant_get(value, "(t)", &ms);
        const auto time = ms > INT64_MAX ? INT64_MAX : static_cast<std::int64_t>(ms);
        json_object_object_add(document_.get(), "time_ms", json_object_new_uint64(ms));
        json_add(document_.get(), "time", local_time(time));
        finish_with(QUARN_OK, command_.name, local_time(time));
      },
      [this](const BusFailure &failure) { fail(failure); });
}

void Session::fail_list(int result, const NoList &otherwise) {
  const char *const what = "getting the application list failed";
  if (list_client_ == QUARN_CLIENT_COMPANION) {
    return finish(exit_of(result), "making the archives failed: " + result_words(result) + "; is " +
                                       kPellixPackage + " installed?");
  }
  std::string error = std::string(what) + ": " + result_words(result);
  if (callback_ && result == QUARN_BAD_ARGUMENT) {
    error = "the cloud holds no application list yet, or it could not be fetched (" +
            std::to_string(result) + ")";
  }
  if (otherwise) return otherwise(error);
  finish_explained(exit_of(result), what, error);
}

void Session::tell_left_out(std::uint64_t entries) {
  json_object_object_add(document_.get(), "left_out",
                         json_object_new_int64(static_cast<std::int64_t>(entries)));
  screen_.error(std::to_string(entries) + " unreadable entries are left out");
}

void Session::fetch_list(std::function<void(const BackupSets &)> then, NoList otherwise) {
  on_answer_ = [this, then = std::move(then), otherwise = std::move(otherwise)] {
    if (!reply_ && !callback_) return;
    const int result = callback_ ? callback_->result : *reply_;
    if (result != QUARN_OK) return fail_list(result, otherwise);
    if (!reply_ || !callback_) return;
    std::string error;
    const auto sets = parse_backup_sets(callback_->text, error);
    if (!sets) return otherwise ? otherwise(error) : finish(EXIT_PROTOCOL, error);
    // The companion's list is of this device alone and does not name it.
    if (sets->left_out > 0 && list_client_ == QUARN_CLIENT_CLOUD) tell_left_out(sets->left_out);
    then(*sets);
  };
  call_for_result("get_app_list", g_variant_new("(iu)", list_client_, req_id_), [this](int result) {
    reply_ = result;
    answered();
  });
}

void Session::show_status() {
  client_->read_status(
      [this](GVariant *answer) {
        if (done_) return;
        const DaemonStatus status = read_status(answer);
        // Ages are told by the clock that the times are of: the device's.
        const std::int64_t now_ms =
            g_get_real_time() / kUsPerMs +
            (platform_clock_offset_ms == nullptr ? 0 : platform_clock_offset_ms());
        status_to_json(status, now_ms, document_.get());
        screen_.text(status_text(status, now_ms));
        // Without Wi-Fi the daemon would try for a minute to reach the cloud.
        if (!status.wifi.value_or(false)) {
          json_object_object_add(document_.get(), "packages", nullptr);
          screen_.line("packages          not known without Wi-Fi");
          return finish(QUARN_OK);
        }
        show_status_packages(status.serial);
      },
      [this](const BusFailure &failure) { fail(failure); });
}

void Session::show_status_packages(const std::string &serial) {
  fetch_list(
      [this, serial](const BackupSets &sets) {
        const BackupSet *set = find_set(sets, serial);
        BackupSets own;
        if (set != nullptr) own.sets.push_back(*set);
        const JsonPtr array(sets_to_json(own));
        json_object *packages = nullptr;
        if (set != nullptr) {
          json_object_object_get_ex(json_object_array_get_idx(array.get(), 0), "packages",
                                    &packages);
        }
        json_object_object_add(
            document_.get(), "packages",
            packages == nullptr ? json_object_new_array() : json_object_get(packages));
        screen_.line("packages          " +
                     std::to_string(set == nullptr ? 0 : set->packages.size()) +
                     " in the cloud's list");
        if (set != nullptr) screen_.text(packages_table(*set));
        finish(QUARN_OK);
      },
      [this](const std::string &error) {
        json_object_object_add(document_.get(), "packages", nullptr);
        screen_.line("packages          not known: " + printable(error));
        finish(QUARN_OK);
      });
}

void Session::show_list(const BackupSets &sets) {
  std::vector<std::vector<std::string>> rows;
  for (const BackupSet &set : sets.sets) {
    const std::string time = set.time_ms ? local_time(*set.time_ms) : "-";
    for (const SetPackage &package : set.packages) {
      rows.push_back({set.serial, package.id, package.version, crc_text(package.crc), time});
    }
  }
  json_object_object_add(document_.get(), "devices", sets_to_json(sets));
  screen_.text(table_text({"DEVICE", "PACKAGE", "VERSION", "CRC", "TIME"}, rows));
  finish(QUARN_OK);
}

void Session::show_sets(const BackupSets &sets) {
  std::vector<std::vector<std::string>> rows;
  for (const BackupSet &set : sets.sets) {
    rows.push_back({set.serial, set.model, set.time_ms ? local_time(*set.time_ms) : "-",
                    std::to_string(set.packages.size())});
  }
  json_object_object_add(document_.get(), "sets", sets_to_json(sets));
  screen_.text(table_text({"SERIAL", "MODEL", "TIME", "PACKAGES"}, rows));
  finish(QUARN_OK);
}

}  // namespace quarn_client
