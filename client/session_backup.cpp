#include "session_run.h"

#include "status.h"
#include "text.h"

namespace quarn_client {

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
            "get_app_list", g_variant_new("(iu)", QUARN_CLIENT_CLOUD, req_id_), "(i)",
            [](GVariant *) {}, [this](const BusFailure &) { start_backup(); });
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

}  // namespace quarn_client
