#include "session.h"

#include <glib-unix.h>

#include <algorithm>
#include <cmath>
#include <csignal>
#include <optional>
#include <set>
#include <utility>

#include "backup_sets.h"
#include "bus_client.h"
#include "clean_up.h"
#include "files/package_files.h"
#include "json_read.h"
#include "platform_clock.h"
#include "progress.h"
#include "quarn_common.h"
#include "quarn_handles.h"
#include "screen.h"
#include "status.h"
#include "text.h"

namespace quarn_client {

namespace {

constexpr int kMsPerSecond = 1000;
constexpr std::int64_t kUsPerMs = 1000;
constexpr guint kGraceMs = 2000;
constexpr int kCloudClient = 0;
constexpr int kCompanionClient = 1;
constexpr int kOn = 1;
constexpr int kOff = 0;
constexpr char kRestoreStop[] = "restore_stop";
constexpr char kBackupKind[] = "backup";
constexpr char kRestoreKind[] = "restore";
constexpr char kRestoredOutcome[] = "restored";

/** A result code as an exit code; one that is not known counts as a failure of no special kind. */
int exit_of(int result) {
  return result >= QUARN_OK && result <= QUARN_FAILED ? result : QUARN_FAILED;
}

std::string result_words(int result) {
  return std::string(quarn_result_text(result)) + " (" + std::to_string(result) + ")";
}

std::string seconds_words(double seconds) {
  char buffer[G_ASCII_DTOSTR_BUF_SIZE];
  return std::string(g_ascii_formatd(buffer, sizeof buffer, "%g", seconds)) + " seconds";
}

std::string packages_table(const BackupSet &set) {
  std::vector<std::vector<std::string>> rows;
  for (const SetPackage &package : set.packages) {
    rows.push_back({package.id, package.version, crc_text(package.crc)});
  }
  return table_text({"PACKAGE", "VERSION", "CRC"}, rows);
}

/** Results that the cloud may have had its part in. */
bool of_the_cloud(int result) {
  return result == QUARN_TRANSFER_FAILED || result == QUARN_LIST_CHECK_FAILED ||
         result == QUARN_FAILED;
}

class Session {
 public:
  explicit Session(const Command &command);
  int run();

 private:
  /** What an answer of the daemon leads to. */
  using Then = std::function<void(int result)>;

  void begin();
  void call_for_result(const char *method, GVariant *arguments, Then then);
  void switch_state(const char *method, int on, const char *done);
  void last_time();
  void backup();
  void preview_backup(const std::set<std::string> &kept);
  void preview_failed(int result);
  void preview_set(const std::string &text);
  void confirm_removal(const BackupSet &set, const std::vector<std::string> &removed);
  void start_backup();
  void cancel();
  void app_request(const char *method, const char *what, const char *done);
  void app_export();
  /** @param otherwise what a list that cannot be had leads to; by default the end */
  void fetch_list(std::function<void(const BackupSets &)> then,
                  std::function<void(const std::string &error)> otherwise = nullptr);
  void show_status();
  void show_status_packages(const std::string &serial);
  void show_list(const BackupSets &sets);
  void show_sets(const BackupSets &sets);
  void restore_on(const BackupSets &sets);
  void restore_transferred();
  void expect(const std::string &package);
  void switch_restore_on(int client);
  void show_transfer();
  void restore_off();

  void answered();
  void take_callback(const Callback &callback);
  void take_status(const Callback &callback);
  void take_progress(const std::string &text);
  void take_notices(const ProgressEvent &event);
  bool concerns_us(const ProgressEvent &event) const;
  void daemon_ended();
  void fail(const BusFailure &failure);

  void watch();
  void check_watch();
  bool all_told() const;
  void end_watch(bool mode_ended);
  int watched_result() const;
  bool has_archive(const std::string &package) const;

  /** An interrupt withdraws the request and waits for its end. */
  bool can_be_withdrawn() const;
  void interrupt();
  void time_out();
  void arm_timer();
  void disarm_timer();

  void show_outcomes();
  void finish(int code, const std::string &error = "");
  void finish_with(int result, const std::string &what, const std::string &done);
  /** A failure in which the cloud may have had its part: the daemon is asked for it first. */
  void finish_explained(int code, const std::string &what, const std::string &error);
  void finish_for(const std::string &problem, int code, const std::string &what,
                  const std::string &error);
  void tell_of_list();

  static gboolean on_interrupt(gpointer user_data);
  static gboolean on_timeout(gpointer user_data);
  static gboolean on_grace_end(gpointer user_data);

  const Command &command_;
  Screen screen_;
  GMainLoopPtr loop_;
  std::unique_ptr<BusClient> client_;
  ProgressBoard board_;
  JsonPtr document_;
  BackupSet set_; /**< restore on: the chosen set */
  int list_client_ = kCloudClient;
  std::vector<std::string> expected_;
  std::function<void()> on_answer_; /**< called whenever reply_ or callback_ has changed */
  std::optional<int> reply_;
  std::optional<Callback> callback_;
  std::uint32_t req_id_;
  Question question_;
  std::set<std::string> kept_; /**< backup: what it leaves in the cloud */
  bool previewing_ = false;    /**< backup: it is looked what it would remove */
  std::string cause_;          /**< what the run failed of, as its last signal told */
  std::optional<bool> list_written_;
  bool called_ = false;
  bool cancelling_ = false;
  bool watching_ = false;
  bool reported_ = false; /**< a progress signal of ours has come */
  bool done_ = false;
  bool explaining_ = false;  // failed; the daemon is asked what the cloud's part in it was
  bool at_once_ = false;
  int exit_ = QUARN_FAILED;
  guint timer_ = 0;
  guint grace_ = 0; /**< every package is done, and the daemon's last message is still to come */
};

Session::Session(const Command &command)
    : command_(command),
      screen_(command.json),
      loop_(g_main_loop_new(nullptr, FALSE)),
      document_(json_object_new_object()),
      req_id_(random_request_id()) {
  json_add(document_.get(), "verb", command.name);
}

int Session::run() {
  const guint sources[] = {g_unix_signal_add(SIGINT, on_interrupt, this),
                           g_unix_signal_add(SIGTERM, on_interrupt, this),
                           g_unix_signal_add(SIGHUP, on_interrupt, this)};
  arm_timer();
  client_ = std::make_unique<BusClient>(BusClient::Events{
      [this] { begin(); }, [this](const Callback &callback) { take_callback(callback); },
      [this](const std::string &text) { take_progress(text); }, [this] { daemon_ended(); },
      [this](const BusFailure &failure) { fail(failure); }});
  client_->connect();
  if (!done_) g_main_loop_run(loop_.get());
  if (!at_once_) client_->flush();
  disarm_timer();
  if (grace_ != 0) g_source_remove(grace_);
  for (const guint source : sources) g_source_remove(source);
  client_.reset();
  // What was in flight ends with its cancellation, which the loop has to deliver.
  while (g_main_context_iteration(nullptr, FALSE) != FALSE) {
  }
  return exit_;
}

void Session::begin() {
  if (done_) return;
  called_ = true;
  switch (command_.verb) {
    case Verb::status:
      return show_status();
    case Verb::activate:
      return switch_state("set_activation", kOn, "the daemon is active");
    case Verb::deactivate:
      return switch_state("set_activation", kOff, "the daemon ends when it is idle");
    case Verb::auto_backup:
      return switch_state(
          "backup_enable", command_.switch_on ? kOn : kOff,
          command_.switch_on ? "automatic backup is on" : "automatic backup is off");
    case Verb::last_time:
      return last_time();
    case Verb::backup:
      return backup();
    case Verb::cancel:
      return cancel();
    case Verb::list:
      return fetch_list([this](const BackupSets &sets) { show_list(sets); });
    case Verb::sets:
      return fetch_list([this](const BackupSets &sets) { show_sets(sets); });
    case Verb::app_backup:
      return app_request("app_data_backup_start", "backup", "was backed up");
    case Verb::app_restore:
      return app_request("app_data_restore_start", "restore", "was restored");
    case Verb::app_export:
      return app_export();
    case Verb::transfer_list:
      list_client_ = kCompanionClient;
      return fetch_list([this](const BackupSets &) { show_transfer(); });
    case Verb::restore_on:
      if (command_.transfer) return restore_transferred();
      return fetch_list([this](const BackupSets &sets) { restore_on(sets); });
    case Verb::restore_off:
      return restore_off();
    case Verb::help:
    case Verb::version:
    case Verb::rules_check:
    case Verb::rules_explain:
      break;
  }
  finish(EXIT_USAGE, "nothing to do");
}

void Session::call_for_result(const char *method, GVariant *arguments, Then then) {
  client_->call(
      method, arguments, "(i)",
      [this, then = std::move(then)](GVariant *value) {
        if (done_) return;
        gint32 result = QUARN_FAILED;
        g_variant_get(value, "(i)", &result);
        then(result);
      },
      [this](const BusFailure &failure) { fail(failure); });
}

void Session::switch_state(const char *method, int on, const char *done) {
  call_for_result(method, g_variant_new("(i)", on),
                  [this, done](int result) { finish_with(result, command_.name, done); });
}

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

void Session::backup() {
  if (command_.yes) return start_backup();
  previewing_ = true;
  // A daemon that cannot tell is not asked further: the backup finds out as well what is wrong.
  client_->read_kept_packages(
      [this](GVariant *answer) {
        if (done_ || !previewing_) return;
        const auto kept = read_kept_packages(answer);
        if (!kept) return start_backup();
        preview_backup(*kept);
      },
      [this](const BusFailure &) { start_backup(); });
}

void Session::preview_backup(const std::set<std::string> &kept) {
  kept_ = kept;
  client_->read_status(
      [this](GVariant *answer) {
        if (done_ || !previewing_) return;
        const DaemonStatus status = read_status(answer);
        if (!status.wifi.value_or(false) || status.serial.empty()) return start_backup();
        set_.serial = status.serial;
        on_answer_ = [this] {
          if (!callback_) return;
          if (callback_->result != QUARN_OK) return preview_failed(callback_->result);
          preview_set(callback_->text);
        };
        // A cloud that cannot be reached is tried for two minutes.
        screen_.bar(stage_text("backup", "checking"));
        client_->call(
            "get_app_list", g_variant_new("(iu)", kCloudClient, req_id_), "(i)", [](GVariant *) {},
            [this](const BusFailure &) { start_backup(); });
      },
      [this](const BusFailure &) { start_backup(); });
}

void Session::preview_failed(int result) {
  if (result == QUARN_NO_SESSION) return finish_with(result, "backup", "");
  client_->read_status(
      [this](GVariant *answer) {
        if (done_ || !previewing_) return;
        const std::string problem = read_status(answer).cloud_problem;
        // The cloud holds no list yet: there is nothing to remove.
        if (problem.empty()) return start_backup();
        // The backup would end so as well, after having tried as long again.
        finish_for(problem, QUARN_LIST_CHECK_FAILED, "backup failed",
                   "backup failed: " + result_words(QUARN_LIST_CHECK_FAILED));
      },
      [this](const BusFailure &) { start_backup(); });
}

void Session::preview_set(const std::string &text) {
  std::string error;
  const auto sets = parse_backup_sets(text, error);
  const BackupSet *own = sets ? find_set(*sets, set_.serial) : nullptr;
  if (own == nullptr) return start_backup();
  const std::vector<std::string> removed = packages_to_remove(*own, kept_);
  if (removed.empty()) return start_backup();
  confirm_removal(*own, removed);
}

void Session::confirm_removal(const BackupSet &set, const std::vector<std::string> &removed) {
  json_object *names = json_object_new_array();
  for (const std::string &package : removed) {
    json_object_array_add(names, json_object_new_string(package.c_str()));
  }
  json_object_object_add(document_.get(), "would_remove", names);
  const std::string what = std::to_string(removed.size()) +
                           (removed.size() == 1 ? " package that is" : " packages that are") +
                           " not installed from the cloud: " + packages_text(removed);
  if (command_.json || !Question::possible()) {
    return finish(EXIT_UNCONFIRMED,
                  "the backup would remove " + what +
                      "; quarnctl backup --yes does, quarnctl restore on --from " + set.serial +
                      " gets them back as they are installed");
  }
  on_answer_ = nullptr;
  screen_.line("the backup would remove " + printable(what));
  question_.ask("back up and remove? [y/N] ", [this](bool yes) {
    if (done_ || !previewing_) return;
    if (yes) return start_backup();
    finish(EXIT_UNCONFIRMED, "not confirmed; nothing was backed up");
  });
}

void Session::start_backup() {
  if (done_ || (!previewing_ && !command_.yes)) return;
  previewing_ = false;
  // Whatever is still on its way belongs to the preview.
  req_id_ = random_request_id();
  callback_.reset();
  json_object_object_del(document_.get(), "would_remove");
  on_answer_ = [this] {
    // The final state may overtake the reply; the daemon is not left before it has given both.
    if (!reply_) return;
    if (*reply_ != QUARN_OK && !callback_) return finish_with(*reply_, "backup", "");
    if (!callback_) return;
    switch (callback_->status) {
      case QUARN_BACKUP_SUCCEEDED:
        return finish_with(QUARN_OK, "backup", "backup succeeded");
      case QUARN_BACKUP_CANCELLED:
        show_outcomes();
        return finish(QUARN_CANCELLED,
                      "backup cancelled (" + std::to_string(QUARN_CANCELLED) + ")");
      default:
        return finish_with(callback_->result == QUARN_OK ? QUARN_FAILED : callback_->result,
                           "backup", "");
    }
  };
  call_for_result("manual_backup_start", g_variant_new("(u)", req_id_), [this](int result) {
    reply_ = result;
    answered();
  });
}

void Session::cancel() {
  on_answer_ = [this] {
    if (!reply_) return;
    if (*reply_ != QUARN_OK || callback_) {
      finish_with(*reply_ != QUARN_OK ? *reply_ : callback_->result, "cancel",
                  "the daemon has taken the cancellation");
    }
  };
  call_for_result("manual_backup_cancel", g_variant_new("(u)", req_id_), [this](int result) {
    reply_ = result;
    answered();
  });
}

void Session::app_request(const char *method, const char *what, const char *done) {
  const std::string &package = command_.packages[0];
  json_add(document_.get(), "package", package);
  on_answer_ = [this, what, done, package] {
    if (!reply_ || (*reply_ == QUARN_OK && !callback_)) return;
    const int result = callback_ ? callback_->result : *reply_;
    finish_with(result, std::string(what) + " of " + package, package + " " + done);
  };
  call_for_result(method, g_variant_new("(su)", package.c_str(), req_id_), [this](int result) {
    reply_ = result;
    answered();
  });
}

void Session::app_export() {
  const std::string &package = command_.packages[0];
  call_for_result("make_app_data", g_variant_new("(s)", package.c_str()), [this](int result) {
    const std::string &name = command_.packages[0];
    const std::string path = exported_archive(name);
    json_add(document_.get(), "package", name);
    if (result == QUARN_OK) json_add(document_.get(), "path", path);
    finish_with(result, "export of " + name, path);
  });
}

void Session::fetch_list(std::function<void(const BackupSets &)> then,
                         std::function<void(const std::string &error)> otherwise) {
  on_answer_ = [this, then = std::move(then), otherwise = std::move(otherwise)] {
    if (!reply_ && !callback_) return;
    const int result = callback_ ? callback_->result : *reply_;
    if (result != QUARN_OK) {
      std::string error = "getting the application list failed: " + result_words(result);
      if (callback_ && result == QUARN_BAD_ARGUMENT) {
        error = "the cloud holds no application list yet, or it could not be fetched (" +
                std::to_string(result) + ")";
      }
      if (list_client_ == kCompanionClient) {
        error = "making the archives failed: " + result_words(result) + "; is " + kPellixPackage +
                " installed?";
        return finish(exit_of(result), error);
      }
      return otherwise
                 ? otherwise(error)
                 : finish_explained(exit_of(result), "getting the application list failed", error);
    }
    if (!reply_ || !callback_) return;
    std::string error;
    const auto sets = parse_backup_sets(callback_->text, error);
    if (!sets) return otherwise ? otherwise(error) : finish(EXIT_PROTOCOL, error);
    // The companion's list is of this device alone and does not name it.
    if (sets->left_out > 0 && list_client_ == kCloudClient) {
      json_object_object_add(document_.get(), "left_out",
                             json_object_new_int64(static_cast<std::int64_t>(sets->left_out)));
      screen_.error(std::to_string(sets->left_out) + " unreadable entries are left out");
    }
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
  switch_restore_on(kCloudClient);
}

void Session::restore_transferred() {
  set_.serial = command_.serial;
  for (const std::string &package : command_.packages) expect(package);
  switch_restore_on(kCompanionClient);
}

void Session::expect(const std::string &package) {
  if (std::find(expected_.begin(), expected_.end(), package) == expected_.end()) {
    expected_.push_back(package);
  }
}

void Session::switch_restore_on(int client) {
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
      "restore_enable", g_variant_new("(iissu)", kOff, kCloudClient, "", "[]", req_id_),
      [this](int result) { finish_with(result, "restore off", "restore mode is off"); });
}

void Session::answered() {
  // A copy: what it does may put another function in its place.
  const auto on_answer = on_answer_;
  if (on_answer) on_answer();
}

void Session::take_callback(const Callback &callback) {
  if (done_ || callback.req_id != req_id_) return;
  switch (callback.kind) {
    case Callback::Kind::backup_status:
      return take_status(callback);
    case Callback::Kind::restore_enable:
      if (command_.verb != Verb::restore_on || !command_.watch) return;
      if (callback.text == kRestoreStop) return end_watch(true);
      return screen_.line(printable(callback.text) + ": " + result_words(callback.result));
    default:
      callback_ = callback;
      answered();
  }
}

void Session::take_status(const Callback &callback) {
  if (command_.verb != Verb::backup) return;
  if (callback.status == QUARN_BACKUP_RUNNING) return screen_.line("backup started");
  callback_ = callback;
  answered();
}

void Session::take_notices(const ProgressEvent &event) {
  if (!event.cause.empty()) cause_ = event.cause;
  if (event.list_written) list_written_ = event.list_written;
  const std::string notice = notice_text(event);
  if (notice.empty()) return;
  json_add(document_.get(), "notice", event.notice);
  screen_.error("note: " + notice);
}

void Session::take_progress(const std::string &text) {
  if (done_ || !called_ || previewing_) return;
  const auto event = parse_progress(text);
  if (!event || !concerns_us(*event)) return;
  if (command_.verb == Verb::backup) take_notices(*event);
  reported_ = true;
  const std::string line = board_.feed(*event);
  if (screen_.redraws()) {
    screen_.bar(board_.bar(screen_.columns()));
  } else if (!line.empty()) {
    screen_.line(line);
  }
  if (watching_) check_watch();
}

bool Session::concerns_us(const ProgressEvent &event) const {
  switch (command_.verb) {
    case Verb::backup:
      return event.kind == kBackupKind;
    case Verb::app_backup:
      return event.kind == kBackupKind && event.package == command_.packages[0];
    case Verb::app_restore:
      return event.kind == kRestoreKind && event.package == command_.packages[0];
    case Verb::restore_on:
      return event.kind == kRestoreKind && command_.watch &&
             std::find(expected_.begin(), expected_.end(), event.package) != expected_.end();
    default:
      return false;
  }
}

void Session::watch() {
  if (!command_.timeout_given) disarm_timer();
  watching_ = true;
  check_watch();
}

bool Session::all_told() const {
  return std::all_of(expected_.begin(), expected_.end(),
                     [this](const auto &package) { return board_.outcome_of(package) != nullptr; });
}

void Session::check_watch() {
  if (grace_ != 0 || !all_told()) return;
  // The daemon says so itself when restore mode is over, which it is about to be.
  grace_ = g_timeout_add(kGraceMs, on_grace_end, this);
}

gboolean Session::on_grace_end(gpointer user_data) {
  auto *self = static_cast<Session *>(user_data);
  self->grace_ = 0;
  if (!self->done_) self->end_watch(false);
  return G_SOURCE_REMOVE;
}

bool Session::has_archive(const std::string &package) const {
  if (command_.transfer) return true;
  const SetPackage *known = find_package(set_, package);
  return known != nullptr && known->crc != 0;
}

int Session::watched_result() const {
  for (const std::string &package : expected_) {
    const PackageOutcome *outcome = board_.outcome_of(package);
    // A package the set holds no archive of cannot come back; that is no failure.
    if (outcome->outcome == kRestoredOutcome || !has_archive(package)) continue;
    const auto result = outcome->result.value_or(QUARN_FAILED);
    return result == QUARN_OK ? static_cast<int>(QUARN_FAILED) : exit_of(static_cast<int>(result));
  }
  return QUARN_OK;
}

void Session::end_watch(bool mode_ended) {
  watching_ = false;
  if (mode_ended) {
    for (const std::string &package : expected_) {
      if (board_.outcome_of(package) != nullptr) continue;
      board_.set_outcome({package, "skipped", "not-installed", {}, {}, QUARN_CANCELLED});
    }
  }
  const int result = watched_result();
  show_outcomes();
  if (result == QUARN_OK) return finish_with(QUARN_OK, "", "restore finished");
  const std::string error = "not every package was restored: " + result_words(result);
  return of_the_cloud(result) ? finish_explained(result, "not every package was restored", error)
                              : finish(result, error);
}

void Session::daemon_ended() {
  if (done_ || explaining_ || !called_) return;
  // One that ended with the list told is started again by the backup.
  if (previewing_ && callback_) return;
  if (watching_ && all_told()) return end_watch(false);
  if (watching_) {
    std::string missing;
    for (const std::string &package : expected_) {
      if (board_.outcome_of(package) == nullptr) missing += " " + package;
    }
    show_outcomes();
    return finish(EXIT_DAEMON_ENDED,
                  std::string("the daemon ended before it had told what became of") + missing +
                      (reported_ ? "" : " (it reported no progress at all)"));
  }
  if (callback_) {
    if (!reply_) reply_ = QUARN_OK;
    answered();
    if (done_) return;
  }
  show_outcomes();
  finish(EXIT_DAEMON_ENDED, "the daemon ended before it had answered");
}

void Session::fail(const BusFailure &failure) {
  if (done_) return;
  int code = EXIT_UNREACHABLE;
  switch (failure.kind) {
    case BusFailure::Kind::unreachable:
      break;
    case BusFailure::Kind::daemon_ended:
      code = EXIT_DAEMON_ENDED;
      break;
    case BusFailure::Kind::denied:
      code = EXIT_DENIED;
      break;
    case BusFailure::Kind::unusable:
      code = EXIT_PROTOCOL;
      break;
  }
  show_outcomes();
  finish(code, failure.message);
}

gboolean Session::on_interrupt(gpointer user_data) {
  static_cast<Session *>(user_data)->interrupt();
  return G_SOURCE_CONTINUE;
}

bool Session::can_be_withdrawn() const {
  return command_.verb == Verb::backup || command_.verb == Verb::app_backup ||
         command_.verb == Verb::app_restore;
}

void Session::interrupt() {
  if (done_) return;
  if (can_be_withdrawn() && called_ && !previewing_ && !cancelling_) {
    cancelling_ = true;
    const char *what = command_.verb == Verb::app_restore ? "restore" : "backup";
    screen_.line(std::string("cancelling the ") + what + "; interrupt again to leave at once");
    // The request's own end tells the outcome, so the answer to this is not waited for.
    client_->cancel_own([](GVariant *) {}, [this](const BusFailure &failure) { fail(failure); });
    return;
  }
  at_once_ = cancelling_;
  if (watching_) {
    show_outcomes();
    return finish(EXIT_INTERRUPTED,
                  "no longer watching; restore mode stays on (quarnctl restore off ends it)");
  }
  finish(EXIT_INTERRUPTED, "interrupted");
}

gboolean Session::on_timeout(gpointer user_data) {
  auto *self = static_cast<Session *>(user_data);
  self->timer_ = 0;
  self->time_out();
  return G_SOURCE_REMOVE;
}

void Session::time_out() {
  if (done_) return;
  std::string error = "no answer within " + seconds_words(command_.timeout);
  if (command_.verb == Verb::backup && called_ && !previewing_) {
    error = "the backup has not ended within " + seconds_words(command_.timeout) +
            "; it goes on (quarnctl cancel stops it)";
  } else if (watching_) {
    error = "not all packages were restored within " + seconds_words(command_.timeout) +
            "; restore mode stays on (quarnctl restore off ends it)";
  }
  show_outcomes();
  finish(EXIT_TIMED_OUT, error);
}

void Session::arm_timer() {
  if (command_.timeout <= 0) return;
  const double ms = std::ceil(command_.timeout * kMsPerSecond);
  timer_ = g_timeout_add(ms >= G_MAXUINT ? G_MAXUINT : static_cast<guint>(ms), on_timeout, this);
}

void Session::disarm_timer() {
  if (timer_ != 0) g_source_remove(timer_);
  timer_ = 0;
}

void Session::show_outcomes() {
  if (board_.outcomes().empty()) return;
  json_object_object_add(document_.get(), "packages", board_.to_json());
  screen_.text(board_.table());
}

void Session::finish_with(int result, const std::string &what, const std::string &done) {
  if (command_.verb == Verb::backup || command_.verb == Verb::app_backup ||
      command_.verb == Verb::app_restore) {
    show_outcomes();
  }
  if (result == QUARN_OK) {
    screen_.line(printable(done));
    return finish(QUARN_OK);
  }
  const std::string failed = what + " failed";
  const std::string error = failed + ": " + result_words(result);
  if (command_.verb == Verb::backup) tell_of_list();
  return of_the_cloud(result) ? finish_explained(exit_of(result), failed, error)
                              : finish(exit_of(result), error);
}

void Session::tell_of_list() {
  if (!list_written_) return;
  json_object_object_add(document_.get(), "list_written", json_object_new_boolean(*list_written_));
  const auto &outcomes = board_.outcomes();
  const bool sent = std::any_of(outcomes.begin(), outcomes.end(), [](const auto &package) {
    return package.outcome == "uploaded" || package.reason == "upload-failed";
  });
  if (*list_written_ || !sent) return;
  screen_.error(
      "no list was written: what this backup sent of changed packages cannot be restored yet; "
      "the next backup sends it again");
}

void Session::finish_explained(int code, const std::string &what, const std::string &error) {
  if (done_ || explaining_) return;
  // The run's own cause counts, whatever has happened since.
  if (!cause_.empty()) return finish_for(cause_, code, what, error);
  explaining_ = true;
  client_->read_status(
      [this, code, what, error](GVariant *answer) {
        if (!done_) finish_for(read_status(answer).cloud_problem, code, what, error);
      },
      [this, code, error](const BusFailure &) {
        if (!done_) finish(code, error);
      });
}

void Session::finish_for(const std::string &problem, int code, const std::string &what,
                         const std::string &error) {
  const std::string of_cloud = cloud_problem_words(problem);
  const std::string of_device = device_problem_words(problem);
  if (of_cloud.empty() && of_device.empty()) return finish(code, error);
  json_add(document_.get(), "cloud_problem", problem);
  if (of_device.empty()) return finish(code, error + ": " + of_cloud);
  // The code's own words would tell of something else.
  finish(code, what + ": " + of_device + " (" + std::to_string(code) + ")");
}

void Session::finish(int code, const std::string &error) {
  if (done_) return;
  done_ = true;
  exit_ = code;
  screen_.clear_bar();
  if (!error.empty()) screen_.error(error);
  if (command_.json) {
    json_object_object_add(document_.get(), "exit", json_object_new_int(code));
    json_add(document_.get(), "message", error.empty() ? quarn_result_text(QUARN_OK) : error);
    screen_.document(json_text(document_.get()));
  }
  g_main_loop_quit(loop_.get());
}

}  // namespace

int run_command(const Command &command) { return Session(command).run(); }

int report_usage_error(const Command &command, const std::string &error) {
  Screen screen(command.json);
  screen.error(error);
  if (command.json) {
    const JsonPtr document(json_object_new_object());
    json_add(document.get(), "verb", command.name);
    json_object_object_add(document.get(), "exit", json_object_new_int(EXIT_USAGE));
    json_add(document.get(), "message", error);
    screen.document(json_text(document.get()));
  }
  return EXIT_USAGE;
}

}  // namespace quarn_client
