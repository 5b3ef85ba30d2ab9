/**
 * @file progress.h
 * @brief The daemon's "progress" signals: read, collected and put into words.
 *
 * docs/progress.md describes the signal.
 */
#ifndef QUARN_CLIENT_PROGRESS_H
#define QUARN_CLIENT_PROGRESS_H

#include <json-c/json.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace quarn_client {

/** One signal; members that are missing or of another type are empty or 0. */
struct ProgressEvent {
  std::int64_t run = 0; /**< tells the backups of one daemon apart */
  std::string kind;     /**< "backup" or "restore" */
  std::string stage;
  std::string package;    /**< empty: the event is about the whole run */
  std::int64_t index = 0; /**< packages done in this stage */
  std::int64_t count = 0; /**< of how many; 0 while that is not known */
  std::uint64_t bytes_done = 0;
  std::uint64_t bytes_total = 0;
  std::string outcome; /**< empty while the package is being worked on */
  std::string reason;
  std::optional<std::uint64_t> size; /**< bytes: the archive's, or what was too large */
  std::optional<std::uint64_t> cap;  /**< bytes that are allowed at most */
  std::optional<std::int64_t> result;
  std::string cause;                /**< what the run failed of; empty when that is not told */
  std::optional<bool> list_written; /**< the failed run's list stands in the cloud */
  std::string notice;               /**< something that is to be seen to; empty as a rule */
};

/** Reads a signal's text; nothing when it is not an object with a kind and a stage. */
std::optional<ProgressEvent> parse_progress(const std::string &text);

/** What became of one package. */
struct PackageOutcome {
  std::string package;
  std::string outcome;
  std::string reason;
  std::optional<std::uint64_t> size;
  std::optional<std::uint64_t> cap;
  std::optional<std::int64_t> result;
};

/** Collects the events of one run; a backup of another run begins anew. */
class ProgressBoard {
 public:
  /** @param expected packages of the run when they are known before it begins, else 0 */
  explicit ProgressBoard(std::size_t expected = 0) : expected_(expected) {}

  /** Takes one event in. @return a line worth showing where nothing can be redrawn, or empty */
  std::string feed(const ProgressEvent &event);

  /** Adds or replaces the outcome of a package. */
  void set_outcome(PackageOutcome outcome);
  const PackageOutcome *outcome_of(const std::string &package) const;
  const std::vector<PackageOutcome> &outcomes() const { return outcomes_; }

  /** One line of at most @p columns columns: what is going on, with a bar when its end is known. */
  std::string bar(std::size_t columns) const;
  /** Each package, what happened to it, its size and why; empty when none was reported. */
  std::string table() const;
  /** The same as a JSON array; the caller owns it. */
  json_object *to_json() const;

 private:
  /** How much of the stage is done, 0 to 1; nothing while that is not known. */
  std::optional<double> fraction() const;

  std::size_t expected_;
  ProgressEvent last_;
  std::optional<double> best_; /**< a bar never runs back */
  std::vector<PackageOutcome> outcomes_;
};

/** Words for a stage of the daemon's work; the stage itself when it is not known. */
std::string stage_text(const std::string &kind, const std::string &stage);

/** Words for a notice; empty when it is not known. */
std::string notice_text(const ProgressEvent &event);

/** Words for why a package came out as it did. */
std::string reason_text(const PackageOutcome &outcome);

}  // namespace quarn_client

#endif
