#include "quarn_d_restore/restore_progress.h"

#include <map>

namespace {

restore_progress_sink progress_sink = nullptr;

struct restore_run {
  unsigned number = 0;
  int done = 0;
  int packages = 0;
};
unsigned last_run = 0;
restore_run mode_run;

/** Runs of one package each that somebody asked for. */
std::map<std::string, restore_run> &requested() {
  static std::map<std::string, restore_run> runs;
  return runs;
}

restore_run &run_of(const std::string &package) {
  const auto found = requested().find(package);
  return found == requested().end() ? mode_run : found->second;
}

void tell(const std::string &package, restore_stage stage, restore_outcome outcome, int result,
          std::uint64_t size) {
  if (progress_sink == nullptr) return;
  const restore_run &run = run_of(package);
  progress_sink(
      {run.number, run.done, run.packages, package.c_str(), stage, outcome, result, size});
}

}  // namespace

void set_restore_progress_sink(restore_progress_sink sink) { progress_sink = sink; }

void begin_restore_run(std::size_t packages) {
  mode_run = {++last_run, 0, static_cast<int>(packages)};
}

void begin_requested_restore(const std::string &package) {
  requested()[package] = {++last_run, 0, 1};
}

void report_restore_step(const std::string &package, restore_stage stage, std::uint64_t size) {
  tell(package, stage, restore_outcome::none, QUARN_OK, size);
}

void report_restore_end(const std::string &package, restore_outcome outcome, int result,
                        std::uint64_t size) {
  ++run_of(package).done;
  tell(package, restore_stage::finished, outcome, result, size);
  requested().erase(package);
}
