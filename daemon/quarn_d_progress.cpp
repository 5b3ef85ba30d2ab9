#include "quarn_d_progress.h"

#include <glib.h>
#include <json-c/json.h>

#include <deque>

#include "json_ptr.h"
#include "quarn_d_status.h"
#include "quarn_dbus_client.h"
#include "thread_annotations.h"

namespace {

constexpr char kSignal[] = "progress";
/** What waits for the main loop at the most; beyond it steps that settle nothing are dropped. */
constexpr std::size_t kMaxWaiting = 512;

struct waiting_step {
  std::string text;
  std::string subject; /**< a later step of the same subject makes an unsettled one obsolete */
  bool settled;
};

/** What the main loop is still to send. */
struct waiting_steps {
  Mutex mutex;
  std::deque<waiting_step> steps QUARN_GUARDED_BY(mutex);
};
/** Held while steps are sent, so that two senders cannot swap their order. */
Mutex publish_mutex;

waiting_steps &waiting() {
  static auto *all = new waiting_steps;
  return *all;
}

const char *stage_name(backup_stage stage) {
  switch (stage) {
    case backup_stage::checking:
      return "checking";
    case backup_stage::archiving:
      return "archiving";
    case backup_stage::uploading:
      return "uploading";
    case backup_stage::listing:
      return "listing";
    case backup_stage::cleaning:
      return "cleaning";
    case backup_stage::finished:
      return "finished";
  }
  return "";
}

const char *stage_name(restore_stage stage) {
  switch (stage) {
    case restore_stage::downloading:
      return "downloading";
    case restore_stage::snapshot:
      return "snapshot";
    case restore_stage::unpacking:
      return "unpacking";
    case restore_stage::attributes:
      return "attributes";
    case restore_stage::finished:
      return "finished";
  }
  return "";
}

struct outcome_words {
  const char *outcome;
  const char *reason;
};

outcome_words words(backup_outcome outcome) {
  switch (outcome) {
    case backup_outcome::none:
      return {nullptr, nullptr};
    case backup_outcome::uploaded:
      return {"uploaded", nullptr};
    case backup_outcome::unchanged:
      return {"unchanged", "unchanged"};
    case backup_outcome::external:
      return {"skipped", "external"};
    case backup_outcome::too_large:
      return {"skipped", "too-large"};
    case backup_outcome::no_space:
      return {"skipped", "no-space"};
    case backup_outcome::disabled:
      return {"skipped", "disabled"};
    case backup_outcome::removed:
      return {"skipped", "removed"};
    case backup_outcome::too_deep:
      return {"skipped", "too-deep"};
    case backup_outcome::unreadable:
      return {"skipped", "unreadable"};
    case backup_outcome::restoring:
      return {"skipped", "restoring"};
    case backup_outcome::unusable_rules:
      return {"skipped", "rules"};
    case backup_outcome::too_many_files:
      return {"skipped", "too-many-files"};
    case backup_outcome::names_too_long:
      return {"skipped", "names-too-long"};
    case backup_outcome::table_too_large:
      return {"skipped", "table-too-large"};
    case backup_outcome::upload_failed:
      return {"failed", "upload-failed"};
  }
  return {nullptr, nullptr};
}

const char *word(restore_outcome outcome) {
  switch (outcome) {
    case restore_outcome::none:
      return nullptr;
    case restore_outcome::restored:
      return "restored";
    case restore_outcome::rolled_back:
      return "rolled-back";
    case restore_outcome::incomplete:
      return "incomplete";
    case restore_outcome::failed:
      return "failed";
    case restore_outcome::skipped:
      return "skipped";
  }
  return nullptr;
}

void put(json_object *object, const char *key, const char *text) {
  if (text != nullptr) json_object_object_add(object, key, json_object_new_string(text));
}

void put(json_object *object, const char *key, std::uint64_t number) {
  json_object_object_add(object, key, json_object_new_uint64(number));
}

void put(json_object *object, const char *key, std::int32_t number) {
  json_object_object_add(object, key, json_object_new_int(number));
}

std::string text_of(json_object *object) {
  return json_object_to_json_string_ext(object, JSON_C_TO_STRING_PLAIN);
}

void publish_waiting() {
  const MutexLock sending(publish_mutex);
  std::deque<waiting_step> steps;
  {
    const MutexLock lock(waiting().mutex);
    steps.swap(waiting().steps);
  }
  for (const waiting_step &step : steps) {
    if (quarn_dbus_connection != nullptr) quarnd_dbus_publish(kSignal, step.text.c_str());
  }
}

gboolean publish_later(gpointer) {
  publish_waiting();
  return G_SOURCE_REMOVE;
}

void leave(waiting_step step) {
  bool first = false;
  waiting_steps &all = waiting();
  {
    const MutexLock lock(all.mutex);
    std::deque<waiting_step> &steps = all.steps;
    first = steps.empty();
    if (!first && !steps.back().settled && steps.back().subject == step.subject) {
      steps.back() = std::move(step);
      return;
    }
    if (steps.size() >= kMaxWaiting && !step.settled) return;
    steps.push_back(std::move(step));
  }
  if (first) g_idle_add(publish_later, nullptr);
}

}  // namespace

std::string backup_progress_text(const backup_progress &progress) {
  const JsonPtr object(json_object_new_object());
  json_object *root = object.get();
  put(root, "run", static_cast<std::uint64_t>(progress.run));
  put(root, "kind", "backup");
  put(root, "stage", stage_name(progress.stage));
  put(root, "package", progress.package);
  put(root, "index", progress.index);
  put(root, "count", progress.count);
  put(root, "bytes_done", progress.bytes_done);
  put(root, "bytes_total", progress.bytes_total);
  const outcome_words settled = words(progress.outcome);
  put(root, "outcome", settled.outcome);
  put(root, "reason", settled.reason);
  if (progress.size != 0) put(root, "size", progress.size);
  if (progress.limit != 0) put(root, "cap", progress.limit);
  if (*progress.notice != '\0') put(root, "notice", progress.notice);
  if (progress.stage == backup_stage::finished) {
    put(root, "result", progress.result);
    if (*progress.cause != '\0') put(root, "cause", progress.cause);
    if (progress.result != QUARN_OK) {
      json_object_object_add(root, "list_written", json_object_new_boolean(progress.list_written));
    }
  }
  return text_of(root);
}

std::string restore_progress_text(const restore_progress &progress) {
  const JsonPtr object(json_object_new_object());
  json_object *root = object.get();
  put(root, "run", static_cast<std::uint64_t>(progress.run));
  put(root, "kind", "restore");
  put(root, "stage", stage_name(progress.stage));
  put(root, "package", progress.package);
  put(root, "index", progress.index);
  put(root, "count", progress.count);
  // The archive is taken whole: there is nothing between none of it and all of it.
  put(root, "bytes_done", progress.size);
  put(root, "bytes_total", progress.size);
  put(root, "outcome", word(progress.outcome));
  if (progress.outcome != restore_outcome::none && progress.size != 0)
    put(root, "size", progress.size);
  if (progress.stage == restore_stage::finished) put(root, "result", progress.result);
  return text_of(root);
}

void note_backup_progress(const backup_progress &progress) {
  const bool settled = progress.outcome != backup_outcome::none || *progress.notice != '\0' ||
                       progress.stage == backup_stage::finished;
  leave({backup_progress_text(progress), std::string("backup ") + stage_name(progress.stage),
         settled});
  // A client stops listening with its final status, which follows: everything goes out before.
  if (progress.stage == backup_stage::finished) publish_waiting();
  if (progress.stage == backup_stage::finished || progress.stage == backup_stage::checking) {
    quarnd_status_refresh();
  }
}

void note_restore_progress(const restore_progress &progress) {
  leave({restore_progress_text(progress), std::string("restore ") + progress.package,
         progress.stage == restore_stage::finished});
  if (progress.stage == restore_stage::finished) quarnd_status_refresh();
}
