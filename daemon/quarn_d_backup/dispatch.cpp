#include <malloc.h>
#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "backup_transport.h"
#include "quarn_common.h"
#include "quarn_d_backup/cancel.h"
#include "quarn_d_backup/pipeline.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_conditions/conditions.h"
#include "quarn_d_turn.h"
#include "quarn_d_utils/boot_cleanup.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_d_utils/power.h"
#include "quarn_dbus_client.h"
#include "quarn_log.h"
#include "thread_annotations.h"

std::atomic<bool> manual_backup_canceled{false};
std::atomic<bool> g_is_backing_up{false};

namespace {

constexpr std::size_t kKeepNothing = 0;
constexpr int kTurnCheckMs = 100;

// The worker has no end and may be anywhere when the process exits: what it
// waits on and reads is never destroyed.
Mutex &backup_req_list_mutex = *new Mutex;

/** The client of a manual backup, which its final status deletes; null: an automatic one. */
using ClientPtr = std::unique_ptr<client_cb_data>;

struct queued_request {
  ClientPtr client;
  std::int64_t waited_before; /**< what the worker had waited for clients when it was made */
};
std::vector<queued_request> &backup_req_list QUARN_GUARDED_BY(backup_req_list_mutex) =
    *new std::vector<queued_request>;
std::vector<queued_request> &cancelled_clients QUARN_GUARDED_BY(backup_req_list_mutex) =
    *new std::vector<queued_request>;

/** Microseconds that clients which do not answer may hold up another's request, all together. */
constexpr std::int64_t kLongestHoldUp = 60000000;

/** The manual run that a cancel meets. */
struct running_manual {
  bool standing = false;  // from its taking to its outcome
  bool cancelled = false;
  std::string sender;
};
running_manual &running QUARN_GUARDED_BY(backup_req_list_mutex) = *new running_manual;

Mutex &backup_req_cond_mutex = *new Mutex;
std::condition_variable &backup_req_cond = *new std::condition_variable;

/** Entries in both lists: what the worker waits for. The two mutexes are never held together. */
std::atomic<std::size_t> waiting_entries{0};
/** Requests that were made and are not finished. */
std::atomic<int> outstanding_requests{0};

/** An automatic backup is queued or runs. */
bool automatic_outstanding QUARN_GUARDED_BY(backup_req_list_mutex) = false;

std::atomic<backup_end_observer> end_observer{nullptr};

void end_request() {
  PendingWork::end();
  --outstanding_requests;
  if (const backup_end_observer observer = end_observer) observer();
}

/** The client of the oldest request of @p list, none when it is empty. */
std::optional<ClientPtr> take_oldest(std::vector<queued_request> *list)
    QUARN_REQUIRES(backup_req_list_mutex) {
  if (list->empty()) return std::nullopt;
  ClientPtr client = std::move(list->front().client);
  list->erase(list->begin());
  --waiting_entries;
  return client;
}

std::optional<ClientPtr> take_request() {
  const MutexLock lock(backup_req_list_mutex);
  std::optional<ClientPtr> taken = take_oldest(&backup_req_list);
  if (!taken) return taken;
  const client_cb_data *const record = taken->get();
  running = {record != nullptr, false, record != nullptr ? record->sender : ""};
  return taken;
}

void forget_automatic() {
  const MutexLock lock(backup_req_list_mutex);
  automatic_outstanding = false;
}

std::optional<ClientPtr> take_cancelled_client() {
  const MutexLock lock(backup_req_list_mutex);
  return take_oldest(&cancelled_clients);
}

/** Clients whose reservation was cancelled learn it here, not on the main thread. */
void answer_cancelled_clients() {
  // One by one: whoever is still to be told counts among those that are held up.
  while (std::optional<ClientPtr> client = take_cancelled_client()) {
    quarn_dbus_manual_backup_status(QUARN_CANCELLED, QUARN_BACKUP_CANCELLED, client->release());
    end_request();
  }
}

bool can_reach_cloud() {
  if (wifi_connected() != 0 && cloud_initialized()) return true;
  LOGE("cloud couldn't be initialized.(wifi:%d)", wifi_connected());
  return false;
}

void run_request(ClientPtr client) {
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
                                    client.release());
    return;
  }
  LOGI("now manual backup start!");
  do_backup(true, std::move(client));
}

void *backup_req_dispatch_thread(void *) {
  for (;;) {
    LOGI("backup_req_dispatch_thread");
    // Nothing is swept or run beside an earlier process that still works; a cancel is answered.
    while (!wait_for_quarn_turn(kTurnCheckMs)) answer_cancelled_clients();
    boot_cleanup_backup_items();
    answer_cancelled_clients();
    if (std::optional<ClientPtr> client = take_request()) {
      const bool is_automatic = *client == nullptr;
      request_power_lock(true);
      g_is_backing_up = true;
      run_request(*std::move(client));
      settle_running_backup();
      if (is_automatic) forget_automatic();
      g_is_backing_up = false;
      request_power_lock(false);
      end_request();
      malloc_trim(kKeepNothing);
    }
    MutexLock lock(backup_req_cond_mutex);
    backup_req_cond.wait(lock.waiting(), [] { return waiting_entries != 0; });
  }
}

/** Take the manual requests out that @p meant says. @return how many */
template <typename Meant>
std::uint32_t drop_reservations(Meant meant) QUARN_REQUIRES(backup_req_list_mutex) {
  const auto dropped = std::stable_partition(
      backup_req_list.begin(), backup_req_list.end(), [&meant](const queued_request &request) {
        return request.client == nullptr || !meant(*request.client);
      });
  std::uint32_t count = 0;
  for (auto request = dropped; request != backup_req_list.end(); ++request, ++count) {
    LOGI("reservation for manual backup is canceled");
    cancelled_clients.push_back(std::move(*request));
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
  const MutexLock lock(backup_req_cond_mutex);
  backup_req_cond.notify_one();
}

}  // namespace

bool others_held_up(const std::string &sender) {
  const std::int64_t waited = quarn_dbus_time_waited();
  const auto held_up = [&](const queued_request &request) {
    const bool others = request.client == nullptr || request.client->sender != sender;
    return others && waited - request.waited_before >= kLongestHoldUp;
  };
  const MutexLock lock(backup_req_list_mutex);
  return std::any_of(backup_req_list.begin(), backup_req_list.end(), held_up) ||
         std::any_of(cancelled_clients.begin(), cancelled_clients.end(), held_up);
}

void set_backup_end_observer(backup_end_observer observer) { end_observer = observer; }

void init_backup_req_dispatch_thread() {
  LOGI("init_backup_req_dispatch_thread");
  pthread_t worker = {};
  const int ret = pthread_create(&worker, nullptr, backup_req_dispatch_thread, nullptr);
  if (ret != 0) {
    LOGE("pthread_create() failed %d", ret);
    return;
  }
  pthread_detach(worker);
}

void request_backup(void *client) {
  ClientPtr record(static_cast<client_cb_data *>(client));
  {
    const MutexLock lock(backup_req_list_mutex);
    if (record == nullptr && std::exchange(automatic_outstanding, true)) {
      LOGI("auto backup is requested already");
      return;
    }
    ++outstanding_requests;
    PendingWork::begin();
    backup_req_list.push_back({std::move(record), quarn_dbus_time_waited()});
    ++waiting_entries;
  }
  wake_worker();
}

void cancel_backup(void *) {
  {
    // Before the transfers end: the run is to know why they did.
    const MutexLock lock(backup_req_list_mutex);
    running.cancelled = running.standing;
  }
  abort_transfers();
  {
    const MutexLock lock(backup_req_list_mutex);
    running.cancelled = running.standing || running.cancelled;  // taken from the queue meanwhile
    drop_reservations([](const client_cb_data &) { return true; });
  }
  wake_worker();
}

std::uint32_t cancel_backups_of(const std::string &sender) {
  std::uint32_t count = 0;
  bool runs = false;
  {
    const MutexLock lock(backup_req_list_mutex);
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
  const MutexLock lock(backup_req_list_mutex);
  return running.cancelled;
}

bool settle_running_backup() {
  const MutexLock lock(backup_req_list_mutex);
  running.standing = false;
  return running.cancelled;
}

bool backup_request_outstanding() { return outstanding_requests != 0; }
