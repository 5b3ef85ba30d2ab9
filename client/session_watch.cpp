#include "session_run.h"

#include <algorithm>

#include "json_read.h"

namespace quarn_client {

namespace {

constexpr guint kGraceMs = 2000;
constexpr char kBackupKind[] = "backup";
constexpr char kRestoreKind[] = "restore";
constexpr char kRestoredOutcome[] = "restored";

}  // namespace

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

void Session::show_outcomes() {
  if (board_.outcomes().empty()) return;
  json_object_object_add(document_.get(), "packages", board_.to_json());
  screen_.text(board_.table());
}

}  // namespace quarn_client
