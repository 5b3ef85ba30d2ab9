#include <gtest/gtest.h>

#include <csignal>

#include "fake_daemon.h"
#include "json_read.h"
#include "quarn_common.h"

namespace {

using quarn_client::json_integer;
using quarn_client::json_parse;
using quarn_client::json_string;

constexpr int kUsage = 64;
constexpr int kUnreachable = 69;
constexpr int kDaemonEnded = 70;
constexpr int kTimedOut = 75;
constexpr int kUnusable = 76;
constexpr int kDenied = 77;
constexpr int kInterrupted = 130;

const std::vector<int> kResultCodes = {1, 12, 13, 14, 17, 19, 27, 31, 32, 33, 34, 36, 41, 42};

class Quarnctl : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { bus_ = new PrivateBus; }
  static void TearDownTestSuite() {
    delete bus_;
    bus_ = nullptr;
  }
  static PrivateBus &bus() { return *bus_; }

  /** A daemon that answers a backup with one final state, as the real one does. */
  static void script_backup(FakeDaemon &daemon, int result, int state) {
    daemon.on("manual_backup_start", [result, state](const IncomingCall &call) {
      const std::uint32_t req = call.req_id();
      call.call_back("manual_backup_status", status_arguments(0, QUARN_BACKUP_RUNNING, req),
                     [call, req, result, state] {
                       call.reply(0);
                       call.call_back("manual_backup_status", status_arguments(result, state, req));
                     });
    });
  }

 private:
  static PrivateBus *bus_;
};

PrivateBus *Quarnctl::bus_ = nullptr;

TEST_F(Quarnctl, ActivateAndDeactivateTellTheDaemonAndTheUser) {
  FakeDaemon daemon(bus());
  std::vector<int> values;
  daemon.on("set_activation", [&](const IncomingCall &call) {
    values.push_back(call.int_argument(0));
    call.reply(0);
  });
  Outcome outcome = quarnctl(bus(), {"activate"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out, "the daemon is active\n");
  outcome = quarnctl(bus(), {"deactivate"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out, "the daemon ends when it is idle\n");
  EXPECT_EQ(values, (std::vector<int>{1, 0}));
}

TEST_F(Quarnctl, DeactivateSucceedsWhenTheDaemonEndsRightAfterItsReply) {
  FakeDaemon daemon(bus());
  daemon.on("set_activation", [&](const IncomingCall &call) {
    call.reply(0);
    daemon.die();
  });
  EXPECT_EQ(quarnctl(bus(), {"deactivate"}).exit, 0);
}

TEST_F(Quarnctl, AutoSwitchesTheSetting) {
  FakeDaemon daemon(bus());
  std::vector<int> values;
  daemon.on("backup_enable", [&](const IncomingCall &call) {
    values.push_back(call.int_argument(0));
    call.reply(0);
  });
  EXPECT_EQ(quarnctl(bus(), {"auto", "on"}).out, "automatic backup is on\n");
  EXPECT_EQ(quarnctl(bus(), {"auto", "off"}).out, "automatic backup is off\n");
  EXPECT_EQ(values, (std::vector<int>{1, 0}));
}

TEST_F(Quarnctl, LastTimeIsShownAsLocalTime) {
  FakeDaemon daemon(bus());
  daemon.on("last_bu_time", [](const IncomingCall &call) {
    call.reply_value(g_variant_new("(t)", G_GUINT64_CONSTANT(1709208300123)));
  });
  EXPECT_EQ(quarnctl(bus(), {"last-time"}).out, "2024-02-29T12:05:00+00:00\n");
  const JsonPtr document = json_parse(quarnctl(bus(), {"last-time", "--json"}).out);
  EXPECT_EQ(json_integer(document.get(), "time_ms"), 1709208300123);
  EXPECT_EQ(json_string(document.get(), "time"), "2024-02-29T12:05:00+00:00");
}

TEST_F(Quarnctl, LastTimeOutOfRangeIsADash) {
  FakeDaemon daemon(bus());
  daemon.on("last_bu_time",
            [](const IncomingCall &call) { call.reply_value(g_variant_new("(t)", G_MAXUINT64)); });
  EXPECT_EQ(quarnctl(bus(), {"last-time"}).out, "-\n");
}

TEST_F(Quarnctl, BackupAnswersTheCallbackThatComesBeforeTheReply) {
  FakeDaemon daemon(bus());
  script_backup(daemon, 0, QUARN_BACKUP_SUCCEEDED);
  const Outcome outcome = quarnctl(bus(), {"backup"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out, "backup started\nbackup succeeded\n");
  EXPECT_EQ(outcome.err, "");
}

TEST_F(Quarnctl, BackupMayEndBeforeItsReply) {
  FakeDaemon daemon(bus());
  daemon.on("manual_backup_start", [](const IncomingCall &call) {
    const std::uint32_t req = call.req_id();
    call.call_back("manual_backup_status", status_arguments(0, QUARN_BACKUP_RUNNING, req), [=] {
      call.call_back("manual_backup_status", status_arguments(0, QUARN_BACKUP_SUCCEEDED, req),
                     [call] { call.reply(0); });
    });
  });
  EXPECT_EQ(quarnctl(bus(), {"backup"}).exit, 0);
}

TEST_F(Quarnctl, BackupExitsWithEveryResultCodeAndSaysItInWords) {
  for (const int code : kResultCodes) {
    FakeDaemon daemon(bus());
    script_backup(daemon, code, QUARN_BACKUP_FAILED);
    const Outcome outcome = quarnctl(bus(), {"backup"});
    EXPECT_EQ(outcome.exit, code);
    EXPECT_EQ(outcome.err, std::string("quarnctl: backup failed: ") + quarn_result_text(code) +
                               " (" + std::to_string(code) + ")\n");
    EXPECT_EQ(outcome.out, "backup started\n");
  }
}

TEST_F(Quarnctl, ACancelledBackupExitsWith17) {
  FakeDaemon daemon(bus());
  script_backup(daemon, QUARN_CANCELLED, QUARN_BACKUP_CANCELLED);
  const Outcome outcome = quarnctl(bus(), {"backup"});
  EXPECT_EQ(outcome.exit, QUARN_CANCELLED);
  EXPECT_EQ(outcome.err, "quarnctl: backup cancelled (17)\n");
}

TEST_F(Quarnctl, AFailureWithoutACodeOrWithAnUnknownOneExitsWith42) {
  for (const auto &[result, state] : {std::pair{0, 5}, std::pair{0, 9}, std::pair{1000, 5}}) {
    FakeDaemon daemon(bus());
    script_backup(daemon, result, state);
    EXPECT_EQ(quarnctl(bus(), {"backup"}).exit, QUARN_FAILED) << result << " " << state;
  }
}

TEST_F(Quarnctl, ARefusedBackupExitsWithTheReply) {
  FakeDaemon daemon(bus());
  daemon.on("manual_backup_start", [](const IncomingCall &call) { call.reply(QUARN_REFUSED); });
  EXPECT_EQ(quarnctl(bus(), {"backup"}).exit, QUARN_REFUSED);
}

TEST_F(Quarnctl, AStateOfAnotherRequestIsNotTaken) {
  FakeDaemon daemon(bus());
  daemon.on("manual_backup_start", [](const IncomingCall &call) {
    const std::uint32_t req = call.req_id();
    call.call_back(
        "manual_backup_status", status_arguments(0, QUARN_BACKUP_SUCCEEDED, req + 1), [=] {
          call.reply(0);
          call.call_back("manual_backup_status",
                         status_arguments(QUARN_TRANSFER_FAILED, QUARN_BACKUP_FAILED, req));
        });
  });
  EXPECT_EQ(quarnctl(bus(), {"backup"}).exit, QUARN_TRANSFER_FAILED);
}

TEST_F(Quarnctl, OnlyTheDaemonMayCallBack) {
  FakeDaemon daemon(bus());
  const auto stranger = bus().connect();
  bool refused = false;
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    const std::uint32_t req = call.req_id();
    GErrorPtr error;
    const GVariantPtr reply(g_dbus_connection_call_sync(
        stranger.get(), call.client().c_str(), kQuarnObjectPath, kQuarnInterface,
        "manual_backup_status", status_arguments(0, QUARN_BACKUP_SUCCEEDED, req), nullptr,
        G_DBUS_CALL_FLAGS_NONE, -1, nullptr, out(error)));
    refused = !reply && g_error_matches(error.get(), G_DBUS_ERROR, G_DBUS_ERROR_ACCESS_DENIED);
    call.reply(0);
    call.call_back("manual_backup_status",
                   status_arguments(QUARN_TRANSFER_FAILED, QUARN_BACKUP_FAILED, req));
  });
  EXPECT_EQ(quarnctl(bus(), {"backup"}).exit, QUARN_TRANSFER_FAILED);
  EXPECT_TRUE(refused);
}

TEST_F(Quarnctl, ADaemonThatGaveItsNameUpIsStillHeard) {
  FakeDaemon daemon(bus());
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    daemon.give_name_up();
    call.call_back(
        "manual_backup_status", status_arguments(0, QUARN_BACKUP_RUNNING, call.req_id()), [call] {
          call.reply(0);
          call.call_back(
              "manual_backup_status",
              status_arguments(QUARN_TRANSFER_FAILED, QUARN_BACKUP_FAILED, call.req_id()));
        });
  });
  EXPECT_EQ(quarnctl(bus(), {"backup"}).exit, QUARN_TRANSFER_FAILED);
}

TEST_F(Quarnctl, AProcessThatTakesTheNameOverDoesNotEndTheRequestOfTheEarlierOne) {
  FakeDaemon daemon(bus());
  std::unique_ptr<FakeDaemon> next;
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    call.reply(0);
    daemon.give_name_up();
    next = std::make_unique<FakeDaemon>(bus());
    next->die();
    call.call_back("manual_backup_status",
                   status_arguments(0, QUARN_BACKUP_SUCCEEDED, call.req_id()));
  });
  EXPECT_EQ(quarnctl(bus(), {"backup"}).exit, 0);
}

TEST_F(Quarnctl, ADaemonThatDiesWithoutItsNameIsTold) {
  FakeDaemon daemon(bus());
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    daemon.give_name_up();
    call.call_back("manual_backup_status", status_arguments(0, QUARN_BACKUP_RUNNING, call.req_id()),
                   [&, call] {
                     call.reply(0);
                     daemon.die();
                   });
  });
  EXPECT_EQ(quarnctl(bus(), {"backup"}).exit, kDaemonEnded);
}

TEST_F(Quarnctl, RequestIdsDiffer) {
  FakeDaemon daemon(bus());
  std::vector<std::uint32_t> ids;
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    ids.push_back(call.req_id());
    call.reply(QUARN_REFUSED);
  });
  quarnctl(bus(), {"backup"});
  quarnctl(bus(), {"backup"});
  ASSERT_EQ(ids.size(), 2U);
  EXPECT_NE(ids[0], ids[1]);
}

TEST_F(Quarnctl, AnInterruptCancelsTheBackupAndWaitsForItsEnd) {
  FakeDaemon daemon(bus());
  std::uint32_t req = 0;
  QuarnctlRun run(bus(), {"backup"});
  std::unique_ptr<IncomingCall> backup;
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    req = call.req_id();
    backup = std::make_unique<IncomingCall>(call);
    call.call_back("manual_backup_status", status_arguments(0, QUARN_BACKUP_RUNNING, req), [&] {
      run.signal(SIGINT);
      backup->reply(0);
    });
  });
  daemon.on("CancelOwn", [&](const IncomingCall &call) {
    EXPECT_EQ(call.client(), backup->client()) << "the connection that asked for the backup";
    call.reply_value(g_variant_new("(u)", 1U));
    call.call_back("manual_backup_status",
                   status_arguments(QUARN_CANCELLED, QUARN_BACKUP_CANCELLED, req));
  });
  const Outcome outcome = run.wait();
  EXPECT_EQ(outcome.exit, QUARN_CANCELLED);
  EXPECT_EQ(outcome.out,
            "backup started\ncancelling the backup; interrupt again to leave at once\n");
  EXPECT_EQ(outcome.err, "quarnctl: backup cancelled (17)\n");
}

TEST_F(Quarnctl, ASecondInterruptLeavesAtOnce) {
  FakeDaemon daemon(bus());
  QuarnctlRun run(bus(), {"backup"});
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    call.reply(0);
    run.signal(SIGINT);
  });
  daemon.on("CancelOwn", [&](const IncomingCall &call) {
    call.reply_value(g_variant_new("(u)", 1U));
    run.signal(SIGINT);
  });
  EXPECT_EQ(run.wait().exit, kInterrupted);
  EXPECT_EQ(daemon.calls(), (std::vector<std::string>{"manual_backup_start", "CancelOwn"}))
      << "nobody else's backup is cancelled";
}

TEST_F(Quarnctl, AnInterruptWithdrawsAnApplicationsRequest) {
  for (const char *verb : {"backup", "restore"}) {
    FakeDaemon daemon(bus());
    QuarnctlRun run(bus(), {"app", verb, "org.example.notes"});
    std::unique_ptr<IncomingCall> request;
    const std::string name = verb;
    daemon.on("app_data_" + name + "_start", [&](const IncomingCall &call) {
      request = std::make_unique<IncomingCall>(call);
      run.signal(SIGTERM);
    });
    daemon.on("CancelOwn", [&](const IncomingCall &call) {
      call.reply_value(g_variant_new("(u)", 1U));
      request->call_back(("app_data_" + name + "_complete").c_str(),
                         text_arguments(QUARN_CANCELLED, "org.example.notes", request->req_id()),
                         [&] { request->reply(0); });
    });
    const Outcome outcome = run.wait();
    EXPECT_EQ(outcome.exit, QUARN_CANCELLED);
    EXPECT_EQ(outcome.out, "cancelling the " + name + "; interrupt again to leave at once\n");
    EXPECT_EQ(outcome.err, "quarnctl: " + name + " of org.example.notes failed: cancelled (17)\n");
  }
}

TEST_F(Quarnctl, AWithdrawalThatIsRefusedEndsIt) {
  FakeDaemon daemon(bus());
  QuarnctlRun run(bus(), {"backup"});
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    call.reply(0);
    run.signal(SIGINT);
  });
  daemon.on("CancelOwn", [&](const IncomingCall &call) {
    call.reply_error("org.freedesktop.DBus.Error.AccessDenied", "not you");
  });
  const Outcome outcome = run.wait();
  EXPECT_EQ(outcome.err, "quarnctl: not permitted: this needs root, or to be in the group quarn\n");
}

TEST_F(Quarnctl, AnInterruptEndsARequestThatCannotBeCancelled) {
  FakeDaemon daemon(bus());
  QuarnctlRun run(bus(), {"app", "export", "org.example.notes"});
  daemon.on("make_app_data", [&](const IncomingCall &) { run.signal(SIGTERM); });
  const Outcome outcome = run.wait();
  EXPECT_EQ(outcome.exit, kInterrupted);
  EXPECT_EQ(outcome.err, "quarnctl: interrupted\n");
}

TEST_F(Quarnctl, CancelWaitsForItsCallback) {
  FakeDaemon daemon(bus());
  daemon.on("manual_backup_cancel", [](const IncomingCall &call) {
    call.call_back("manual_backup_cancel_result", g_variant_new("(iu)", 0, call.req_id()),
                   [call] { call.reply(0); });
  });
  const Outcome outcome = quarnctl(bus(), {"cancel"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out, "the daemon has taken the cancellation\n");
}

TEST_F(Quarnctl, ASilentDaemonEndsEveryVerbWithATimeOut) {
  FakeDaemon daemon(bus());
  std::vector<std::string> methods = {"set_activation",        "backup_enable",
                                      "last_bu_time",          "get_app_list",
                                      "manual_backup_start",   "manual_backup_cancel",
                                      "app_data_backup_start", "app_data_restore_start",
                                      "make_app_data",         "restore_enable"};
  for (const std::string &method : methods) daemon.on(method, [](const IncomingCall &) {});
  const std::vector<std::vector<std::string>> verbs = {{"activate"},
                                                       {"auto", "on"},
                                                       {"last-time"},
                                                       {"list"},
                                                       {"sets"},
                                                       {"backup"},
                                                       {"cancel"},
                                                       {"app", "backup", "a"},
                                                       {"app", "restore", "a"},
                                                       {"app", "export", "a"},
                                                       {"restore", "off"},
                                                       {"restore", "on", "--from", "1"}};
  for (std::vector<std::string> arguments : verbs) {
    const std::string verb = arguments[0];
    arguments.insert(arguments.end(), {"--timeout", "0.1"});
    const Outcome outcome = quarnctl(bus(), arguments);
    EXPECT_EQ(outcome.exit, kTimedOut) << verb;
    EXPECT_EQ(outcome.err,
              verb == "backup"
                  ? "quarnctl: the backup has not ended within 0.1 seconds; it goes on (quarnctl "
                    "cancel stops it)\n"
                  : "quarnctl: no answer within 0.1 seconds\n");
  }
}

TEST_F(Quarnctl, ADaemonThatDiesIsToldAtOnce) {
  const std::vector<std::pair<std::string, std::vector<std::string>>> cases = {
      {"manual_backup_start", {"backup"}},
      {"get_app_list", {"list"}},
      {"app_data_backup_start", {"app", "backup", "a"}},
      {"make_app_data", {"app", "export", "a"}}};
  for (const auto &[method, arguments] : cases) {
    FakeDaemon daemon(bus());
    daemon.on(method, [&](const IncomingCall &) { daemon.die(); });
    const Outcome outcome = quarnctl(bus(), arguments);
    EXPECT_EQ(outcome.exit, kDaemonEnded) << method;
    EXPECT_EQ(outcome.err, "quarnctl: the daemon ended before it had answered\n");
  }
}

TEST_F(Quarnctl, ADaemonThatDiesDuringTheBackupIsToldAtOnce) {
  FakeDaemon daemon(bus());
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    call.call_back("manual_backup_status", status_arguments(0, QUARN_BACKUP_RUNNING, call.req_id()),
                   [&, call] {
                     call.reply(0);
                     daemon.die();
                   });
  });
  EXPECT_EQ(quarnctl(bus(), {"backup"}).exit, kDaemonEnded);
}

TEST_F(Quarnctl, AResultThatHasComeStandsWhenTheDaemonDiesBeforeItsReply) {
  FakeDaemon daemon(bus());
  daemon.on("app_data_backup_start", [&](const IncomingCall &call) {
    call.call_back("app_data_backup_complete", text_arguments(QUARN_UNCHANGED, "a", call.req_id()),
                   [&] { daemon.die(); });
  });
  EXPECT_EQ(quarnctl(bus(), {"app", "backup", "a"}).exit, QUARN_UNCHANGED);
}

TEST_F(Quarnctl, WithoutADaemonTheExitCodeIs69) {
  const Outcome outcome = quarnctl(bus(), {"backup"});
  EXPECT_EQ(outcome.exit, kUnreachable);
  EXPECT_EQ(outcome.err.rfind("quarnctl: cannot reach the daemon: ", 0), 0U) << outcome.err;
}

TEST_F(Quarnctl, ABusThatGoesAwayIsTold) {
  PrivateBus own_bus;
  FakeDaemon daemon(own_bus);
  g_dbus_connection_set_exit_on_close(daemon.connection(), FALSE);
  bool called = false;
  daemon.on("manual_backup_start", [&](const IncomingCall &) { called = true; });
  QuarnctlRun run(own_bus, {"backup"});
  ASSERT_TRUE(run_until([&] { return called; }));
  own_bus.stop();
  // Which of the two connections the bus closes first is its own affair.
  const int exit = run.wait().exit;
  EXPECT_TRUE(exit == kUnreachable || exit == kDaemonEnded) << exit;
}

TEST_F(Quarnctl, ErrorsOfTheBusHaveTheirOwnExitCodes) {
  const std::vector<std::tuple<std::string, int, std::string>> cases = {
      {"org.freedesktop.DBus.Error.AccessDenied", kDenied,
       "not permitted: this needs root, or to be in the group quarn"},
      {"org.freedesktop.DBus.Error.NotSupported", kUnusable, "the daemon refused the call: no"},
      {"org.freedesktop.DBus.Error.UnknownMethod", kUnusable, "the daemon refused the call: no"},
      {"org.freedesktop.DBus.Error.NoReply", kDaemonEnded,
       "the daemon ended before it had answered"},
      {"org.freedesktop.DBus.Error.Spawn.ChildExited", kUnreachable,
       "the daemon did not start (it ends at once when no cloud account is signed in): no"}};
  for (const auto &[name, exit, message] : cases) {
    FakeDaemon daemon(bus());
    const std::string error = name;
    daemon.on("make_app_data",
              [error](const IncomingCall &call) { call.reply_error(error.c_str(), "no"); });
    const Outcome outcome = quarnctl(bus(), {"app", "export", "a", "--json"});
    EXPECT_EQ(outcome.exit, exit) << name;
    EXPECT_EQ(outcome.err, "quarnctl: " + message + "\n");
    const JsonPtr document = json_parse(outcome.out);
    EXPECT_EQ(json_string(document.get(), "message"), message);
    EXPECT_EQ(json_integer(document.get(), "exit"), exit);
  }
}

TEST_F(Quarnctl, AReplyOfAnotherTypeIsUnusable) {
  FakeDaemon daemon(bus());
  daemon.on("make_app_data",
            [](const IncomingCall &call) { call.reply_raw(g_variant_new("(s)", "yes")); });
  EXPECT_EQ(quarnctl(bus(), {"app", "export", "a"}).exit, kUnusable);
}

TEST_F(Quarnctl, AppRequestsExitWithEveryResultCode) {
  std::vector<int> codes = kResultCodes;
  codes.push_back(0);
  for (const int code : codes) {
    FakeDaemon daemon(bus());
    const auto script = [code](const char *callback) {
      return [code, callback](const IncomingCall &call) {
        EXPECT_EQ(call.text_argument(0), "org.example.notes");
        call.call_back(callback, text_arguments(code, call.text_argument(0), call.req_id()),
                       [call, code] { call.reply(code == QUARN_BAD_ARGUMENT ? 1 : 0); });
      };
    };
    daemon.on("app_data_backup_start", script("app_data_backup_complete"));
    daemon.on("app_data_restore_start", script("app_data_restore_complete"));
    const Outcome backup = quarnctl(bus(), {"app", "backup", "org.example.notes"});
    const Outcome restore = quarnctl(bus(), {"app", "restore", "org.example.notes"});
    EXPECT_EQ(backup.exit, code);
    EXPECT_EQ(restore.exit, code);
    if (code == 0) {
      EXPECT_EQ(backup.out, "org.example.notes was backed up\n");
      EXPECT_EQ(restore.out, "org.example.notes was restored\n");
    } else {
      const std::string words =
          std::string(quarn_result_text(code)) + " (" + std::to_string(code) + ")\n";
      EXPECT_EQ(backup.err, "quarnctl: backup of org.example.notes failed: " + words);
      EXPECT_EQ(restore.err, "quarnctl: restore of org.example.notes failed: " + words);
    }
  }
}

TEST_F(Quarnctl, AppExportTellsWhereTheArchiveLies) {
  FakeDaemon daemon(bus());
  int result = 0;
  daemon.on("make_app_data", [&](const IncomingCall &call) { call.reply(result); });
  Outcome outcome = quarnctl(bus(), {"app", "export", "org.example.notes"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out, "/tmp/org.example.notes_tmp.zip\n");
  result = QUARN_REFUSED;
  outcome = quarnctl(bus(), {"app", "export", "org.example.notes"});
  EXPECT_EQ(outcome.exit, QUARN_REFUSED);
  EXPECT_EQ(outcome.out, "");
}

TEST_F(Quarnctl, WrongArgumentsExitWith64AndSayWhyInJsonToo) {
  Outcome outcome = quarnctl(bus(), {"backup", "now"});
  EXPECT_EQ(outcome.exit, kUsage);
  EXPECT_EQ(outcome.err, "quarnctl: usage: quarnctl backup\n");
  EXPECT_EQ(outcome.out, "");
  outcome = quarnctl(bus(), {"--json", "fly"});
  EXPECT_EQ(outcome.exit, kUsage);
  EXPECT_EQ(json_integer(json_parse(outcome.out).get(), "exit"), kUsage);
}

TEST_F(Quarnctl, HelpAndVersionNeedNoBus) {
  EXPECT_EQ(quarnctl(bus(), {"--help"}).exit, 0);
  const Outcome help = quarnctl(bus(), {"restore", "on", "--help"});
  EXPECT_EQ(help.exit, 0);
  EXPECT_NE(help.out.find("--from SERIAL"), std::string::npos);
  EXPECT_EQ(quarnctl(bus(), {"--version"}).out.rfind("quarnctl ", 0), 0U);
}

/** A run of three packages, told by progress signals as the daemon publishes them. */
void script_reported_backup(FakeDaemon &daemon) {
  daemon.on("manual_backup_start", [&daemon](const IncomingCall &call) {
    const std::uint32_t req = call.req_id();
    const auto publish = [&daemon](const std::string &members) {
      daemon.publish(R"({"run":2,"kind":"backup",)" + members + "}");
    };
    call.call_back(
        "manual_backup_status", status_arguments(0, QUARN_BACKUP_RUNNING, req), [=, &daemon] {
          call.reply(0);
          daemon.publish("no JSON");
          daemon.publish("[1]");
          daemon.publish(
              R"({"kind":"restore","stage":"downloading","package":"org.example.notes"})");
          // An automatic run that was going on has nothing to do with this one.
          daemon.publish(R"({"run":1,"kind":"backup","stage":"uploading","package":"other",)"
                         R"("index":1,"count":1,"outcome":"uploaded"})");
          publish(R"("stage":"checking","index":0,"count":0,"bytes_done":0,"bytes_total":0)");
          publish(R"("stage":"archiving","index":0,"count":0)");
          publish(R"("stage":"archiving","package":"org.example.video","index":1,"count":0,)"
                  R"("outcome":"skipped","reason":"too-large","size":28311552,"cap":26214400)");
          publish(R"("stage":"archiving","package":"b\u001b[2Jad","index":2,"count":0,)"
                  R"("outcome":"unchanged","reason":"unchanged")");
          publish(R"("stage":"uploading","index":0,"count":1,"bytes_done":0,"bytes_total":2048)");
          publish(R"("stage":"uploading","package":"org.example.notes","index":1,"count":1,)"
                  R"("bytes_done":2048,"bytes_total":2048,"outcome":"uploaded","size":2048)");
          publish(R"("stage":"finished","result":0)");
          call.call_back("manual_backup_status", status_arguments(0, QUARN_BACKUP_SUCCEEDED, req));
        });
  });
}

constexpr char kBackupTable[] =
    "PACKAGE            OUTCOME    SIZE      WHY\n"
    "org.example.video  skipped    27.0 MiB  27.0 MiB of data, at most 25.0 MiB\n"
    "b\\x1b[2Jad         unchanged  -         the cloud holds it already\n"
    "org.example.notes  uploaded   2.0 KiB\n";

TEST_F(Quarnctl, ProgressIsPlainLinesAndATableWhereNothingCanBeRedrawn) {
  FakeDaemon daemon(bus());
  script_reported_backup(daemon);
  const Outcome outcome = quarnctl(bus(), {"backup"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out, std::string("backup started\n"
                                     "other: uploaded\n"
                                     "checking the application list in the cloud\n"
                                     "making archives\n"
                                     "org.example.video: skipped (27.0 MiB of data, at most 25.0 "
                                     "MiB)\n"
                                     "b\\x1b[2Jad: unchanged (the cloud holds it already)\n"
                                     "uploading\n"
                                     "org.example.notes: uploaded\n"
                                     "backup finished\n") +
                             kBackupTable + "backup succeeded\n");
}

TEST_F(Quarnctl, ProgressIsABarOnATerminal) {
  FakeDaemon daemon(bus());
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    daemon.publish(R"({"run":1,"kind":"backup","stage":"uploading","index":1,"count":2,)"
                   R"("bytes_done":1048576,"bytes_total":2097152})");
    daemon.publish(R"({"run":1,"kind":"backup","stage":"archiving","package":"a\u001b[2J",)"
                   R"("outcome":"unchanged","reason":"unchanged"})");
    call.reply(0);
    call.call_back("manual_backup_status",
                   status_arguments(0, QUARN_BACKUP_SUCCEEDED, call.req_id()));
  });
  const Outcome outcome = QuarnctlRun(bus(), {"backup"}, 80).wait();
  EXPECT_EQ(outcome.exit, 0);
  const std::string bar =
      "\r\033[K[############------------]  50%  uploading  1 of 2  1.0 MiB of 2.0 MiB";
  const std::string end =
      "\r\033[KPACKAGE   OUTCOME    SIZE  WHY\r\n"
      "a\\x1b[2J  unchanged  -     the cloud holds it already\r\n"
      "backup succeeded\r\n";
  EXPECT_EQ(outcome.out.substr(0, bar.size()), bar);
  ASSERT_GE(outcome.out.size(), end.size());
  EXPECT_EQ(outcome.out.substr(outcome.out.size() - end.size()), end);
  EXPECT_EQ(outcome.out.find("\033[2J"), std::string::npos);
}

TEST_F(Quarnctl, TheBarOfANarrowTerminalDoesNotWrap) {
  FakeDaemon daemon(bus());
  daemon.on("manual_backup_start", [&](const IncomingCall &call) {
    daemon.publish(R"({"run":1,"kind":"backup","stage":"uploading","index":1,"count":2,)"
                   R"("bytes_done":1048576,"bytes_total":2097152})");
    call.reply(0);
    call.call_back("manual_backup_status",
                   status_arguments(0, QUARN_BACKUP_SUCCEEDED, call.req_id()));
  });
  const Outcome outcome = QuarnctlRun(bus(), {"backup"}, 20).wait();
  EXPECT_EQ(outcome.out.find("\r\033[K[############---...\r\033[K"), 0U) << outcome.out;
}

TEST_F(Quarnctl, ProgressIsPartOfTheJsonDocument) {
  FakeDaemon daemon(bus());
  script_reported_backup(daemon);
  const Outcome outcome = quarnctl(bus(), {"backup", "--json"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out,
            R"({"verb":"backup","packages":[{"package":"org.example.video","outcome":"skipped",)"
            R"("reason":"too-large","size":28311552,"cap":26214400},)"
            R"({"package":"b\u001b[2Jad","outcome":"unchanged","reason":"unchanged"},)"
            R"({"package":"org.example.notes","outcome":"uploaded","size":2048}],)"
            R"("exit":0,"message":"success"})"
            "\n");
}

}  // namespace
