/**
 * @file run_fixture.h
 * @brief Whole runs against the store in memory, with something done at a request of theirs.
 */
#ifndef RUN_FIXTURE_H
#define RUN_FIXTURE_H

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "backup_device.h"
#include "poll_hook.h"
#include "quarn_d_backup/pipeline.h"

inline constexpr std::uint32_t kRunRequest = 43;

/** A progress step with its texts, which outlive the call here. */
struct SeenStep {
  backup_stage stage;
  std::string package;
  backup_outcome outcome;
  std::string cause;
  std::string notice;
  bool list_written;
  std::uint64_t size;
  std::uint64_t limit;
  std::int32_t result;
};

class Runs : public BackupDevice {
 protected:
  Runs() {
    steps().clear();
    set_backup_progress_sink([](const backup_progress &progress) {
      steps().push_back({progress.stage, progress.package, progress.outcome, progress.cause,
                         progress.notice, progress.list_written, progress.size, progress.limit,
                         progress.result});
    });
    set_poll_hook([this](int) { cloud_.answer_next(); });
  }
  ~Runs() override {
    set_poll_hook(nullptr);
    cloud_.answer_all();
  }

  static std::vector<SeenStep> &steps() {
    static std::vector<SeenStep> all;
    return all;
  }
  static SeenStep step_of(const std::string &package) {
    for (const SeenStep &step : steps()) {
      if (step.package == package && step.outcome != backup_outcome::none) return step;
    }
    ADD_FAILURE() << "no outcome of " << package;
    return {};
  }

  /** Do this once, when the request is made, before its answer. */
  void at(Op op, const std::string &path, std::function<void()> action) {
    auto done = std::make_shared<bool>(false);
    cloud_.refuse = [=](Op asked, const std::string &what) {
      if (asked != op || what.rfind(path, 0) != 0 || *done) return 0;
      *done = true;
      action();
      return 0;
    };
  }

  void manual() { do_backup(true, std::unique_ptr<client_cb_data>(new_client(kRunRequest))); }
  void automatic() { do_backup(false, nullptr); }
  AppList cloud_list() { return AppList(cloud_.objects[kAppListInCloud]); }
  bool in_cloud(const std::string &path) { return cloud_.objects.count(path) != 0; }
  int info(const std::string &text) const { return count_logged(DLOG_INFO, text); }
  int error(const std::string &text) const { return count_logged(DLOG_ERROR, text); }
};

#endif
