#include "session_run.h"

#include <glib-unix.h>

#include <cmath>
#include <csignal>
#include <utility>

#include "files/package_files.h"
#include "json_ptr.h"
#include "json_read.h"
#include "session.h"
#include "status.h"
#include "text.h"

namespace quarn_client {

namespace {

constexpr int kMsPerSecond = 1000;
constexpr char kRestoreStop[] = "restore_stop";

std::string seconds_words(double seconds) {
  char buffer[G_ASCII_DTOSTR_BUF_SIZE];
  return std::string(g_ascii_formatd(buffer, sizeof buffer, "%g", seconds)) + " seconds";
}

}  // namespace

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
      list_client_ = QUARN_CLIENT_COMPANION;
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
