#include "quarn_d_utils/cloud_session.h"

#include <glib.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <vector>

#include "backup_transport.h"
#include "glib_handles.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_log.h"
#include "thread_annotations.h"

std::atomic<bool> cloud_init_done{false};
std::atomic<backup_trans_handle_h> _g_handle{nullptr};
unsigned int cloud_init_timeout_seconds = 60;

namespace {

using AttemptId = std::uintptr_t;
constexpr AttemptId kNoAttempt = 0;

// The library is handed the number of an attempt, not a record, so an answer that comes late or
// never leaves nothing behind.
Mutex session_mutex;

/** One call of cloud_initialized(); it lives on that caller's stack. */
struct wait_record {
  AttemptId attempt = kNoAttempt; /**< stays once the record is in the list */
  GMainLoop *loop QUARN_GUARDED_BY(session_mutex) = nullptr; /**< of the main thread's wait alone */
  guint timeout_source QUARN_GUARDED_BY(session_mutex) = 0;  /**< the same */
  bool answered QUARN_GUARDED_BY(session_mutex) = false;
  bool waiting QUARN_GUARDED_BY(session_mutex) = false; /**< the nested loop runs */
};

std::condition_variable session_answered;
std::vector<wait_record *> wait_records QUARN_GUARDED_BY(session_mutex);
AttemptId last_attempt QUARN_GUARDED_BY(session_mutex) = kNoAttempt;
/** Started, not answered, not timed out. */
AttemptId running_attempt QUARN_GUARDED_BY(session_mutex) = kNoAttempt;

/** The next call starts anew. */
void end_attempt(AttemptId attempt) QUARN_REQUIRES(session_mutex) {
  if (running_attempt == attempt) running_attempt = kNoAttempt;
}

void wake(wait_record *record) QUARN_REQUIRES(session_mutex) {
  record->answered = true;
  if (record->waiting) {
    g_main_loop_quit(record->loop);
    record->waiting = false;
  }
}

/** An attempt has its answer; a transport that is ready answers every attempt. */
void answer(AttemptId attempt) {
  const MutexLock lock(session_mutex);
  end_attempt(attempt);
  for (wait_record *record : wait_records) {
    if (record->attempt == attempt || cloud_init_done) wake(record);
  }
  session_answered.notify_all();
}

void __backup_trans_init_resp_cb(backup_trans_error_code err, void *user_data) {
  if (err == BACKUP_TRANS_ERROR_NONE) {
    LOGI("backup_trans_init successful!");
    // A second attempt may have been started before the first was answered.
    if (_g_handle == nullptr) _g_handle = backup_trans_create_handle();
    const backup_trans_handle_h handle = _g_handle;
    if (handle == nullptr) {
      LOGE("cannot get cloud handler");
    } else {
      LOGI("_g_handle is 0x%x",
           static_cast<unsigned int>(reinterpret_cast<std::uintptr_t>(handle)));
    }
    // Only now: other threads take the handle as soon as the flag is set.
    cloud_init_done = handle != nullptr;
  } else {
    LOGE("backup_trans_init error : %d", err);
  }
  answer(reinterpret_cast<AttemptId>(user_data));
}

void log_timeout() {
  LOGE("cloud init couldn't be completed over %d seconds",
       static_cast<int>(cloud_init_timeout_seconds));
}

gboolean _waiting_timeout(gpointer user_data) {
  auto *record = static_cast<wait_record *>(user_data);
  log_timeout();
  const MutexLock lock(session_mutex);
  record->timeout_source = 0;
  if (record->waiting) {
    g_main_loop_quit(record->loop);
    record->waiting = false;
  }
  return G_SOURCE_REMOVE;
}

/** The thread that runs the main loop is the process's first. */
bool on_main_thread() { return gettid() == getpid(); }

void wait_in_nested_loop(wait_record *record) {
  const GMainLoopPtr loop(new_wait_loop());
  {
    const MutexLock lock(session_mutex);
    if (record->answered) return;
    record->loop = loop.get();
    record->waiting = true;
    record->timeout_source =
        g_timeout_add_seconds(cloud_init_timeout_seconds, _waiting_timeout, record);
  }
  run_nested_loop(loop.get());

  const MutexLock lock(session_mutex);
  record->waiting = false;
  if (record->timeout_source != 0) g_source_remove(record->timeout_source);
}

void wait_on_condition(wait_record *record) {
  MutexLock lock(session_mutex);
  const auto timeout = std::chrono::seconds(cloud_init_timeout_seconds);
  if (!session_answered.wait_for(lock.waiting(), timeout, [record]() QUARN_REQUIRES(session_mutex) {
        return record->answered;
      })) {
    log_timeout();
  }
}

/** Join the attempt that is running. @return true when the caller is to make a new one */
bool join_attempt(wait_record *record) {
  const MutexLock lock(session_mutex);
  if (cloud_init_done) {
    // Answered since the caller looked.
    record->answered = true;
    return false;
  }
  const bool is_new = running_attempt == kNoAttempt;
  if (is_new) running_attempt = ++last_attempt;
  record->attempt = running_attempt;
  wait_records.push_back(record);
  return is_new;
}

void leave_attempt(wait_record *record) {
  const MutexLock lock(session_mutex);
  wait_records.erase(std::remove(wait_records.begin(), wait_records.end(), record),
                     wait_records.end());
  const bool others_wait =
      std::any_of(wait_records.begin(), wait_records.end(),
                  [record](const wait_record *other) { return other->attempt == record->attempt; });
  // One that was withdrawn leaves the attempt to those that share it.
  const bool left_to_others = others_wait && waits_are_ended();
  if (!record->answered && !left_to_others) end_attempt(record->attempt);
}

}  // namespace

bool cloud_initialized() {
  if (cloud_init_done) return true;
  LOGI("try to init cloud");

  wait_record record;
  if (join_attempt(&record)) {
    const int ret =
        backup_trans_init(reinterpret_cast<void *>(record.attempt), __backup_trans_init_resp_cb);
    if (ret != BACKUP_TRANS_ERROR_NONE) {
      LOGE("backup_trans_init error : %d", ret);
      answer(record.attempt);
    }
  }
  if (on_main_thread()) {
    wait_in_nested_loop(&record);
  } else {
    wait_on_condition(&record);
  }
  leave_attempt(&record);
  return cloud_init_done;
}

backup_trans_handle_h cloud_handler() { return _g_handle; }
