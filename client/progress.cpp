#include "progress.h"

#include <algorithm>
#include <cmath>
#include <utility>

#include "json_ptr.h"
#include "json_read.h"
#include "quarn_common.h"
#include "text.h"

namespace quarn_client {

namespace {

constexpr char kBackup[] = "backup";
constexpr char kUploading[] = "uploading";
constexpr char kFinished[] = "finished";
constexpr std::size_t kBarColumns = 24;
constexpr int kPercent = 100;
constexpr std::size_t kPercentColumns = 4;

struct Words {
  const char *word;
  const char *text;
};

constexpr Words kStages[] = {
    {"checking", "checking the application list in the cloud"},
    {"archiving", "making archives"},
    {"uploading", "uploading"},
    {"listing", "uploading the application list"},
    {"cleaning", "removing what is no longer needed from the cloud"},
    {"finished", "finished"},
    {"downloading", "downloading"},
    {"snapshot", "keeping a copy of the present data"},
    {"unpacking", "unpacking"},
    {"attributes", "setting modes, owners and labels"},
};

constexpr Words kReasons[] = {
    {"unchanged", "the cloud holds it already"},
    {"external", "its data is on external storage"},
    {"too-large", "its data is too large"},
    {"no-space", "not enough free space on the device"},
    {"disabled", "the application does not allow it"},
    {"removed", "it was removed meanwhile"},
    {"too-deep", "its folders are nested too deeply"},
    {"unreadable", "its data could not be read"},
    {"restoring", "a restore is to have its backup first"},
    {"rules", "its rules file cannot be used"},
    {"too-many-files", "it has too many files"},
    {"names-too-long", "its file names are too long"},
    {"table-too-large", "the table of its files is too large"},
    {"upload-failed", "the upload failed"},
    {"not-installed", "restore mode ended before it was installed"},
};

template <std::size_t N>
std::string words(const Words (&list)[N], const std::string &word) {
  for (const Words &entry : list) {
    if (word == entry.word) return entry.text;
  }
  return word;
}

std::uint64_t unsigned_member(json_object *object, const char *name) {
  const auto value = json_integer(object, name);
  return value && *value > 0 ? static_cast<std::uint64_t>(*value) : 0;
}

std::optional<std::uint64_t> optional_size(json_object *object, const char *name) {
  const auto value = json_integer(object, name);
  if (!value || *value < 0) return std::nullopt;
  return static_cast<std::uint64_t>(*value);
}

}  // namespace

std::optional<ProgressEvent> parse_progress(const std::string &text) {
  const JsonPtr root = json_parse(text);
  json_object *object = root.get();
  ProgressEvent event;
  event.kind = json_string(object, "kind").value_or("");
  event.stage = json_string(object, "stage").value_or("");
  if (event.kind.empty() || event.stage.empty()) return std::nullopt;
  event.run = json_integer(object, "run").value_or(0);
  event.package = json_string(object, "package").value_or("");
  event.index = json_integer(object, "index").value_or(0);
  event.count = json_integer(object, "count").value_or(0);
  event.bytes_done = unsigned_member(object, "bytes_done");
  event.bytes_total = unsigned_member(object, "bytes_total");
  event.outcome = json_string(object, "outcome").value_or("");
  event.reason = json_string(object, "reason").value_or("");
  event.size = optional_size(object, "size");
  event.cap = optional_size(object, "cap");
  event.result = json_integer(object, "result");
  event.cause = json_string(object, "cause").value_or("");
  event.notice = json_string(object, "notice").value_or("");
  json_object *written = json_member(object, "list_written", json_type_boolean);
  if (written != nullptr) event.list_written = json_object_get_boolean(written) != 0;
  return event;
}

std::string stage_text(const std::string &kind, const std::string &stage) {
  if (stage == kFinished && kind == kBackup) return "backup finished";
  return words(kStages, stage);
}

std::string notice_text(const ProgressEvent &event) {
  if (event.notice != "list-nearly-full") return "";
  std::string text = "the application list is nearly full";
  if (event.size && event.cap) {
    text += ": " + size_text(*event.size) + " of at most " + size_text(*event.cap);
  }
  return text + "; once it is full no device of the account can back up";
}

std::string reason_text(const PackageOutcome &outcome) {
  if (outcome.size && outcome.cap) {
    std::string size = size_text(*outcome.size);
    std::string cap = size_text(*outcome.cap);
    // Where the units hide the difference the bytes show it.
    if (size == cap) {
      size = std::to_string(*outcome.size) + " B";
      cap = std::to_string(*outcome.cap) + " B";
    }
    if (outcome.reason == "too-large") return size + " of data, at most " + cap;
    if (outcome.reason == "no-space") return size + " of data, " + cap + " are free";
  }
  if (!outcome.reason.empty()) return words(kReasons, outcome.reason);
  if (!outcome.result || *outcome.result == QUARN_OK) return "";
  return quarn_result_text(static_cast<int>(*outcome.result));
}

const PackageOutcome *ProgressBoard::outcome_of(const std::string &package) const {
  const auto found =
      std::find_if(outcomes_.begin(), outcomes_.end(),
                   [&](const PackageOutcome &known) { return known.package == package; });
  return found == outcomes_.end() ? nullptr : &*found;
}

void ProgressBoard::set_outcome(PackageOutcome outcome) {
  const PackageOutcome *known = outcome_of(outcome.package);
  if (known == nullptr) {
    outcomes_.push_back(std::move(outcome));
  } else {
    outcomes_[static_cast<std::size_t>(known - outcomes_.data())] = std::move(outcome);
  }
}

std::string ProgressBoard::feed(const ProgressEvent &event) {
  const bool is_backup = event.kind == kBackup;
  if (is_backup && event.run != last_.run) outcomes_.clear();
  const bool new_stage = event.stage != last_.stage || event.run != last_.run;
  if (new_stage && is_backup) best_.reset();
  last_ = event;
  std::string line;
  if (!event.package.empty() && !event.outcome.empty()) {
    PackageOutcome outcome{event.package, event.outcome, event.reason,
                           event.size,    event.cap,     event.result};
    const std::string reason = reason_text(outcome);
    line = event.package + ": " + event.outcome;
    if (!reason.empty()) line += " (" + reason + ")";
    set_outcome(std::move(outcome));
  } else if (new_stage && is_backup) {
    line = stage_text(event.kind, event.stage);
  }
  const auto done = fraction();
  if (done) best_ = std::clamp(std::max(best_.value_or(0), *done), 0.0, 1.0);
  return printable(line);
}

std::optional<double> ProgressBoard::fraction() const {
  if (last_.kind != kBackup) {
    if (expected_ == 0) return std::nullopt;
    return static_cast<double>(outcomes_.size()) / static_cast<double>(expected_);
  }
  if (last_.stage == kFinished) return 1;
  if (last_.stage == kUploading && last_.bytes_total > 0) {
    return static_cast<double>(last_.bytes_done) / static_cast<double>(last_.bytes_total);
  }
  if (last_.count <= 0) return std::nullopt;
  return static_cast<double>(last_.index) / static_cast<double>(last_.count);
}

std::string ProgressBoard::bar(std::size_t columns) const {
  std::string line;
  if (best_) {
    const auto filled = static_cast<std::size_t>(std::floor(*best_ * kBarColumns));
    const std::string percent = std::to_string(std::lround(std::floor(*best_ * kPercent)));
    line = "[" + std::string(filled, '#') + std::string(kBarColumns - filled, '-') + "]" +
           std::string(kPercentColumns - percent.size(), ' ') + percent + "%  ";
  }
  line += stage_text(last_.kind, last_.stage);
  if (last_.index > 0) {
    line += "  " + std::to_string(last_.index);
    line += last_.count > 0 ? " of " + std::to_string(last_.count) : " done";
  }
  if (!last_.package.empty()) line += "  " + last_.package;
  if (last_.stage == kUploading && last_.bytes_total > 0) {
    line += "  " + size_text(last_.bytes_done) + " of " + size_text(last_.bytes_total);
  }
  return clipped(line, columns);
}

std::string ProgressBoard::table() const {
  if (outcomes_.empty()) return "";
  std::vector<std::vector<std::string>> rows;
  for (const PackageOutcome &outcome : outcomes_) {
    rows.push_back({outcome.package, outcome.outcome, outcome.size ? size_text(*outcome.size) : "-",
                    reason_text(outcome)});
  }
  return table_text({"PACKAGE", "OUTCOME", "SIZE", "WHY"}, rows);
}

json_object *ProgressBoard::to_json() const {
  json_object *array = json_object_new_array();
  for (const PackageOutcome &outcome : outcomes_) {
    json_object *entry = json_object_new_object();
    json_add(entry, "package", outcome.package);
    json_add(entry, "outcome", outcome.outcome);
    if (!outcome.reason.empty()) json_add(entry, "reason", outcome.reason);
    if (outcome.size) {
      json_object_object_add(entry, "size",
                             json_object_new_int64(static_cast<std::int64_t>(*outcome.size)));
    }
    if (outcome.cap) {
      json_object_object_add(entry, "cap",
                             json_object_new_int64(static_cast<std::int64_t>(*outcome.cap)));
    }
    if (outcome.result) {
      json_object_object_add(entry, "result", json_object_new_int64(*outcome.result));
    }
    json_object_array_add(array, entry);
  }
  return array;
}

}  // namespace quarn_client
