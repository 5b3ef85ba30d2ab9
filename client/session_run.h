/**
 * @file session_run.h
 * @brief One command's way through the daemon's answers, signals and interrupts.
 *
 * session.cpp has what every verb needs, session_backup.cpp, session_restore.cpp and
 * session_show.cpp the verbs, session_watch.cpp what a run tells while it lasts. All on the default
 * main context.
 */
#ifndef QUARN_CLIENT_SESSION_RUN_H
#define QUARN_CLIENT_SESSION_RUN_H

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "arguments.h"
#include "backup_sets.h"
#include "bus_client.h"
#include "clean_up.h"
#include "glib_handles.h"
#include "json_ptr.h"
#include "progress.h"
#include "quarn_common.h"
#include "screen.h"

namespace quarn_client {

inline constexpr int kOn = 1;
inline constexpr int kOff = 0;

/** A result code as an exit code; one that is not known counts as a failure of no special kind. */
inline int exit_of(int result) {
  return result >= QUARN_OK && result <= QUARN_FAILED ? result : QUARN_FAILED;
}

/** What a result code says, and the code. */
inline std::string result_words(int result) {
  return std::string(quarn_result_text(result)) + " (" + std::to_string(result) + ")";
}

/** Results that the cloud may have had its part in. */
inline bool of_the_cloud(int result) {
  return result == QUARN_TRANSFER_FAILED || result == QUARN_LIST_CHECK_FAILED ||
         result == QUARN_FAILED;
}

/** Runs one command; what it shows is on the standard streams. */
class Session {
 public:
  explicit Session(const Command &command);
  int run();

 private:
  /** What an answer of the daemon leads to. */
  using Then = std::function<void(int result)>;
  /** What a list that cannot be had leads to, where that is not the end. */
  using NoList = std::function<void(const std::string &error)>;

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
  void fetch_list(std::function<void(const BackupSets &)> then, NoList otherwise = nullptr);
  void fail_list(int result, const NoList &otherwise);
  /** Of the entries of a list. */
  void tell_left_out(std::uint64_t entries);
  void show_status();
  void show_status_packages(const std::string &serial);
  void show_list(const BackupSets &sets);
  void show_sets(const BackupSets &sets);
  void restore_on(const BackupSets &sets);
  void restore_transferred();
  void expect(const std::string &package);
  void switch_restore_on(quarn_client_kind client);
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
  quarn_client_kind list_client_ = QUARN_CLIENT_CLOUD;
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

}  // namespace quarn_client

#endif
