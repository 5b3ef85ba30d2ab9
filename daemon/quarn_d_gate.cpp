#include "quarn_d_gate.h"

#include <deque>
#include <iterator>
#include <map>
#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "glib_handles.h"
#include "quarn_common.h"
#include "quarn_d_credentials.h"
#include "quarn_d_methods.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_log.h"
#include "thread_annotations.h"

namespace {

constexpr char kBusName[] = "org.freedesktop.DBus";
constexpr char kBusPath[] = "/org/freedesktop/DBus";
/** Milliseconds that the bus may take to tell who calls. */
constexpr int kBusTimeout = 5000;

/** A call that waits to know who makes it. */
struct waiting_call {
  explicit waiting_call(caller_work waiting) : work(std::move(waiting)) {}
  caller_work work;
  PendingWork pending;
};

// Never destroyed: the process may be left while other threads look.
Mutex &entries_mutex = *new Mutex;

/** What is known of one connection, and what waits to know it. But for the caller main thread. */
struct connection_entry {
  quarn_caller caller QUARN_GUARDED_BY(entries_mutex);
  bool asked = false;
  bool told = false;
  std::deque<waiting_call> waiting;
  GDBusConnection *connection = nullptr;
  guint subscription = 0;
  std::uint64_t age = 0;
};
using EntryPtr = std::shared_ptr<connection_entry>;

std::map<std::string, EntryPtr> &entries QUARN_GUARDED_BY(entries_mutex) =
    *new std::map<std::string, EntryPtr>;
std::uint64_t last_age = 0;
caller_source &source = *new caller_source;

/** What was refused to one caller since a moment. */
struct refusals {
  gint64 since = 0;
  unsigned int count = 0;
};
struct refusal_table {
  Mutex mutex;
  std::map<std::string, refusals> callers QUARN_GUARDED_BY(mutex);
};
refusal_table &refused = *new refusal_table;
gint64 (*refusal_clock)() = g_get_monotonic_time;

/** What one application has asked for since a moment. Main thread. */
struct accepted_requests {
  gint64 since = 0;
  unsigned int count = 0;
};
std::map<std::string, accepted_requests> &asking_callers =
    *new std::map<std::string, accepted_requests>;

/** The same for all connections of a caller, and no other's: nobody hides what others do. */
std::string name_of_caller(const quarn_caller &caller) {
  if (!caller.known) return "callers that are not known";
  const std::string user = "user " + std::to_string(caller.uid);
  return caller.label.empty() ? user : user + ", label " + caller.label;
}

void tell_left_out(const std::string &who, const refusals &of) {
  if (of.count <= kMostRefusalLines) return;
  LOGE("refused : %u more calls of %s", of.count - kMostRefusalLines, who.c_str());
}

/** Tell of what is over, so that no more is kept than callers that are refused now. */
void end_refusals(gint64 before) QUARN_REQUIRES(refused.mutex) {
  for (auto at = refused.callers.begin(); at != refused.callers.end();) {
    if (at->second.since > before) {
      ++at;
      continue;
    }
    tell_left_out(at->first, at->second);
    at = refused.callers.erase(at);
  }
}

/** Null for a connection that nothing is known of. */
EntryPtr find_entry(const std::string &sender) {
  const MutexLock lock(entries_mutex);
  const auto found = entries.find(sender);
  return found == entries.end() ? nullptr : found->second;
}

void drop(const std::string &sender) {
  EntryPtr dropped;
  {
    const MutexLock lock(entries_mutex);
    const auto found = entries.find(sender);
    if (found == entries.end()) return;
    dropped = std::move(found->second);
    entries.erase(found);
  }
  if (dropped->subscription != 0) {
    g_dbus_connection_signal_unsubscribe(dropped->connection, dropped->subscription);
  }
}

void on_left(GDBusConnection *, const gchar *, const gchar *, const gchar *, const gchar *,
             GVariant *parameters, gpointer) {
  if (g_variant_is_of_type(parameters, G_VARIANT_TYPE("(sss)")) == FALSE) return;
  const char *name = nullptr;
  const char *owner = nullptr;
  g_variant_get(parameters, "(&s&s&s)", &name, nullptr, &owner);
  if (*owner != '\0') return;
  const EntryPtr entry = find_entry(name);
  // Who has left while it is asked for is told of by the answer.
  if (entry != nullptr && entry->told) drop(name);
}

/** Of those that have nothing waiting the one that is known longest; none while there is room. */
std::optional<std::string> dispensable_entry() {
  const MutexLock lock(entries_mutex);
  if (entries.size() < kMostCallersKnown) return std::nullopt;
  const std::string *oldest = nullptr;
  std::uint64_t age = 0;
  for (const auto &[name, entry] : entries) {
    if (!entry->told || !entry->waiting.empty()) continue;
    if (oldest == nullptr || entry->age < age) {
      oldest = &name;
      age = entry->age;
    }
  }
  return oldest == nullptr ? std::nullopt : std::optional(*oldest);
}

EntryPtr entry_of(GDBusConnection *connection, const std::string &sender) {
  if (EntryPtr known = find_entry(sender)) return known;
  if (const std::optional<std::string> dispensable = dispensable_entry()) drop(*dispensable);
  auto entry = std::make_shared<connection_entry>();
  entry->age = ++last_age;
  entry->connection = connection;
  const MutexLock lock(entries_mutex);
  entries[sender] = entry;
  return entry;
}

void drain(const EntryPtr &entry) {
  quarn_caller caller;
  {
    const MutexLock lock(entries_mutex);
    caller = entry->caller;
  }
  while (!entry->waiting.empty()) {
    const caller_work work = std::move(entry->waiting.front().work);
    entry->waiting.pop_front();
    work(caller);
  }
}

/** Hear of a connection's end; after its answers, which nothing is to delay. */
void watch(const std::string &sender, const EntryPtr &entry) {
  if (entry->connection == nullptr || find_entry(sender) != entry) return;
  entry->subscription = g_dbus_connection_signal_subscribe(
      entry->connection, kBusName, kBusName, "NameOwnerChanged", kBusPath, sender.c_str(),
      G_DBUS_SIGNAL_FLAGS_NONE, on_left, nullptr, nullptr);
}

void take_answer(const std::string &sender, const EntryPtr &entry, const quarn_caller &caller) {
  {
    const MutexLock lock(entries_mutex);
    entry->caller = caller;
    entry->told = true;
  }
  drain(entry);
  if (caller.known) {
    watch(sender, entry);
  } else {
    drop(sender);  // it is asked for again, should it call again
  }
}

struct question {
  std::string sender;
  EntryPtr entry;
};

void on_credentials(GObject *bus, GAsyncResult *result, gpointer data) {
  const std::unique_ptr<question> asked(static_cast<question *>(data));
  GErrorPtr error;
  const GVariantPtr reply(
      g_dbus_connection_call_finish(G_DBUS_CONNECTION(bus), result, out(error)));
  if (!reply && tells_of_refusal({})) {
    LOGE("cannot get user of (%s) : %s", asked->sender.c_str(), error->message);
  }
  take_answer(asked->sender, asked->entry, reply ? read_credentials(reply.get()) : quarn_caller{});
}

void ask(GDBusConnection *connection, const std::string &sender, const EntryPtr &entry) {
  entry->asked = true;
  if (source) {
    source(sender,
           [sender, entry](const quarn_caller &caller) { take_answer(sender, entry, caller); });
    return;
  }
  g_dbus_connection_call(connection, kBusName, kBusPath, kBusName, "GetConnectionCredentials",
                         g_variant_new("(s)", sender.c_str()), G_VARIANT_TYPE("(a{sv})"),
                         G_DBUS_CALL_FLAGS_NONE, kBusTimeout, nullptr, on_credentials,
                         new question{sender, entry});
}

}  // namespace

void with_caller(GDBusConnection *connection, const std::string &sender, caller_work work) {
  const EntryPtr entry = entry_of(connection, sender);
  entry->waiting.emplace_back(std::move(work));
  if (entry->told) {
    drain(entry);
  } else if (!entry->asked) {
    ask(connection, sender, entry);
  }
}

bool callers_are_asked_for() {
  const MutexLock lock(entries_mutex);
  for (const auto &[sender, entry] : entries) {
    if (!entry->waiting.empty()) return true;
  }
  return false;
}

quarn_caller known_caller(const std::string &sender) {
  const MutexLock lock(entries_mutex);
  const auto found = entries.find(sender);
  return found == entries.end() ? quarn_caller{} : found->second->caller;
}

quarn_caller ask_caller_now(GDBusConnection *connection, const std::string &sender, int ms) {
  quarn_caller caller = known_caller(sender);
  if (caller.known) return caller;
  const GVariantPtr reply(g_dbus_connection_call_sync(
      connection, kBusName, kBusPath, kBusName, "GetConnectionCredentials",
      g_variant_new("(s)", sender.c_str()), G_VARIANT_TYPE("(a{sv})"), G_DBUS_CALL_FLAGS_NONE, ms,
      nullptr, nullptr));
  return reply ? read_credentials(reply.get()) : quarn_caller{};
}

quarn_subject subject_of_call(const std::string &interface_name, const std::string &member,
                              GVariant *arguments) {
  quarn_subject subject{interface_name, member, "", -1, false};
  if (interface_name != kQuarnInterface) return subject;
  const std::optional<quarn_arguments> given = read_quarn_arguments(member, arguments);
  if (!given) return subject;
  subject.client = given->client;
  subject.switches_on = given->on != 0;
  if (given->pkg_id != nullptr) subject.package = given->pkg_id;
  return subject;
}

caller_verdict judge_call(const quarn_caller &caller, const std::string &sender,
                          const quarn_subject &subject, bool cloud_mode) {
  caller_verdict verdict =
      may_call(caller, caller.uid == 0 ? kNoGroup : client_group(), subject, cloud_mode);
  if (!verdict.allowed && tells_of_refusal(caller)) {
    LOGE("refused : %s of (%s) : %s", subject.member.c_str(), sender.c_str(),
         verdict.reason.c_str());
  }
  return verdict;
}

std::string refusal_text(const quarn_subject &subject, const caller_verdict &verdict) {
  return subject.member + " is refused: " + verdict.reason;
}

bool tells_of_refusal(const quarn_caller &caller) {
  const MutexLock lock(refused.mutex);
  const gint64 now = refusal_clock();
  end_refusals(now - kRefusalPeriod);
  refusals &of =
      refused.callers.try_emplace(name_of_caller(caller), refusals{now, 0}).first->second;
  return ++of.count <= kMostRefusalLines;
}

bool count_request(const quarn_caller &caller) {
  if (caller.uid == 0 || kind_of_caller(caller, client_group()) == caller_kind::trusted)
    return true;
  const gint64 now = refusal_clock();
  for (auto at = asking_callers.begin(); at != asking_callers.end();) {
    at = at->second.since <= now - kRequestPeriod ? asking_callers.erase(at) : std::next(at);
  }
  accepted_requests &of =
      asking_callers.try_emplace(name_of_caller(caller), accepted_requests{now, 0}).first->second;
  if (of.count >= kMostRequestsOfPeriod) return false;
  ++of.count;
  return true;
}

void forget_callers() {
  {
    const MutexLock lock(refused.mutex);
    end_refusals(G_MAXINT64);
  }
  asking_callers.clear();
  std::map<std::string, EntryPtr> known;
  {
    const MutexLock lock(entries_mutex);
    known = entries;
  }
  for (const auto &[sender, entry] : known) drop(sender);
}

void set_caller_source(caller_source asked) { source = std::move(asked); }

void set_refusal_clock(gint64 (*clock)()) {
  refusal_clock = clock == nullptr ? g_get_monotonic_time : clock;
}
