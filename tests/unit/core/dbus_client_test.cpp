#include "quarn_dbus_client.h"

#include <gtest/gtest.h>

#include <new>

#include "glib_handles.h"
#include "log_capture.h"
#include "quarn_common.h"
#include "run_until.h"
#include "scripted_client.h"

namespace {

using Texts = std::vector<std::string>;

/** Whether the watched record was deleted. */
const void *watched = nullptr;
bool watched_deleted = false;

}  // namespace

// The record has no virtual destructor to hook into.
void operator delete(void *memory, std::size_t) noexcept {
  if (memory != nullptr && memory == watched) watched_deleted = true;
  std::free(memory);
}
void operator delete(void *memory) noexcept {
  if (memory != nullptr && memory == watched) watched_deleted = true;
  std::free(memory);
}
void *operator new(std::size_t size) {
  if (void *memory = std::malloc(size)) return memory;
  throw std::bad_alloc();
}

namespace {

class Callbacks : public ::testing::Test {
 protected:
  void SetUp() override {
    connection_ = connect_to_private_bus();
    quarn_dbus_connection = connection_.get();
    client_ = std::make_unique<ScriptedClient>();
    clear_captured_log();
  }
  void TearDown() override {
    client_.reset();
    if (!watched_deleted) delete record_;
    watched = nullptr;
    quarn_dbus_connection = nullptr;
    g_dbus_connection_close_sync(connection_.get(), nullptr, nullptr);
  }

  /** A record for @p client, watched. */
  client_cb_data *record_for(const std::string &client) {
    record_ = new client_cb_data{7, client};
    watched_deleted = false;
    watched = record_;
    return record_;
  }
  client_cb_data *record() { return record_for(client_->name()); }
  /** A client that has left the bus. */
  static std::string left() {
    const ScriptedClient gone;
    return gone.name();
  }

  ConnectionHandle connection_;
  std::unique_ptr<ScriptedClient> client_;
  client_cb_data *record_ = nullptr;
};

TEST_F(Callbacks, RestoreEnableCarriesErrorMessageAndRequestId) {
  client_->answer("restore_enable_cb", "(5,)");
  EXPECT_EQ(quarn_dbus_restore_enable_cb(3, "org.example.notes", record()), 5);
  EXPECT_EQ(client_->callbacks(), Texts{"restore_enable_cb(3, 'org.example.notes', 7)"});
  EXPECT_EQ(
      count_logged(DLOG_INFO, "in quarn_dbus_restore_enable_cb. err:3, msg:org.example.notes"), 1);
}

TEST_F(Callbacks, RestoreEnableKeepsTheRecordUntilRestoreStop) {
  client_cb_data *data = record();
  quarn_dbus_restore_enable_cb(0, "org.example.notes", data);
  EXPECT_FALSE(watched_deleted);
  quarn_dbus_restore_enable_cb(0, "restore_stop_now", data);
  EXPECT_FALSE(watched_deleted);
  quarn_dbus_restore_enable_cb(0, "restore_stop", data);
  EXPECT_TRUE(watched_deleted);
  EXPECT_EQ(client_->callbacks().back(), "restore_enable_cb(0, 'restore_stop', 7)");
}

TEST_F(Callbacks, GetAppListCarriesTheListAndDeletesTheRecord) {
  EXPECT_EQ(quarn_dbus_get_app_list_cb(0, "{}", record()), 0);
  EXPECT_EQ(client_->callbacks(), Texts{"get_app_list_cb(0, '{}', 7)"});
  EXPECT_TRUE(watched_deleted);
  EXPECT_EQ(count_logged(DLOG_INFO, "in quarn_dbus_get_app_list_cb"), 1);
}

TEST_F(Callbacks, ManualBackupStatusTwoKeepsTheRecordForLaterCalls) {
  client_cb_data *data = record();
  EXPECT_EQ(quarn_dbus_manual_backup_status(0, 2, data), 0);
  EXPECT_FALSE(watched_deleted);
  EXPECT_EQ(quarn_dbus_manual_backup_status(0, 4, data), 0);
  EXPECT_TRUE(watched_deleted);
  EXPECT_EQ(client_->callbacks(),
            (Texts{"manual_backup_status(0, 2, 7)", "manual_backup_status(0, 4, 7)"}));
  EXPECT_EQ(count_logged(DLOG_INFO, "in quarn_dbus_manual_backup_status"), 2);
}

TEST_F(Callbacks, AnyOtherManualBackupStatusDeletesTheRecord) {
  for (const int status : {0, 1, 3, 4, 5, 6, -1}) {
    quarn_dbus_manual_backup_status(0, status, record());
    EXPECT_TRUE(watched_deleted) << status;
  }
}

TEST_F(Callbacks, ManualBackupCancelResultDeletesTheRecord) {
  EXPECT_EQ(quarn_dbus_manual_backup_cancel_result(0, record()), 0);
  EXPECT_EQ(client_->callbacks(), Texts{"manual_backup_cancel_result(0, 7)"});
  EXPECT_TRUE(watched_deleted);
  EXPECT_EQ(count_logged(DLOG_INFO, "in quarn_dbus_manual_backup_cancel_result"), 1);
}

TEST_F(Callbacks, AppBackupCompleteDeletesTheRecord) {
  EXPECT_EQ(quarn_dbus_app_backup_complete(27, "org.example.notes", record()), 0);
  EXPECT_EQ(client_->callbacks(), Texts{"app_data_backup_complete(27, 'org.example.notes', 7)"});
  EXPECT_TRUE(watched_deleted);
  EXPECT_EQ(count_logged(DLOG_INFO, "in quarn_dbus_app_backup_complete"), 1);
}

TEST_F(Callbacks, AppRestoreCompleteDeletesTheRecord) {
  EXPECT_EQ(quarn_dbus_app_restore_complete(41, "org.example.notes", record()), 0);
  EXPECT_EQ(client_->callbacks(), Texts{"app_data_restore_complete(41, 'org.example.notes', 7)"});
  EXPECT_TRUE(watched_deleted);
  EXPECT_EQ(count_logged(DLOG_INFO, "in quarn_dbus_app_restore_complete"), 1);
}

TEST_F(Callbacks, NullRecordIsLoggedAndNothingIsSent) {
  EXPECT_EQ(quarn_dbus_restore_enable_cb(0, "restore_stop", nullptr), 42);
  EXPECT_EQ(quarn_dbus_get_app_list_cb(0, "", nullptr), 42);
  EXPECT_EQ(quarn_dbus_manual_backup_status(0, 4, nullptr), 42);
  EXPECT_EQ(quarn_dbus_manual_backup_cancel_result(0, nullptr), 42);
  EXPECT_EQ(quarn_dbus_app_backup_complete(0, "", nullptr), 42);
  EXPECT_EQ(quarn_dbus_app_restore_complete(0, "", nullptr), 42);
  EXPECT_EQ(count_logged(DLOG_ERROR, "client_cb_data is NULL"), 6);
  EXPECT_TRUE(client_->callbacks().empty());
}

bool logged_call_failure() {
  for (const LogLine &line : captured_log()) {
    if (line.level == DLOG_ERROR &&
        line.text.rfind("g_dbus_connection_call_sync() Fail(", 0) == 0) {
      return true;
    }
  }
  return false;
}

TEST_F(Callbacks, ClientThatHasLeftGives42AndTheRecordIsDeleted) {
  EXPECT_EQ(quarn_dbus_get_app_list_cb(0, "{}", record_for(left())), 42);
  EXPECT_TRUE(watched_deleted);
  EXPECT_TRUE(logged_call_failure());
}

TEST_F(Callbacks, ClientThatHasLeftKeepsTheRecordOfStatusTwo) {
  client_cb_data *data = record_for(left());
  EXPECT_EQ(quarn_dbus_manual_backup_status(0, 2, data), 42);
  EXPECT_FALSE(watched_deleted);
  EXPECT_EQ(quarn_dbus_manual_backup_status(0, 5, data), 42);
  EXPECT_TRUE(watched_deleted);
}

TEST_F(Callbacks, ClientThatHasLeftKeepsTheRecordOfARestoreMessage) {
  client_cb_data *data = record_for(left());
  EXPECT_EQ(quarn_dbus_restore_enable_cb(0, "org.example.notes", data), 42);
  EXPECT_FALSE(watched_deleted);
  EXPECT_EQ(quarn_dbus_restore_enable_cb(0, "restore_stop", data), 42);
  EXPECT_TRUE(watched_deleted);
}

TEST_F(Callbacks, ClientThatDiesWhileAskedGives42) {
  client_->keep_silent("get_app_list_cb");
  client_cb_data *data = record();
  int result = 0;
  std::thread caller([&] { result = quarn_dbus_get_app_list_cb(0, "{}", data); });
  ASSERT_TRUE(client_->wait_for_callbacks(1));
  client_.reset();
  caller.join();
  EXPECT_EQ(result, 42);
  EXPECT_TRUE(watched_deleted);
  EXPECT_TRUE(logged_call_failure());
}

TEST_F(Callbacks, ClientWithoutTheObjectGives42) {
  const ScriptedClient bare(false);
  EXPECT_EQ(quarn_dbus_manual_backup_cancel_result(0, record_for(bare.name())), 42);
  EXPECT_TRUE(logged_call_failure());
}

TEST_F(Callbacks, ReplyThatCannotBeReadGives42) {
  for (const char *reply : {"('text',)", "()", "(1, 2)", "(uint32 1,)"}) {
    client_->answer("manual_backup_cancel_result", reply);
    clear_captured_log();
    EXPECT_EQ(quarn_dbus_manual_backup_cancel_result(0, record()), 42) << reply;
    EXPECT_EQ(count_logged(DLOG_ERROR, "g_dbus_connection_call_sync 'Launch' error"), 1) << reply;
    EXPECT_TRUE(watched_deleted);
  }
}

TEST_F(Callbacks, WithoutAConnectionOrASenderGive42) {
  EXPECT_EQ(quarn_dbus_manual_backup_cancel_result(0, record_for("")), 42);
  EXPECT_TRUE(watched_deleted);
  quarn_dbus_connection = nullptr;
  EXPECT_EQ(quarn_dbus_manual_backup_cancel_result(0, record()), 42);
  EXPECT_TRUE(watched_deleted);
  EXPECT_EQ(count_logged(DLOG_ERROR, "g_dbus_connection_call_sync 'Launch' error"), 2);
}

TEST_F(Callbacks, TextThatNoMessageCanCarryIsMadeFit) {
  EXPECT_EQ(quarn_dbus_get_app_list_cb(0, nullptr, record()), 0);
  EXPECT_EQ(quarn_dbus_get_app_list_cb(0, "a\xff", record()), 0);
  EXPECT_EQ(client_->callbacks(),
            (Texts{"get_app_list_cb(0, '', 7)", "get_app_list_cb(0, 'a\xEF\xBF\xBD', 7)"}));
}

TEST_F(Callbacks, ThreadsDoNotDisturbEachOther) {
  std::vector<std::thread> threads;
  std::atomic<int> delivered{0};
  for (std::uint32_t id = 0; id < 8; ++id) {
    threads.emplace_back([this, id, &delivered] {
      if (quarn_dbus_manual_backup_cancel_result(0, new client_cb_data{id, client_->name()}) == 0) {
        ++delivered;
      }
    });
  }
  for (std::thread &thread : threads) thread.join();
  EXPECT_EQ(delivered, 8);
  EXPECT_EQ(client_->callbacks().size(), 8u);
}

/* ---- accepted requests ---- */

struct Kind {
  quarn_request kind;
  const char *text;
  const char *cancelled;
};
const Kind kKinds[] = {
    {quarn_request::restore_mode, "", "restore_enable_cb(17, 'restore_stop', 7)"},
    {quarn_request::app_list, "", "get_app_list_cb(17, 'failed', 7)"},
    {quarn_request::manual_backup, "", "manual_backup_status(17, 6, 7)"},
    {quarn_request::cancel, "", "manual_backup_cancel_result(17, 7)"},
    {quarn_request::app_backup, "org.example.notes",
     "app_data_backup_complete(17, 'org.example.notes', 7)"},
    {quarn_request::app_restore, "org.example.notes",
     "app_data_restore_complete(17, 'org.example.notes', 7)"}};

int send_last(quarn_request kind, void *record) {
  switch (kind) {
    case quarn_request::restore_mode:
      return quarn_dbus_restore_enable_cb(0, "restore_stop", record);
    case quarn_request::app_list:
      return quarn_dbus_get_app_list_cb(0, "{}", record);
    case quarn_request::manual_backup:
      return quarn_dbus_manual_backup_status(0, 4, record);
    case quarn_request::cancel:
      return quarn_dbus_manual_backup_cancel_result(0, record);
    case quarn_request::app_backup:
      return quarn_dbus_app_backup_complete(0, "org.example.notes", record);
    case quarn_request::app_restore:
      return quarn_dbus_app_restore_complete(0, "org.example.notes", record);
  }
  return -1;
}

TEST_F(Callbacks, AcceptedRequestThatIsCutShortIsToldOnceAndItsRecordIsDeletedLater) {
  for (const Kind &kind : kKinds) {
    const std::size_t before = client_->callbacks().size();
    client_cb_data *data = record();
    quarn_dbus_accept_request(kind.kind, kind.text, data);
    quarn_dbus_end_requests();
    quarn_dbus_end_requests();
    ASSERT_TRUE(client_->wait_for_callbacks(before + 1)) << kind.cancelled;
    EXPECT_FALSE(watched_deleted);
    EXPECT_EQ(send_last(kind.kind, data), 42);
    EXPECT_TRUE(watched_deleted);
    quarn_dbus_end_requests();
    EXPECT_EQ(client_->callbacks().size(), before + 1);
    EXPECT_EQ(client_->callbacks().back(), kind.cancelled);
  }
}

TEST_F(Callbacks, AcceptedRequestThatHasEndedIsNotToldAgain) {
  for (const Kind &kind : kKinds) {
    client_cb_data *data = record();
    quarn_dbus_accept_request(kind.kind, kind.text, data);
    const std::size_t before = client_->callbacks().size();
    EXPECT_EQ(send_last(kind.kind, data), 0);
    quarn_dbus_end_requests();
    quarn_dbus_flush(1000);
    EXPECT_EQ(quarn_dbus_manual_backup_cancel_result(0, record()), 0);
    EXPECT_EQ(client_->callbacks().size(), before + 2);
  }
}

TEST_F(Callbacks, NothingFollowsTheLastCallback) {
  client_cb_data *data = record();
  quarn_dbus_accept_request(quarn_request::manual_backup, "", data);
  quarn_dbus_end_requests();
  EXPECT_EQ(quarn_dbus_manual_backup_status(0, 2, data), 42);
  EXPECT_FALSE(watched_deleted);
  ASSERT_TRUE(client_->wait_for_callbacks(1));
  EXPECT_EQ(client_->callbacks(), Texts{"manual_backup_status(17, 6, 7)"});
  quarn_dbus_manual_backup_status(0, 4, data);
}

TEST_F(Callbacks, RequestOfAClientThatHasLeftEndsWithoutHarm) {
  client_cb_data *data = record_for(left());
  quarn_dbus_accept_request(quarn_request::app_list, "", data);
  quarn_dbus_end_requests();
  EXPECT_EQ(quarn_dbus_get_app_list_cb(0, "{}", data), 42);
}

TEST_F(Callbacks, LastCallbackAndTheEndMeetAndExactlyOneIsSent) {
  constexpr std::uint32_t kRounds = 200;
  for (std::uint32_t id = 0; id < kRounds; ++id) {
    auto *data = new client_cb_data{id, client_->name()};
    quarn_dbus_accept_request(quarn_request::manual_backup, "", data);
    std::thread worker([data] { quarn_dbus_manual_backup_status(0, 4, data); });
    quarn_dbus_end_requests();
    worker.join();
  }
  ASSERT_TRUE(client_->wait_for_callbacks(kRounds));
  EXPECT_EQ(quarn_dbus_manual_backup_cancel_result(0, record()), 0);
  EXPECT_EQ(client_->callbacks().size(), kRounds + 1);
}

/** In a process of its own: it is not to be undone. */
void stop_while_a_client_is_waited_for() {
  const ConnectionHandle connection = connect_to_private_bus();
  quarn_dbus_connection = connection.get();
  ScriptedClient client;
  client.keep_silent("manual_backup_status");
  auto *data = new client_cb_data{7, client.name()};
  std::thread waiting([data] { quarn_dbus_manual_backup_status(0, 2, data); });
  if (!client.wait_for_callbacks(1)) std::_Exit(1);
  quarn_dbus_stop_waiting();
  waiting.join();
  // Nobody answers this one either.
  quarn_dbus_manual_backup_status(0, 4, data);
  if (!client.wait_for_callbacks(2)) std::_Exit(2);
  std::_Exit(quarn_dbus_waiting_stopped() ? 0 : 3);
}

TEST(StopWaitingDeathTest, LetsThoseGoOnThatWaitAndSendsWithoutWaiting) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  private_bus_address();
  EXPECT_EXIT(stop_while_a_client_is_waited_for(), ::testing::ExitedWithCode(0), "");
}

/* ---- published signals ---- */

class Publish : public ::testing::Test {
 protected:
  void SetUp() override {
    connection_ = connect_to_private_bus();
    listener_ = connect_to_private_bus();
    quarn_dbus_connection = connection_.get();
    subscription_ = g_dbus_connection_signal_subscribe(
        listener_.get(), nullptr, kQuarnInterface, nullptr, nullptr, nullptr,
        G_DBUS_SIGNAL_FLAGS_NONE, on_signal, this, nullptr);
    // A round trip: the bus knows of the subscription afterwards.
    g_variant_unref(g_dbus_connection_call_sync(
        listener_.get(), "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
        "GetId", nullptr, nullptr, G_DBUS_CALL_FLAGS_NONE, -1, nullptr, nullptr));
    clear_captured_log();
  }
  void TearDown() override {
    quarn_dbus_connection = nullptr;
    g_dbus_connection_signal_unsubscribe(listener_.get(), subscription_);
    for (GDBusConnection *connection : {connection_.get(), listener_.get()}) {
      if (g_dbus_connection_is_closed(connection) == FALSE) {
        g_dbus_connection_close_sync(connection, nullptr, nullptr);
      }
    }
    run_pending();
  }
  static void on_signal(GDBusConnection *, const gchar *, const gchar *path, const gchar *,
                        const gchar *signal, GVariant *parameters, gpointer self) {
    const GText printed(g_variant_print(parameters, FALSE));
    static_cast<Publish *>(self)->signals_.push_back(std::string(path) + " " + signal +
                                                     printed.get());
  }

  ConnectionHandle connection_;
  ConnectionHandle listener_;
  guint subscription_ = 0;
  Texts signals_;
};

TEST_F(Publish, BroadcastsOnThePathOfItsName) {
  EXPECT_EQ(quarnd_dbus_publish("backed_up", "now"), 0);
  EXPECT_TRUE(run_until([this] { return !signals_.empty(); }));
  EXPECT_EQ(signals_, Texts{"/backed_up backed_up('now',)"});
  EXPECT_EQ(count_logged(DLOG_INFO, "quarnd_dbus_publish:quarn_utils_parse_key called"), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, ">>>>>>>> called"), 1);
}

TEST_F(Publish, TakesNoValueAsTheEmptyText) {
  EXPECT_EQ(quarnd_dbus_publish("backed_up", nullptr), 0);
  EXPECT_TRUE(run_until([this] { return !signals_.empty(); }));
  EXPECT_EQ(signals_, Texts{"/backed_up backed_up('',)"});
}

TEST_F(Publish, RefusesWhatIsNoSignalName) {
  for (const char *name : {static_cast<const char *>(nullptr), "", "a b", "a/b", "1"}) {
    clear_captured_log();
    EXPECT_EQ(quarnd_dbus_publish(name, "x"), -1);
    EXPECT_EQ(count_logged(DLOG_ERROR, "g_dbus_connection_emit_signal() Fail(not a signal name)"),
              1);
  }
}

TEST_F(Publish, FailsOnAClosedConnection) {
  g_dbus_connection_close_sync(connection_.get(), nullptr, nullptr);
  EXPECT_EQ(quarnd_dbus_publish("backed_up", "now"), -1);
  EXPECT_EQ(
      count_logged(DLOG_ERROR, "g_dbus_connection_emit_signal() Fail(The connection is closed)"),
      1);
}

TEST_F(Publish, FailsBeforeThereIsAConnection) {
  quarn_dbus_connection = nullptr;
  EXPECT_EQ(quarnd_dbus_publish("backed_up", "now"), -1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "g_dbus_connection_emit_signal() Fail(not connected)"), 1);
}

}  // namespace
