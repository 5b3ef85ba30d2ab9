#include "quarn_dbus_server.h"

#include <fcntl.h>
#include <gio/gunixfdlist.h>
#include <glib.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "glib_handles.h"
#include "log_capture.h"
#include "quarn_common.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_credentials.h"
#include "quarn_d_end.h"
#include "quarn_d_gate.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_turn.h"
#include "quarn_d_utils/admission.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/pending_work.h"
#include "quarn_d_utils/power.h"
#include "quarn_dbus_calls.h"
#include "quarn_dbus_client.h"
#include "quarn_dbus_introspection.h"
#include "quarn_dbus_limits.h"
#include "run_until.h"
#include "scripted_client.h"
#include "temp_dir.h"

namespace {

using Texts = std::vector<std::string>;

/** What the dispatcher did, in order. */
Texts steps;
/** What handlers return. */
int result = 0;
/** Handlers are given this much to do before they return. */
std::function<void()> inside_handler;

int note(const std::string &step) {
  steps.push_back(step);
  if (inside_handler) inside_handler();
  return result;
}

using RecordPtr = std::unique_ptr<client_cb_data>;
/** Records of requests whose outcome is still to come; null: each ends with its handler. */
std::vector<RecordPtr> *kept_records = nullptr;

/** The record's content; the handler owns it. */
std::string take(void *record) {
  RecordPtr data(static_cast<client_cb_data *>(record));
  std::string text = data->sender + "#" + std::to_string(data->req_id);
  if (kept_records != nullptr) kept_records->push_back(std::move(data));
  return text;
}

std::string number(long long value) { return std::to_string(value); }

/* Failures of GDBus, told by the tests. */
bool fail_parse = false;
bool fail_own = false;

}  // namespace

extern "C" {
GDBusNodeInfo *__real_g_dbus_node_info_new_for_xml(const gchar *xml, GError **error);
GDBusNodeInfo *__wrap_g_dbus_node_info_new_for_xml(const gchar *xml, GError **error) {
  return __real_g_dbus_node_info_new_for_xml(fail_parse ? "<node" : xml, error);
}
guint __real_g_bus_own_name(GBusType type, const gchar *name, GBusNameOwnerFlags flags,
                            GBusAcquiredCallback bus, GBusNameAcquiredCallback acquired,
                            GBusNameLostCallback lost, gpointer data, GDestroyNotify free);
guint __wrap_g_bus_own_name(GBusType type, const gchar *name, GBusNameOwnerFlags flags,
                            GBusAcquiredCallback bus, GBusNameAcquiredCallback acquired,
                            GBusNameLostCallback lost, gpointer data, GDestroyNotify free) {
  if (fail_own) return 0;
  EXPECT_EQ(type, G_BUS_TYPE_SYSTEM);
  EXPECT_EQ(flags, G_BUS_NAME_OWNER_FLAGS_REPLACE);
  return __real_g_bus_own_name(type, name, flags, bus, acquired, lost, data, free);
}
}

bool cloud_mode = false;
bool cloud_restore_running() { return cloud_mode; }
bool is_idle_status() { return !quarnd_calls_unjudged(); }
void quarn_loop_quit() { steps.emplace_back("quit"); }
void init_last_backup_time() { note("init_last_backup_time"); }
void request_quarn_terminate(double delay, bool restart) {
  note("terminate " + number(static_cast<int>(delay)) + (restart ? " restart" : ""));
}
void cancel_quarn_terminate() { steps.emplace_back("cancel"); }
void hold_quarn_terminate() {}
void release_quarn_terminate() {}
int quarnd_backup_enable(int on) { return note("backup_enable " + number(on)); }
int quarnd_get_last_backed_up_time(unsigned long long *timestamp) {
  *timestamp = 0x8000000000000001ULL;
  return note("last_bu_time");
}
int quarnd_get_app_list(int client, void *record) {
  return note("get_app_list " + number(client) + " " + take(record));
}
int quarnd_manual_backup(void *record) { return note("manual_backup " + take(record)); }
int quarnd_manual_backup_cancel(void *record) {
  return note("manual_backup_cancel " + take(record));
}
int quarnd_backup_app_data(const char *pkg_id, void *record) {
  const int value = note(std::string("backup_app_data ") + take(record));
  // The text must have outlived whatever happened meanwhile.
  steps.push_back(pkg_id);
  return value;
}
int quarnd_restore_app_data(const char *pkg_id, void *record) {
  return note(std::string("restore_app_data ") + pkg_id + " " + take(record));
}
std::size_t waiting_in_export = 0;
int quarnd_make_app_data(const char *pkg_id, unsigned int client_uid,
                         const std::string &client_label) {
  waiting_in_export = waiting_requests();
  return note(std::string("make_app_data ") + pkg_id + " " + number(client_uid) +
              (client_label.empty() ? "" : " " + client_label));
}
int quarnd_restore_enable(int on, int client, const char *serial_num, const char *pkg_list,
                          void *record) {
  return note("restore_enable " + number(on) + " " + number(client) + " " + serial_num + " " +
              pkg_list + " " + take(record));
}

namespace {

bool acquired() { return count_logged(DLOG_INFO, "Acquired the name org.orvane.Quarn") > 0; }

class Server : public ::testing::Test {
 protected:
  void SetUp() override {
    private_bus_address();
    clear_captured_log();
    owner_id_ = quarnd_dbus_init();
    ASSERT_TRUE(run_until(acquired));
    client_ = std::make_unique<ScriptedClient>();
    steps.clear();
    result = 0;
    inside_handler = nullptr;
    kept_records = nullptr;
  }
  void TearDown() override {
    kept_records = nullptr;
    client_.reset();
    quarnd_dbus_deinit(owner_id_);
    run_pending();
  }
  /** Steps of a call after the cancelled timer. */
  static Texts after_cancel() {
    EXPECT_FALSE(steps.empty());
    if (steps.empty()) return {};
    EXPECT_EQ(steps.front(), "cancel");
    return {steps.begin() + 1, steps.end()};
  }
  /** "SENDER#ID" as make_record() should have filled it. */
  std::string id(unsigned int req_id) const { return client_->name() + "#" + number(req_id); }

  unsigned int owner_id_ = 0;
  std::unique_ptr<ScriptedClient> client_;
};

constexpr char kTooMany[] = "org.freedesktop.DBus.Error.LimitsExceeded";

/* ---- who may call ---- */

constexpr char kDenied[] = "org.freedesktop.DBus.Error.AccessDenied";
constexpr char kInvalid[] = "org.freedesktop.DBus.Error.InvalidArgs";
constexpr gid_t kGroup = 7001;

/** The bus tells what the test says, when the test says it. */
class Callers : public Server {
 protected:
  void SetUp() override {
    Server::SetUp();
    set_client_group(kGroup);
    set_caller_source([this](const std::string &, caller_work answer) {
      if (held_) {
        questions_.push_back(std::move(answer));
      } else {
        answer(told_);
      }
    });
    // What the test before has made known.
    forget_callers();
  }
  void TearDown() override {
    set_caller_source(nullptr);
    Server::TearDown();
  }
  static quarn_caller application(const std::string &label) { return {true, 5000, {5000}, label}; }

  quarn_caller told_;
  bool held_ = false;
  std::vector<caller_work> questions_;
};

const std::vector<std::pair<const char *, const char *>> kEverything = {
    {"set_activation", "(0,)"},
    {"backup_enable", "(1,)"},
    {"restore_enable", "(1, 0, '35', '[\"a\"]', uint32 1)"},
    {"restore_enable", "(0, 0, '', '', uint32 1)"},
    {"last_bu_time", "()"},
    {"get_app_list", "(0, uint32 1)"},
    {"auto_backup_start", "('',)"},
    {"manual_backup_start", "(uint32 1,)"},
    {"manual_backup_cancel", "(uint32 1,)"},
    {"app_data_backup_start", "('org.example.notes', uint32 1)"},
    {"app_data_restore_start", "('org.example.notes', uint32 1)"},
    {"make_app_data", "('org.example.notes',)"},
    {"fly", "('high',)"},
    {"fly", "()"},
    {"set_activation", "()"},
    {"set_activation", "('one',)"}};

TEST_F(Callers, WhoMayNothingIsRefusedEverythingAndTouchesOnlyThePendingEnd) {
  const quarn_caller strangers[] = {{true, 7001, {100}, ""},
                                    {true, 5000, {5000}, ""},
                                    {true, 5000, {5000}, "_"},
                                    {true, 7001, {100}, "org.example.notes"},
                                    {}};
  for (const quarn_caller &stranger : strangers) {
    told_ = stranger;
    forget_callers();
    for (const auto &[method, arguments] : kEverything) {
      steps.clear();
      clear_captured_log();
      const CallOutcome outcome = client_->call(method, arguments);
      EXPECT_EQ(outcome.error_name, kDenied) << method << arguments << stranger.label;
      EXPECT_EQ(steps, Texts{"cancel"}) << method << arguments;
      EXPECT_EQ(captured_log().size(), 1U) << "one line";
      EXPECT_EQ(captured_log().front().text.rfind(
                    "refused : " + std::string(method) + " of (" + client_->name() + ") : ", 0),
                0U);
    }
    for (const char *interface : {"org.freedesktop.DBus.Introspectable", "org.example.Other",
                                  "org.freedesktop.DBus.Peer", "org.freedesktop.DBus.Properties"}) {
      steps.clear();
      EXPECT_EQ(client_->call("Introspect", "()", interface).error_name, kDenied) << interface;
      EXPECT_TRUE(steps.empty());
    }
  }
}

TEST_F(Callers, AnApplicationAsksForItsOwnPackageAndNoOther) {
  told_ = application("org.example.notes");
  for (const char *method : {"app_data_backup_start", "app_data_restore_start"}) {
    EXPECT_EQ(client_->call(method, "('org.example.notes', uint32 1)").reply, "(0,)");
    steps.clear();
    EXPECT_EQ(client_->call(method, "('org.example.other', uint32 1)").error_name, kDenied);
    EXPECT_EQ(steps, Texts{"cancel"});
  }
  EXPECT_EQ(client_->call("make_app_data", "('org.example.notes',)").reply, "(0,)");
  EXPECT_EQ(steps.back(), "make_app_data org.example.notes 5000 org.example.notes")
      << "and the archive is its own";
  const CallOutcome refused = client_->call("make_app_data", "('org.example.other',)");
  EXPECT_EQ(refused.error_name, kDenied);
  EXPECT_EQ(refused.error_text,
            "make_app_data is refused: an application may ask for its own package only");
  EXPECT_EQ(client_->call("backup_enable", "(0,)").error_text,
            "backup_enable is refused: it is for root and the group quarn");
}

TEST_F(Callers, TheCompanionAsksForItsListAndItsRestoreMode) {
  told_ = application("com.velmor.pellix-efl");
  EXPECT_EQ(client_->call("get_app_list", "(1, uint32 1)").reply, "(0,)");
  EXPECT_EQ(client_->call("get_app_list", "(0, uint32 1)").error_name, kDenied);
  EXPECT_EQ(client_->call("restore_enable", "(1, 1, '', '[]', uint32 1)").reply, "(0,)");
  EXPECT_EQ(client_->call("restore_enable", "(1, 0, '', '[]', uint32 1)").error_name, kDenied);
  EXPECT_EQ(client_->call("restore_enable", "(0, 1, '', '', uint32 1)").reply, "(0,)");
  cloud_mode = true;
  EXPECT_EQ(client_->call("restore_enable", "(0, 1, '', '', uint32 1)").error_name, kDenied);
  cloud_mode = false;
  EXPECT_EQ(client_->call("manual_backup_start", "(uint32 1,)").error_name, kDenied);
}

TEST_F(Callers, AMemberOfTheGroupMayEverything) {
  told_ = {true, 7001, {100, kGroup}, ""};
  for (const auto &[method, arguments] : kEverything) {
    EXPECT_NE(client_->call(method, arguments).error_name, kDenied) << method;
  }
  EXPECT_NE(client_->call("Introspect", "()", "org.freedesktop.DBus.Introspectable").reply, "");
}

TEST_F(Callers, CallsThatWaitForTheAnswerKeepTheirOrderAndHoldUpNobody) {
  held_ = true;
  const char *const methods[] = {"backup_enable", "fly", "backup_enable"};
  std::vector<std::shared_ptr<CallOutcome>> outcomes;
  for (std::size_t i = 0; i < std::size(methods); ++i) {
    outcomes.push_back(std::make_shared<CallOutcome>());
    client_->start_call(methods[i], i == 1 ? "()" : "(" + number(static_cast<int>(i)) + ",)",
                        outcomes.back());
  }
  EXPECT_TRUE(run_until([this] { return !questions_.empty(); }));
  EXPECT_TRUE(quarnd_calls_unjudged());
  EXPECT_TRUE(PendingWork::any());
  held_ = false;
  told_ = {true, 0, {}, ""};
  ScriptedClient other;
  EXPECT_EQ(other.call("set_activation", "(1,)").reply, "(0,)");
  EXPECT_EQ(questions_.size(), 1U);
  steps.clear();
  questions_.front()({true, 0, {}, ""});
  EXPECT_TRUE(run_until([&] { return outcomes.back()->finished; }));
  EXPECT_EQ(steps, (Texts{"cancel", "backup_enable 0", "cancel", "cancel", "backup_enable 2"}));
  EXPECT_FALSE(quarnd_calls_unjudged());
  EXPECT_FALSE(PendingWork::any());
}

gboolean run_work(gpointer work) {
  (*static_cast<std::function<void()> *>(work))();
  return G_SOURCE_REMOVE;
}

TEST_F(Callers, LeavingWaitsForTheAnswerAndServesWhatHadArrived) {
  held_ = true;
  const auto outcome = std::make_shared<CallOutcome>();
  client_->start_call("backup_enable", "(1,)", outcome);
  EXPECT_TRUE(run_until([this] { return !questions_.empty(); }));
  std::function<void()> answer = [this] { questions_.front()({true, 0, {}, ""}); };
  g_timeout_add(50, run_work, &answer);
  quarnd_dbus_leave();
  EXPECT_EQ(steps, (Texts{"cancel", "backup_enable 1"}));
  EXPECT_TRUE(run_until([&] { return outcome->finished; }));
  EXPECT_EQ(outcome->reply, "(0,)");
}

constexpr uid_t kMember = 7001;

/** Callers that ask from one connection after the other, for what waits. */
class Askers {
 public:
  Askers() { kept_records = &records_; }
  ~Askers() { kept_records = nullptr; }
  Askers(const Askers &) = delete;
  Askers &operator=(const Askers &) = delete;

  /** @return how many requests were accepted before one was refused for their number */
  std::size_t ask(const char *method, const std::string &arguments) {
    constexpr std::size_t kOfAConnection = 48;
    for (std::size_t count = 0;; ++count) {
      if (count % kOfAConnection == 0) clients_.push_back(std::make_unique<ScriptedClient>());
      const CallOutcome outcome = clients_.back()->call(method, arguments);
      if (outcome.error_name == kTooMany) return count;
      EXPECT_EQ(outcome.reply, "(0,)") << outcome.error_name;
      if (outcome.reply != "(0,)") return count;
    }
  }
  std::size_t waiting() const { return records_.size(); }

 private:
  std::vector<RecordPtr> records_;
  std::vector<std::unique_ptr<ScriptedClient>> clients_;
};

TEST_F(Callers, OneApplicationOrUserFillsNoMoreThanACallersPlacesWithManyConnections) {
  Askers askers;
  told_ = application("org.example.a");
  EXPECT_EQ(askers.ask("app_data_backup_start", "('org.example.a', uint32 1)"),
            kMaxWaitingOfCaller);
  told_ = {true, kMember, {kGroup}, "User"};
  EXPECT_EQ(askers.ask("manual_backup_start", "(uint32 1,)"), kMaxWaitingOfCaller);
  told_ = {true, kMember + 1, {kGroup}, "User"};
  EXPECT_EQ(askers.ask("manual_backup_start", "(uint32 1,)"), kMaxWaitingOfCaller)
      << "a label that many users have bounds none of them";
}

TEST_F(Callers, RootIsServedWhoeverElseHasFilledTheirPlaces) {
  Askers askers;
  for (char letter = 'a'; letter <= 'd'; ++letter) {
    const std::string package = std::string("org.example.") + letter;
    told_ = application(package);
    EXPECT_EQ(askers.ask("app_data_backup_start", "('" + package + "', uint32 1)"),
              kMaxWaitingOfCaller);
  }
  told_ = application("org.example.e");
  EXPECT_EQ(askers.ask("app_data_backup_start", "('org.example.e', uint32 1)"), 0U)
      << "all applications together";
  for (uid_t user = kMember; user < kMember + 3; ++user) {
    told_ = {true, user, {kGroup}, ""};
    EXPECT_EQ(askers.ask("manual_backup_start", "(uint32 1,)"), kMaxWaitingOfCaller);
  }
  told_ = {true, kMember + 3, {kGroup}, ""};
  EXPECT_EQ(askers.ask("manual_backup_start", "(uint32 1,)"), 0U) << "all but root together";
  EXPECT_EQ(askers.waiting(), kMaxWaitingOfOthers);
  told_ = {true, 0, {}, ""};
  EXPECT_EQ(askers.ask("manual_backup_start", "(uint32 1,)"), kMaxWaiting - kMaxWaitingOfOthers);
}

TEST_F(Callers, AnApplicationsExportIsForItsLabelAlone) {
  const auto exported_for = [this](const quarn_caller &caller) {
    told_ = caller;
    steps.clear();
    ScriptedClient connection;
    EXPECT_EQ(connection.call("make_app_data", "('org.example.a',)").reply, "(0,)");
    return steps.back();
  };
  EXPECT_EQ(exported_for(application("org.example.a")),
            "make_app_data org.example.a 5000 org.example.a");
  EXPECT_EQ(exported_for({true, kMember, {kGroup}, "User"}), "make_app_data org.example.a 7001");
  EXPECT_EQ(exported_for({true, 0, {}, "System"}), "make_app_data org.example.a 0");
}

gint64 minute_clock = 0;

TEST_F(Callers, AnApplicationMayAskSoOftenInAMinuteAndOthersAsEver) {
  minute_clock = g_get_monotonic_time();
  set_refusal_clock([] { return minute_clock; });
  const auto ask = [this](const quarn_caller &caller) {
    told_ = caller;
    ScriptedClient connection;
    return connection.call("app_data_backup_start", "('" + caller.label + "', uint32 1)");
  };
  for (unsigned int i = 0; i < kMostRequestsOfPeriod; ++i) {
    ASSERT_EQ(ask(application("org.example.a")).reply, "(0,)") << i;
  }
  steps.clear();
  captured_log().clear();
  const CallOutcome beyond = ask(application("org.example.a"));
  EXPECT_EQ(beyond.error_name, kTooMany);
  EXPECT_EQ(beyond.error_text, "Too many requests within a minute");
  EXPECT_EQ(steps, Texts{"cancel"}) << "nothing is made of it";
  EXPECT_EQ(ask(application("org.example.b")).reply, "(0,)");
  const quarn_caller member{true, kMember, {kGroup}, "User"};
  for (unsigned int i = 0; i <= kMostRequestsOfPeriod; ++i) {
    ASSERT_EQ(ask(member).reply, "(0,)") << i;
  }
  minute_clock += kRequestPeriod;
  EXPECT_EQ(ask(application("org.example.a")).reply, "(0,)");
  set_refusal_clock(nullptr);
}

TEST_F(Callers, ListsAndNamesAreBoundedBeforeARecordIsMade) {
  told_ = {true, 0, {}, ""};
  const auto list = [](std::size_t packages) {
    std::string text = "[\"a\"";
    for (std::size_t i = 1; i < packages; ++i) text += ",\"a\"";
    return "(1, 0, '35', '" + text + "]', uint32 1)";
  };
  EXPECT_EQ(client_->call("restore_enable", list(kMostCandidates)).reply, "(0,)");
  steps.clear();
  CallOutcome outcome = client_->call("restore_enable", list(kMostCandidates + 1));
  EXPECT_EQ(outcome.error_name, kInvalid);
  EXPECT_EQ(outcome.error_text, "pkg_list has more than 4096 packages");
  const std::string long_id(kMostListBytes, 'a');
  outcome = client_->call("restore_enable", "(1, 0, '35', '[\"" + long_id + "\"]', uint32 1)");
  EXPECT_EQ(outcome.error_text, "pkg_list has more than 262144 bytes");
  const std::string name(kMostNameBytes + 1, 'a');
  outcome = client_->call("restore_enable", "(1, 0, '" + name + "', '[]', uint32 1)");
  EXPECT_EQ(outcome.error_text, "serial_num has more than 255 bytes");
  for (const char *method : {"app_data_backup_start", "app_data_restore_start"}) {
    outcome = client_->call(method, "('" + name + "', uint32 1)");
    EXPECT_EQ(outcome.error_text, "pkg_id has more than 255 bytes");
  }
  outcome = client_->call("make_app_data", "('" + name + "',)");
  EXPECT_EQ(outcome.error_name, kInvalid);
  EXPECT_EQ(steps, Texts(6, "cancel"));
}

TEST_F(Callers, ArgumentsThatNobodyWouldReadAreNotKept) {
  told_ = {true, 0, {}, ""};
  const std::string large(kMostArgumentBytes, 'a');
  const std::string list(kMostListArgumentBytes, 'a');
  for (const char *interface : {"org.orvane.Quarn", "org.example.Other"}) {
    const CallOutcome outcome = client_->call("auto_backup_start", "('" + large + "',)", interface);
    EXPECT_EQ(outcome.error_name, kInvalid);
    EXPECT_EQ(outcome.error_text, "The arguments are too large");
  }
  EXPECT_EQ(client_->call("restore_enable", "(1, 0, '', '" + list + "', uint32 1)").error_text,
            "The arguments are too large");
  EXPECT_EQ(count_logged(DLOG_ERROR, "refused : restore_enable of (" + client_->name() +
                                         ") : The arguments are too large"),
            1);
  told_ = application("");
  ScriptedClient stranger;
  EXPECT_EQ(stranger.call("auto_backup_start", "('" + large + "',)").error_name, kDenied);
}

constexpr std::size_t kManyCalls = 2000;

/** So many calls that want no answer; all have left when this returns. */
void send_calls(ScriptedClient &client, std::size_t count) {
  for (std::size_t i = 0; i < count; ++i) {
    GDBusMessage *message = g_dbus_message_new_method_call("org.orvane.Quarn", kQuarnObjectPath,
                                                           kQuarnInterface, "backup_enable");
    g_dbus_message_set_flags(message, G_DBUS_MESSAGE_FLAGS_NO_REPLY_EXPECTED);
    g_dbus_message_set_body(message, g_variant_new("(i)", 1));
    g_dbus_connection_send_message(client.connection(), message, G_DBUS_SEND_MESSAGE_FLAGS_NONE,
                                   nullptr, nullptr);
    g_object_unref(message);
  }
  client.call_bus("GetId");
}

int told_of_too_many(const ScriptedClient &client) {
  return count_logged(DLOG_ERROR, "refused : too many calls of (" + client.name() + ") wait");
}

TEST_F(Callers, CallsThatNobodyHasLookedAtAreBoundedForAConnectionAndForAll) {
  held_ = true;
  std::vector<std::unique_ptr<ScriptedClient>> clients;
  for (std::size_t i = 0; i < kMostBytesOfConnections / kMostBytesOfConnection; ++i) {
    clients.push_back(std::make_unique<ScriptedClient>());
    send_calls(*clients.back(), kManyCalls);
    EXPECT_TRUE(run_until([&] { return told_of_too_many(*clients.back()) == 1; }));
  }
  EXPECT_TRUE(run_until([&] { return questions_.size() == clients.size(); }));
  const auto answered = [](const std::shared_ptr<CallOutcome> &outcome) {
    return run_until([&] { return outcome->finished; });
  };
  const auto one_more = std::make_shared<CallOutcome>();
  clients.front()->start_call("backup_enable", "(1,)", one_more);
  EXPECT_TRUE(answered(one_more));
  EXPECT_EQ(one_more->error_name, kTooMany);
  EXPECT_EQ(one_more->error_text, "Too many calls are waiting");
  EXPECT_EQ(told_of_too_many(*clients.front()), 1) << "told once, not for each";

  std::vector<std::shared_ptr<CallOutcome>> late;
  for (std::size_t i = 0; i <= kCallsAlwaysTaken; ++i) {
    late.push_back(std::make_shared<CallOutcome>());
    client_->start_call("backup_enable", "(1,)", late.back());
  }
  EXPECT_TRUE(answered(late.back()));
  EXPECT_EQ(late.back()->error_name, kTooMany);
  EXPECT_FALSE(late.front()->finished) << "a few are taken whatever others send";

  steps.clear();
  for (std::size_t i = 0; i < questions_.size(); ++i) questions_[i]({true, 5000, {kGroup}, ""});
  EXPECT_TRUE(answered(late.front()));
  EXPECT_EQ(late.front()->reply, "(0,)");
  const auto served = static_cast<std::size_t>(
      std::count(steps.begin(), steps.end(), std::string("backup_enable 1")));
  EXPECT_GT(served, kManyCalls / 2);
  EXPECT_LT(served * 2048, kMostBytesOfConnections + 2048 * (kCallsAlwaysTaken + 1));
  EXPECT_EQ(clients.front()->call("backup_enable", "(1,)").reply, "(0,)") << "there is room again";
}

/** How many descriptors of this process lead to @p target. */
int descriptors_of(const std::string &target) {
  int count = 0;
  for (const auto &entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code gone;
    if (std::filesystem::read_symlink(entry, gone).string().find(target) != std::string::npos) {
      ++count;
    }
  }
  return count;
}

TEST_F(Callers, DescriptorsThatComeWithACallAreClosedBeforeItIsLookedAt) {
  held_ = true;
  const int descriptor = memfd_create("brought", MFD_CLOEXEC);
  ASSERT_GE(descriptor, 0);
  for (const char *method : {"make_app_data", "fly"}) {
    GDBusMessage *message = g_dbus_message_new_method_call("org.orvane.Quarn", kQuarnObjectPath,
                                                           kQuarnInterface, method);
    g_dbus_message_set_body(message, g_variant_new("(s)", "org.example.notes"));
    GUnixFDList *list = g_unix_fd_list_new();
    g_unix_fd_list_append(list, descriptor, nullptr);
    g_dbus_message_set_unix_fd_list(message, list);
    g_dbus_connection_send_message(client_->connection(), message, G_DBUS_SEND_MESSAGE_FLAGS_NONE,
                                   nullptr, nullptr);
    g_object_unref(list);
    g_object_unref(message);
  }
  // The answer to what comes last tells that all of it has come.
  client_->call_bus("GetId");
  EXPECT_TRUE(run_until([this] { return !questions_.empty(); }));
  EXPECT_TRUE(run_until([] { return descriptors_of("brought") == 1; }));
  const auto last = std::make_shared<CallOutcome>();
  client_->start_call("last_bu_time", "()", last);
  questions_.front()({true, 0, {}, ""});
  EXPECT_TRUE(run_until([&] { return last->finished; }));
  EXPECT_EQ(steps.front(), "cancel");
  EXPECT_EQ(steps[1], "make_app_data org.example.notes 0") << "the call itself is served";
  close(descriptor);
}

TEST(Elements, AreCountedWithoutParsingAndNeverTooFew) {
  EXPECT_EQ(most_elements_of(""), 1U);
  EXPECT_EQ(most_elements_of("[\"a\",\"b\"]"), 2U);
  EXPECT_EQ(most_elements_of("[\"a,b\",\"c\\\",d\",\"e\"]"), 3U);
  EXPECT_EQ(most_elements_of("[\"a\\"), 1U);
}

/* ---- what it dispatches ---- */

TEST_F(Server, StartLogsItsSteps) {
  bool called = false;
  for (const LogLine &line : captured_log()) {
    called = called || (line.buffer == LOG_ID_SYSTEM && line.text == ">>>>>>>> called");
  }
  EXPECT_TRUE(called);
  EXPECT_EQ(count_logged(DLOG_INFO, "g_dbus_connection_register_object() succeed"), 1);
}

TEST_F(Server, SetActivationOneRepliesZeroAndDoesNotTerminate) {
  EXPECT_EQ(client_->call("set_activation", "(1,)").reply, "(0,)");
  EXPECT_EQ(steps, Texts{"cancel"});
  EXPECT_EQ(count_logged(DLOG_INFO, "quarn activated successfully!"), 1);
}

TEST_F(Server, SetActivationZeroForgetsTheLastBackupThenTerminates) {
  EXPECT_EQ(client_->call("set_activation", "(0,)").reply, "(0,)");
  EXPECT_EQ(after_cancel(), (Texts{"init_last_backup_time", "terminate 0"}));
  EXPECT_EQ(count_logged(DLOG_INFO, "try to terminate quarn"), 1);
}

TEST_F(Server, BackupEnableAnswersTheHandlersResult) {
  result = 5;
  EXPECT_EQ(client_->call("backup_enable", "(-3,)").reply, "(5,)");
  EXPECT_EQ(after_cancel(), Texts{"backup_enable -3"});
}

TEST_F(Server, RestoreEnablePassesAllArgumentsAndARecord) {
  result = 36;
  EXPECT_EQ(client_->call("restore_enable", "(1, 0, '35', '[\"a\"]', uint32 4294967295)").reply,
            "(36,)");
  EXPECT_EQ(after_cancel(), Texts{"restore_enable 1 0 35 [\"a\"] " + id(4294967295u)});
}

TEST_F(Server, LastBackupTimeIsASixtyFourBitUnsignedValue) {
  const CallOutcome outcome = client_->call("last_bu_time", "()");
  EXPECT_EQ(outcome.reply, "(9223372036854775809,)");
  EXPECT_EQ(after_cancel(), Texts{"last_bu_time"});
}

TEST_F(Server, GetAppListPassesTheClientKind) {
  result = 1;
  EXPECT_EQ(client_->call("get_app_list", "(-1, uint32 9)").reply, "(1,)");
  EXPECT_EQ(after_cancel(), Texts{"get_app_list -1 " + id(9)});
}

TEST_F(Server, AutoBackupStartIsAnsweredEmptyAndStartsNothing) {
  EXPECT_EQ(client_->call("auto_backup_start", "('now',)").reply, "()");
  EXPECT_EQ(steps, Texts{"cancel"});
}

TEST_F(Server, ManualBackupStartPassesARecord) {
  EXPECT_EQ(client_->call("manual_backup_start", "(uint32 11,)").reply, "(0,)");
  EXPECT_EQ(after_cancel(), Texts{"manual_backup " + id(11)});
}

TEST_F(Server, ManualBackupCancelPassesARecord) {
  EXPECT_EQ(client_->call("manual_backup_cancel", "(uint32 12,)").reply, "(0,)");
  EXPECT_EQ(after_cancel(), Texts{"manual_backup_cancel " + id(12)});
}

TEST_F(Server, AppDataBackupStartPassesPackageAndRecord) {
  result = 1;
  EXPECT_EQ(client_->call("app_data_backup_start", "('org.example.notes', uint32 13)").reply,
            "(1,)");
  EXPECT_EQ(after_cancel(), (Texts{"backup_app_data " + id(13), "org.example.notes"}));
}

TEST_F(Server, AppDataRestoreStartPassesPackageAndRecord) {
  EXPECT_EQ(client_->call("app_data_restore_start", "('org.example.notes', uint32 14)").reply,
            "(0,)");
  EXPECT_EQ(after_cancel(), Texts{"restore_app_data org.example.notes " + id(14)});
}

TEST_F(Server, MakeAppDataIsToldTheCallersUser) {
  result = 36;
  EXPECT_EQ(client_->call("make_app_data", "('org.example.notes',)").reply, "(36,)");
  EXPECT_EQ(after_cancel(), Texts{"make_app_data org.example.notes " + number(getuid())});
}

TEST_F(Server, CallsAreServedWhileAHandlerWaitsInANestedLoop) {
  bool first = true;
  const auto second = std::make_shared<CallOutcome>();
  inside_handler = [&] {
    if (!first) return;
    first = false;
    client_->start_call("set_activation", "(1,)", second);
    EXPECT_TRUE(run_until([&] { return second->finished; }));
  };
  EXPECT_EQ(client_->call("app_data_backup_start", "('org.example.notes', uint32 1)").reply,
            "(0,)");
  EXPECT_EQ(second->reply, "(0,)");
  EXPECT_EQ(steps, (Texts{"cancel", "backup_app_data " + id(1), "cancel", "org.example.notes"}));
}

TEST_F(Server, EachCallIsAnsweredWhenItsOwnEventComes) {
  constexpr std::size_t kCalls = 3;
  std::vector<GMainLoopPtr> marks;
  inside_handler = [&marks] {
    marks.emplace_back(new_wait_loop());
    run_nested_loop(marks.back().get());
  };
  std::vector<std::shared_ptr<CallOutcome>> outcomes;
  for (std::size_t i = 0; i < kCalls; ++i) {
    outcomes.push_back(std::make_shared<CallOutcome>());
    client_->start_call("app_data_backup_start", "('org.example.notes', uint32 1)", outcomes[i]);
    ASSERT_TRUE(run_until([&] { return marks.size() == i + 1; }));
  }
  for (const std::size_t answered : {1U, 0U, 2U}) {
    EXPECT_FALSE(outcomes[answered]->finished);
    g_main_loop_quit(marks[answered].get());
    EXPECT_TRUE(run_until([&] { return outcomes[answered]->finished; })) << answered;
    EXPECT_EQ(outcomes[answered]->reply, "(0,)");
  }
}

/** Every request that waits, and its arguments. */
const std::vector<std::pair<const char *, const char *>> kWaiting = {
    {"manual_backup_start", "(uint32 1,)"},
    {"app_data_backup_start", "('org.example.notes', uint32 1)"},
    {"app_data_restore_start", "('org.example.notes', uint32 1)"},
    {"get_app_list", "(0, uint32 1)"},
    {"restore_enable", "(1, 0, '35', '[\"a\"]', uint32 1)"}};

TEST_F(Server, OneCallerMayHaveSixtyFourRequestsWaiting) {
  std::vector<RecordPtr> records;
  kept_records = &records;
  for (std::size_t i = 0; i < kMaxWaitingOfCaller; ++i) {
    const auto &[method, arguments] = kWaiting[i % kWaiting.size()];
    ASSERT_EQ(client_->call(method, arguments).reply, "(0,)") << i;
  }
  for (const auto &[method, arguments] : kWaiting) {
    steps.clear();
    EXPECT_EQ(client_->call(method, arguments).error_name, kTooMany) << method;
    EXPECT_EQ(steps, Texts{"cancel"}) << "the end is put off all the same";
  }
  EXPECT_EQ(records.size(), kMaxWaitingOfCaller) << "no record is made";
  EXPECT_EQ(client_->call("make_app_data", "('org.example.notes',)").error_name, kTooMany);
  // What ends waiting, or never waits, is served.
  EXPECT_EQ(client_->call("manual_backup_cancel", "(uint32 1,)").reply, "(0,)");
  EXPECT_EQ(client_->call("restore_enable", "(0, 0, '', '', uint32 1)").reply, "(0,)");
  EXPECT_EQ(client_->call("set_activation", "(1,)").reply, "(0,)");
  ScriptedClient other;
  EXPECT_EQ(other.call("manual_backup_start", "(uint32 1,)").reply, "(0,)");
  records.erase(records.begin());
  EXPECT_EQ(client_->call("manual_backup_start", "(uint32 1,)").reply, "(0,)");
  EXPECT_EQ(client_->call("manual_backup_start", "(uint32 1,)").error_name, kTooMany);
}

TEST_F(Server, AnExportCountsAsWaitingAsLongAsItLasts) {
  EXPECT_EQ(client_->call("make_app_data", "('org.example.notes',)").reply, "(0,)");
  EXPECT_EQ(waiting_in_export, 1U);
  EXPECT_EQ(waiting_requests(), 0U);
}

TEST_F(Server, AllCallersTogetherMayHaveFiveHundredAndTwelveRequestsWaiting) {
  std::vector<RecordPtr> records;
  kept_records = &records;
  std::vector<std::unique_ptr<ScriptedClient>> clients;
  for (std::size_t i = 0; i < kMaxWaiting; ++i) {
    if (i % kMaxWaitingOfCaller == 0) clients.push_back(std::make_unique<ScriptedClient>());
    ASSERT_EQ(clients.back()->call("manual_backup_start", "(uint32 1,)").reply, "(0,)") << i;
  }
  EXPECT_EQ(client_->call("manual_backup_start", "(uint32 1,)").error_name, kTooMany);
  records.pop_back();
  EXPECT_EQ(client_->call("manual_backup_start", "(uint32 1,)").reply, "(0,)");
}

TEST_F(Server, UnknownMethodIsAnErrorAndCancelsTheTerminateTimer) {
  const CallOutcome outcome = client_->call("fly", "('high', 3)");
  EXPECT_EQ(outcome.reply, "");
  EXPECT_EQ(outcome.error_name, "org.freedesktop.DBus.Error.UnknownMethod");
  EXPECT_EQ(outcome.error_text, "Method fly is not implemented on interface org.orvane.Quarn");
  EXPECT_EQ(steps, Texts{"cancel"});
}

TEST_F(Server, UnknownMethodWithoutArgumentsIsTheSameError) {
  EXPECT_EQ(client_->call("fly", "()").error_text,
            "Method fly is not implemented on interface org.orvane.Quarn");
}

TEST_F(Server, MissingArgumentsAreAnsweredMinusOneWithoutAHandler) {
  for (const char *method : {"set_activation", "backup_enable", "restore_enable", "get_app_list",
                             "manual_backup_start", "manual_backup_cancel", "app_data_backup_start",
                             "app_data_restore_start", "make_app_data"}) {
    steps.clear();
    EXPECT_EQ(client_->call(method, "()").reply, "(-1,)") << method;
    EXPECT_EQ(steps, Texts{"cancel"}) << method;
  }
}

TEST_F(Server, AutoBackupStartWithoutItsArgumentIsAnsweredEmptyToo) {
  EXPECT_EQ(client_->call("auto_backup_start", "()").reply, "()");
  EXPECT_EQ(steps, Texts{"cancel"});
}

TEST_F(Server, OtherArgumentsThanThoseOfTheInterfaceAreRefusedAndCancelTheTimer) {
  for (const char *arguments : {"('one',)", "(1, 2)"}) {
    steps.clear();
    const CallOutcome outcome = client_->call("set_activation", arguments);
    EXPECT_EQ(outcome.error_name, "org.freedesktop.DBus.Error.InvalidArgs") << arguments;
    EXPECT_TRUE(run_until([] { return !steps.empty(); }));
    EXPECT_EQ(steps, Texts{"cancel"});
  }
}

TEST_F(Server, CallThatWantsNoReplyGetsNone) {
  GDBusMessage *message =
      g_dbus_message_new_method_call("org.orvane.Quarn", kQuarnObjectPath, kQuarnInterface, "fly");
  g_dbus_message_set_flags(message, G_DBUS_MESSAGE_FLAGS_NO_REPLY_EXPECTED);
  g_dbus_connection_send_message(client_->connection(), message, G_DBUS_SEND_MESSAGE_FLAGS_NONE,
                                 nullptr, nullptr);
  g_object_unref(message);
  EXPECT_TRUE(run_until([] { return !steps.empty(); }));
  EXPECT_EQ(steps, Texts{"cancel"});
}

TEST_F(Server, CallsAreAnsweredInTheOrderInWhichTheyCame) {
  const auto known = std::make_shared<CallOutcome>();
  const auto missing = std::make_shared<CallOutcome>();
  const auto last = std::make_shared<CallOutcome>();
  client_->start_call("backup_enable", "(1,)", known);
  client_->start_call("fly", "()", missing);
  client_->start_call("backup_enable", "(2,)", last);
  EXPECT_TRUE(run_until([&] { return last->finished; }));
  EXPECT_TRUE(known->finished);
  EXPECT_TRUE(missing->finished);
  EXPECT_EQ(steps, (Texts{"cancel", "backup_enable 1", "cancel", "cancel", "backup_enable 2"}));
}

TEST_F(Server, OtherInterfacesAreLeftToTheBusLibrary) {
  const CallOutcome outcome =
      client_->call("Introspect", "()", "org.freedesktop.DBus.Introspectable");
  EXPECT_NE(outcome.reply.find("org.orvane.Quarn"), std::string::npos);
  EXPECT_TRUE(steps.empty());
  EXPECT_EQ(client_->call("fly", "()", "org.example.Other").error_name,
            "org.freedesktop.DBus.Error.UnknownMethod");
  EXPECT_TRUE(steps.empty());
}

TEST_F(Server, AnswersAreOnTheirWayWhenTheNameIsGivenUp) {
  const auto outcome = std::make_shared<CallOutcome>();
  inside_handler = nullptr;
  client_->start_call("manual_backup_start", "(uint32 1,)", outcome);
  EXPECT_TRUE(run_until([] { return steps.size() == 2; }));
  quarnd_dbus_deinit(owner_id_);
  EXPECT_TRUE(run_until([&] { return outcome->finished; }));
  EXPECT_EQ(outcome->reply, "(0,)");
  const CallOutcome after = client_->call("set_activation", "(1,)");
  EXPECT_EQ(after.error_name, "org.freedesktop.DBus.Error.ServiceUnknown");
  owner_id_ = quarnd_dbus_init();
  clear_captured_log();
  EXPECT_TRUE(run_until(acquired));
}

/* ---- an earlier process that still works ---- */

/** Holds the lock for which the process under test waits, until it is told to go. */
class EarlierProcess {
 public:
  EarlierProcess() {
    int ready[2];
    EXPECT_EQ(pipe2(ready, O_CLOEXEC), 0);
    EXPECT_EQ(pipe2(hold_, O_CLOEXEC), 0);
    pid_ = fork();
    if (pid_ == 0) {
      close(hold_[1]);
      begin_quarn_turn(lock().c_str(), nullptr, nullptr);
      char byte = 'R';
      if (write(ready[1], &byte, 1) == 1) static_cast<void>(!read(hold_[0], &byte, 1));
      _exit(0);
    }
    char byte = 0;
    EXPECT_EQ(read(ready[0], &byte, 1), 1);
    close(ready[0]);
    close(ready[1]);
    close(hold_[0]);
    begin_quarn_turn(lock_.c_str(), nullptr, quarnd_dispatch_deferred);
    EXPECT_FALSE(is_quarn_turn());
  }
  ~EarlierProcess() { end(); }
  EarlierProcess(const EarlierProcess &) = delete;
  EarlierProcess &operator=(const EarlierProcess &) = delete;
  void end() {
    if (pid_ == 0) return;
    close(hold_[1]);
    waitpid(pid_, nullptr, 0);
    pid_ = 0;
    EXPECT_TRUE(run_until(is_quarn_turn));
  }

 private:
  const std::string &lock() const { return lock_; }
  const TempDir folder_;
  const std::string lock_ = folder_ / "lock";
  int hold_[2] = {-1, -1};
  pid_t pid_ = 0;
};

/** Once a process: a lock is kept for its life. */
TEST_F(Server, CallsThatTouchDataWaitForAnEarlierProcessAndTheOthersDoNot) {
  EarlierProcess earlier;
  const std::vector<std::pair<const char *, const char *>> waiting = {
      {"restore_enable", "(1, 0, 's', '[]', uint32 1)"},
      {"get_app_list", "(0, uint32 2)"},
      {"app_data_backup_start", "('org.example.notes', uint32 3)"},
      {"app_data_restore_start", "('org.example.notes', uint32 4)"},
      {"make_app_data", "('org.example.notes',)"}};
  std::vector<std::shared_ptr<CallOutcome>> outcomes;
  for (const auto &[method, arguments] : waiting) {
    outcomes.push_back(std::make_shared<CallOutcome>());
    client_->start_call(method, arguments, outcomes.back());
  }
  EXPECT_EQ(client_->call("set_activation", "(1,)").reply, "(0,)");
  EXPECT_EQ(client_->call("restore_enable", "(0, 0, '', '', uint32 5)").reply, "(0,)");
  EXPECT_EQ(client_->call("manual_backup_start", "(uint32 6,)").reply, "(0,)");
  EXPECT_EQ(client_->call("get_app_list", "()").reply, "(-1,)");
  EXPECT_EQ(steps,
            (Texts{"cancel", "cancel", "cancel", "cancel", "cancel", "cancel", "cancel",
                   "restore_enable 0 0   " + id(5), "cancel", "manual_backup " + id(6), "cancel"}));
  EXPECT_TRUE(quarnd_calls_deferred());
  EXPECT_TRUE(PendingWork::any());
  for (const auto &outcome : outcomes) EXPECT_FALSE(outcome->finished);
  steps.clear();
  earlier.end();
  EXPECT_TRUE(run_until([&] {
    return std::all_of(outcomes.begin(), outcomes.end(),
                       [](const auto &outcome) { return outcome->finished; });
  }));
  EXPECT_FALSE(quarnd_calls_deferred());
  EXPECT_FALSE(PendingWork::any());
  EXPECT_EQ(steps,
            (Texts{"cancel", "restore_enable 1 0 s [] " + id(1), "cancel",
                   "get_app_list 0 " + id(2), "cancel", "backup_app_data " + id(3),
                   "org.example.notes", "cancel", "restore_app_data org.example.notes " + id(4),
                   "cancel", "make_app_data org.example.notes " + number(getuid())}));
}

TEST_F(Server, NameThatAnotherOwnsIsLostAndLogged) {
  quarnd_dbus_deinit(owner_id_);
  const ConnectionHandle other = connect_to_private_bus();
  const GVariantPtr owned(g_dbus_connection_call_sync(
      other.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
      "RequestName", g_variant_new("(su)", kQuarnBusName, 4u), nullptr, G_DBUS_CALL_FLAGS_NONE, -1,
      nullptr, nullptr));
  ASSERT_TRUE(owned);
  clear_captured_log();
  owner_id_ = quarnd_dbus_init();
  EXPECT_TRUE(
      run_until([] { return count_logged(DLOG_INFO, "Lost the name org.orvane.Quarn") == 1; }));
  g_dbus_connection_close_sync(other.get(), nullptr, nullptr);
}

TEST_F(Server, ObjectThatCannotBeRegisteredIsLoggedBeforeTheLineOfSuccess) {
  quarnd_dbus_deinit(owner_id_);
  // In the way: the same interface at the same path of the same connection.
  GDBusNodeInfo *node = g_dbus_node_info_new_for_xml(quarn_introspection_xml, nullptr);
  const GDBusInterfaceVTable table{nullptr, nullptr, nullptr, {}};
  const guint in_the_way =
      g_dbus_connection_register_object(quarn_dbus_connection, kQuarnObjectPath,
                                        node->interfaces[0], &table, nullptr, nullptr, nullptr);
  clear_captured_log();
  owner_id_ = quarnd_dbus_init();
  EXPECT_TRUE(run_until(acquired));
  const Texts texts = captured_texts();
  const std::string failed = "g_dbus_connection_register_object() Fail(";
  const auto failure = std::find_if(texts.begin(), texts.end(), [&](const std::string &text) {
    return text.rfind(failed, 0) == 0;
  });
  ASSERT_NE(failure, texts.end());
  ASSERT_NE(failure + 1, texts.end());
  EXPECT_EQ(*(failure + 1), "g_dbus_connection_register_object() succeed");
  g_dbus_connection_unregister_object(quarn_dbus_connection, in_the_way);
  g_dbus_node_info_unref(node);
}

/* ---- the end ---- */

TEST_F(Server, CallThatArrivedBeforeTheNameWasGivenUpIsAnswered) {
  const auto outcome = std::make_shared<CallOutcome>();
  client_->start_call("backup_enable", "(1,)", outcome);
  g_dbus_connection_flush_sync(client_->connection(), nullptr, nullptr);
  // The bus has passed the call on, and nobody has looked at it.
  client_->call_bus("GetId");
  quarnd_dbus_leave();
  EXPECT_EQ(steps, (Texts{"cancel", "backup_enable 1"}));
  EXPECT_EQ(client_->call("backup_enable", "(1,)").error_name,
            "org.freedesktop.DBus.Error.ServiceUnknown");
  EXPECT_EQ(outcome->reply, "(0,)");
}

TEST_F(Server, EndTakesTheNameBackForACallThatHadArrived) {
  const auto outcome = std::make_shared<CallOutcome>();
  inside_handler = [] { withdraw_quarn_end(); };
  client_->start_call("backup_enable", "(1,)", outcome);
  client_->call_bus("GetId");
  clear_captured_log();
  begin_quarn_end();
  EXPECT_TRUE(run_until(acquired));
  EXPECT_TRUE(run_until([&] { return outcome->finished; }));
  EXPECT_EQ(outcome->reply, "(0,)");
  EXPECT_EQ(client_->call("backup_enable", "(2,)").reply, "(0,)");
  EXPECT_EQ(std::count(steps.begin(), steps.end(), "quit"), 0);
}

TEST_F(Server, EndThatMeetsASignalDoesNotTakeTheNameBackForACallThatHadArrived) {
  const auto outcome = std::make_shared<CallOutcome>();
  inside_handler = [] { withdraw_quarn_end(); };
  client_->start_call("backup_enable", "(1,)", outcome);
  client_->call_bus("GetId");
  begin_quarn_end();
  quarnd_dbus_leave();
  EXPECT_EQ(client_->call("backup_enable", "(1,)").error_name,
            "org.freedesktop.DBus.Error.ServiceUnknown");
  EXPECT_EQ(outcome->reply, "(0,)");
}

TEST_F(Server, EndWithoutACallQuitsTheLoopWithoutTheName) {
  begin_quarn_end();
  EXPECT_TRUE(run_until([] { return !steps.empty(); }));
  EXPECT_EQ(steps, Texts{"quit"});
  EXPECT_EQ(client_->call("backup_enable", "(1,)").error_name,
            "org.freedesktop.DBus.Error.ServiceUnknown");
}

TEST_F(Server, BusThatIsGoneEndsTheDaemonWhenItIsIdle) {
  EXPECT_FALSE(g_dbus_connection_get_exit_on_close(quarn_dbus_connection));
  g_signal_emit_by_name(quarn_dbus_connection, "closed", TRUE, nullptr);
  EXPECT_EQ(count_logged(DLOG_ERROR, "the bus is gone : "), 1);
  EXPECT_TRUE(run_until([] { return !steps.empty(); }));
  EXPECT_EQ(steps, Texts{"quit"});
}

/** In a process of its own: it is not to be undone. */
void serve_calls_at_the_end() {
  if (quarnd_dbus_init() == 0 || !run_until(acquired)) _exit(1);
  ScriptedClient client;
  quarn_dbus_stop_waiting();
  steps.clear();
  const std::vector<std::pair<const char *, const char *>> calls = {
      {"restore_enable", "(1, 0, 's', '[]', uint32 1)"},
      {"get_app_list", "(0, uint32 2)"},
      {"app_data_backup_start", "('org.example.notes', uint32 3)"},
      {"app_data_restore_start", "('org.example.notes', uint32 4)"},
      {"make_app_data", "('org.example.notes',)"},
      {"backup_enable", "(1,)"}};
  std::string replies;
  for (const auto &[method, arguments] : calls) replies += client.call(method, arguments).reply;
  if (!client.wait_for_callbacks(3)) _exit(2);
  for (const std::string &callback : client.callbacks()) replies += callback + " ";
  for (const std::string &step : steps) {
    if (step != "cancel") replies += step;
  }
  std::fputs(replies.c_str(), stderr);
  _exit(0);
}

TEST(ServerAtTheEndDeathTest, AnswersEveryCallAndBeginsNoWork) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  private_bus_address();
  EXPECT_EXIT(serve_calls_at_the_end(), ::testing::ExitedWithCode(0),
              ".36,..17,..0,..0,..17,..0,.get_app_list_cb.17, 'failed', 2. "
              "app_data_backup_complete.17, 'org.example.notes', 3. "
              "app_data_restore_complete.17, 'org.example.notes', 4. backup_enable 1");
}

TEST(ServerStart, UnreadableIntrospectionDataGivesMinusOne) {
  clear_captured_log();
  fail_parse = true;
  EXPECT_EQ(quarnd_dbus_init(), static_cast<unsigned int>(-1));
  fail_parse = false;
  const Texts texts = captured_texts();
  ASSERT_EQ(texts.size(), 1u);
  EXPECT_EQ(texts[0].rfind("g_dbus_node_info_new_for_xml() Fail(", 0), 0u);
  quarnd_dbus_deinit(static_cast<unsigned int>(-1));
}

TEST(ServerStart, NameThatCannotBeAskedForGivesZero) {
  clear_captured_log();
  fail_own = true;
  EXPECT_EQ(quarnd_dbus_init(), 0u);
  fail_own = false;
  EXPECT_EQ(count_logged(DLOG_ERROR, "g_bus_own_name() Fail"), 1);
  quarnd_dbus_deinit(0);
}

/* ---- the introspection document ---- */

/** Without white space between elements, comments and the document type. */
std::string bare(const std::string &xml) {
  std::string text;
  std::size_t at = 0;
  while (at < xml.size()) {
    if (xml.compare(at, 4, "<!--") == 0) {
      at = xml.find("-->", at) + 3;
    } else if (xml.compare(at, 2, "<!") == 0 || xml.compare(at, 2, "<?") == 0) {
      at = xml.find('>', at) + 1;
    } else {
      const char c = xml[at++];
      text += c == '"' ? '\'' : c;
    }
  }
  std::string result;
  for (std::size_t i = 0; i < text.size(); ++i) {
    const bool blank = std::isspace(static_cast<unsigned char>(text[i])) != 0;
    const bool between = result.empty() || result.back() == '>';
    if (!(blank && between)) result += text[i];
  }
  return result;
}

TEST(Introspection, InstalledDocumentSaysTheSame) {
  const std::string content = read_text(QUARN_INTROSPECTION_FILE);
  ASSERT_NE(content, "") << QUARN_INTROSPECTION_FILE;
  EXPECT_EQ(bare(content), bare(quarn_introspection_xml));
}

std::string arguments(GDBusArgInfo **args) {
  std::string text;
  for (; args != nullptr && *args != nullptr; ++args) {
    if (!text.empty()) text += ", ";
    text += std::string((*args)->signature) + " " + (*args)->name;
  }
  return text;
}

TEST(Introspection, HasElevenMethodsInOrder) {
  GDBusNodeInfo *node = g_dbus_node_info_new_for_xml(quarn_introspection_xml, nullptr);
  ASSERT_NE(node, nullptr);
  ASSERT_NE(node->interfaces[0], nullptr);
  EXPECT_EQ(node->interfaces[1], nullptr);
  EXPECT_STREQ(node->interfaces[0]->name, "org.orvane.Quarn");
  Texts methods;
  for (GDBusMethodInfo **method = node->interfaces[0]->methods; *method != nullptr; ++method) {
    methods.push_back(std::string((*method)->name) + "(" + arguments((*method)->in_args) + ") -> " +
                      arguments((*method)->out_args));
  }
  EXPECT_EQ(methods,
            (Texts{"set_activation(i activation) -> i ret", "backup_enable(i on) -> i ret",
                   "restore_enable(i on, i client, s serial_num, s pkg_list, u req_id) -> i ret",
                   "last_bu_time() -> t timestamp", "get_app_list(i client, u req_id) -> i ret",
                   "auto_backup_start(s param) -> ", "manual_backup_start(u req_id) -> i ret",
                   "manual_backup_cancel(u req_id) -> i ret",
                   "app_data_backup_start(s pkg_id, u req_id) -> i ret",
                   "app_data_restore_start(s pkg_id, u req_id) -> i ret",
                   "make_app_data(s pkg_id) -> i ret"}));
  g_dbus_node_info_unref(node);
}

TEST(Introspection, HasTabsBetweenElements) {
  const std::string xml = quarn_introspection_xml;
  EXPECT_EQ(xml.find('\n'), std::string::npos);
  EXPECT_NE(xml.find(">\t<interface"), std::string::npos);
  EXPECT_NE(xml.find(">\t\t\t<arg"), std::string::npos);
}

}  // namespace
