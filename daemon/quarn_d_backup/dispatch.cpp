#include <glib.h>
#include <malloc.h>
#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "backup_transport.h"
#include "quarn_common.h"
#include "quarn_d_backup/cancel.h"
#include "quarn_d_backup/run_private.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_turn.h"
#include "quarn_d_utils/boot_cleanup.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_d_utils/power.h"
#include "quarn_dbus_client.h"
#include "quarn_log.h"

std::atomic<bool> manual_backup_canceled{false};
std::atomic<bool> g_is_backing_up{false};

namespace {

constexpr std::size_t kKeepNothing = 0;
constexpr int kTurnCheckMs = 100;

// The worker has no end and may be anywhere when the process exits: what it
// waits on and reads is never destroyed.
std::mutex &backup_req_list_mutex = *new std::mutex;

struct queued_request {
  void *client;               /**< null: an automatic backup */
  std::int64_t waited_before; /**< what the worker had waited for clients when it was made */
};
std::vector<queued_request> &backup_req_list = *new std::vector<queued_request>;
/** With the list's mutex. */
std::vector<queued_request> &cancelled_clients = *new std::vector<queued_request>;

/** Microseconds that clients which do not answer may hold up another's request, all together. */
constexpr std::int64_t kLongestHoldUp = 60000000;

/** The manual run that a cancel meets. */
struct running_manual {
  bool standing = false;  // from its taking to its outcome
  bool cancelled = false;
  std::string sender;
};
running_manual &running = *new running_manual;  // with the list's mutex

std::mutex &backup_req_cond_mutex = *new std::mutex;
std::condition_variable &backup_req_cond = *new std::condition_variable;

/** Entries in both lists: what the worker waits for. The two mutexes are never held together. */
std::atomic<std::size_t> waiting_entries{0};
/** Requests that were made and are not finished. */
std::atomic<int> outstanding_requests{0};

/** An automatic backup is queued or runs; with the list's mutex. */
bool automatic_outstanding = false;

std::atomic<backup_end_observer> end_observer{nullptr};

void end_request() {
  PendingWork::end();
  --outstanding_requests;
  if (const backup_end_observer observer = end_observer) observer();
}

enum class Taken { kNothing, kRequest };

Taken take_request(void **client) {
  const std::lock_guard<std::mutex> lock(backup_req_list_mutex);
  if (backup_req_list.empty()) return Taken::kNothing;
  *client = backup_req_list.front().client;
  backup_req_list.erase(backup_req_list.begin());
  --waiting_entries;
  const auto *record = static_cast<const client_cb_data *>(*client);
  running = {record != nullptr, false, record != nullptr ? record->sender : ""};
  return Taken::kRequest;
}

void forget_automatic() {
  const std::lock_guard<std::mutex> lock(backup_req_list_mutex);
  automatic_outstanding = false;
}

/** Whether somebody else than @p sender has waited for unanswered callbacks for long enough. */
bool others_held_up(const std::string &sender) {
  const std::int64_t waited = quarn_dbus_time_waited();
  const auto held_up = [&](const queued_request &request) {
    const auto *record = static_cast<const client_cb_data *>(request.client);
    const bool others = record == nullptr || record->sender != sender;
    return others && waited - request.waited_before >= kLongestHoldUp;
  };
  const std::lock_guard<std::mutex> lock(backup_req_list_mutex);
  return std::any_of(backup_req_list.begin(), backup_req_list.end(), held_up) ||
         std::any_of(cancelled_clients.begin(), cancelled_clients.end(), held_up);
}

bool take_cancelled_client(void **client) {
  const std::lock_guard<std::mutex> lock(backup_req_list_mutex);
  if (cancelled_clients.empty()) return false;
  *client = cancelled_clients.front().client;
  cancelled_clients.erase(cancelled_clients.begin());
  --waiting_entries;
  return true;
}

/** Clients whose reservation was cancelled learn it here, not on the main thread. */
void answer_cancelled_clients() {
  void *client = nullptr;
  // One by one: whoever is still to be told counts among those that are held up.
  while (take_cancelled_client(&client)) {
    quarn_dbus_manual_backup_status(QUARN_CANCELLED, QUARN_BACKUP_CANCELLED, client);
    end_request();
  }
}

bool can_reach_cloud() {
  if (wifi_connected() != 0 && cloud_initialized()) return true;
  LOGE("cloud couldn't be initialized.(wifi:%d)", wifi_connected());
  return false;
}

void run_request(void *client) {
  if (client == nullptr) {
    if (!can_reach_cloud()) return;
    LOGI("now auto backup start!");
    do_backup(false, nullptr);
    return;
  }
  if (!can_reach_cloud()) {
    const bool cancelled = settle_running_backup();
    quarn_dbus_manual_backup_status(cancelled ? QUARN_CANCELLED : QUARN_NO_SESSION,
                                    cancelled ? QUARN_BACKUP_CANCELLED : QUARN_BACKUP_FAILED,
                                    client);
    return;
  }
  LOGI("now manual backup start!");
  do_backup(true, client);
}

void *backup_req_dispatch_thread(void *) {
  for (;;) {
    LOGI("backup_req_dispatch_thread");
    // Nothing is swept or run beside an earlier process that still works; a cancel is answered.
    while (!wait_for_quarn_turn(kTurnCheckMs)) answer_cancelled_clients();
    boot_cleanup_backup_items();
    answer_cancelled_clients();
    void *client = nullptr;
    if (take_request(&client) == Taken::kRequest) {
      request_power_lock(true);
      g_is_backing_up = true;
      run_request(client);
      settle_running_backup();
      if (client == nullptr) forget_automatic();
      g_is_backing_up = false;
      request_power_lock(false);
      end_request();
      malloc_trim(kKeepNothing);
    }
    std::unique_lock<std::mutex> lock(backup_req_cond_mutex);
    backup_req_cond.wait(lock, [] { return waiting_entries != 0; });
  }
}

/** Under the list's mutex: take the manual requests out that @p meant says. @return how many */
template <typename Meant>
std::uint32_t drop_reservations(Meant meant) {
  const auto dropped = std::stable_partition(
      backup_req_list.begin(), backup_req_list.end(), [&meant](const queued_request &request) {
        return request.client == nullptr ||
               !meant(*static_cast<const client_cb_data *>(request.client));
      });
  std::uint32_t count = 0;
  for (auto request = dropped; request != backup_req_list.end(); ++request, ++count) {
    LOGI("reservation for manual backup is canceled");
    cancelled_clients.push_back(*request);
  }
  backup_req_list.erase(dropped, backup_req_list.end());
  return count;
}

void abort_transfers() {
  const backup_trans_handle_h handle = cloud_handler();
  LOGI("request cancel to handler(0x%x)",
       static_cast<unsigned int>(reinterpret_cast<std::uintptr_t>(handle)));
  backup_trans_cancel_request(handle);
}

void wake_worker() {
  const std::lock_guard<std::mutex> lock(backup_req_cond_mutex);
  backup_req_cond.notify_one();
}

}  // namespace

void set_backup_end_observer(backup_end_observer observer) { end_observer = observer; }

void init_backup_req_dispatch_thread() {
  LOGI("init_backup_req_dispatch_thread");
  quarn_dbus_set_patience(others_held_up);
  pthread_t worker = {};
  const int ret = pthread_create(&worker, nullptr, backup_req_dispatch_thread, nullptr);
  if (ret != 0) {
    LOGE("pthread_create() failed %d", ret);
    return;
  }
  pthread_detach(worker);
}

void request_backup(void *client) {
  {
    const std::lock_guard<std::mutex> lock(backup_req_list_mutex);
    if (client == nullptr && std::exchange(automatic_outstanding, true)) {
      LOGI("auto backup is requested already");
      return;
    }
    ++outstanding_requests;
    PendingWork::begin();
    backup_req_list.push_back({client, quarn_dbus_time_waited()});
    ++waiting_entries;
  }
  wake_worker();
}

void cancel_backup(void *) {
  {
    // Before the transfers end: the run is to know why they did.
    const std::lock_guard<std::mutex> lock(backup_req_list_mutex);
    running.cancelled = running.standing;
  }
  abort_transfers();
  {
    const std::lock_guard<std::mutex> lock(backup_req_list_mutex);
    running.cancelled = running.standing || running.cancelled;  // taken from the queue meanwhile
    drop_reservations([](const client_cb_data &) { return true; });
  }
  wake_worker();
}

std::uint32_t cancel_backups_of(const std::string &sender) {
  std::uint32_t count = 0;
  bool runs = false;
  {
    const std::lock_guard<std::mutex> lock(backup_req_list_mutex);
    count = drop_reservations(
        [&sender](const client_cb_data &client) { return client.sender == sender; });
    runs = running.standing && !running.cancelled && running.sender == sender;
    if (runs) running.cancelled = true;
  }
  if (runs) abort_transfers();
  wake_worker();
  return runs ? count + 1 : count;
}

bool running_backup_cancelled() {
  const std::lock_guard<std::mutex> lock(backup_req_list_mutex);
  return running.cancelled;
}

bool settle_running_backup() {
  const std::lock_guard<std::mutex> lock(backup_req_list_mutex);
  running.standing = false;
  return running.cancelled;
}

bool backup_request_outstanding() { return outstanding_requests != 0; }
