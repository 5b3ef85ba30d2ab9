#include <gtest/gtest.h>

#include <csignal>

#include "fake_daemon.h"
#include "json_read.h"
#include "quarn_common.h"

namespace {

using quarn_client::json_integer;
using quarn_client::json_parse;

constexpr int kUsage = 64;
constexpr int kDaemonEnded = 70;
constexpr int kTimedOut = 75;
constexpr int kInterrupted = 130;

constexpr char kSerial[] = "350000000000001";
constexpr char kList[] =
    R"({"format_ver":1,"model_list":[{"backup_info":{"serial_number":"350000000000001"},)"
    R"("pkg_list":[{"pkg_id":"org.example.notes","version":"1","crc":7},)"
    R"({"pkg_id":"org.example.photos","version":"1","crc":8},)"
    R"({"pkg_id":"org.example.bank","version":"1","crc":0}]},)"
    R"({"backup_info":{"serial_number":"empty"},"pkg_list":[]}]})";

class QuarnctlRestore : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { bus_ = new PrivateBus; }
  static void TearDownTestSuite() {
    delete bus_;
    bus_ = nullptr;
  }

  void SetUp() override {
    daemon_ = std::make_unique<FakeDaemon>(*bus_);
    daemon_->on("get_app_list", [](const IncomingCall &call) {
      const std::uint32_t req = call.req_id();
      call.reply(0);
      call.call_back("get_app_list_cb", text_arguments(0, kList, req));
    });
    daemon_->on("restore_enable", [this](const IncomingCall &call) {
      on_ = call.int_argument(0);
      client_ = call.int_argument(1);
      serial_ = call.text_argument(2);
      packages_ = call.text_argument(3);
      req_ = call.req_id();
      call.reply(reply_);
      if (enabled_) enabled_(call);
    });
  }

  static Outcome run(const std::vector<std::string> &arguments) {
    return quarnctl(*bus_, arguments);
  }

  /** Publishes that a package is done. */
  void tell(const std::string &package, const std::string &rest) {
    tell_raw(R"("stage":"finished","package":")" + package + R"(",)" + rest);
  }
  void tell_raw(const std::string &members) {
    daemon_->publish(R"({"kind":"restore",)" + members + "}");
  }
  /** Ends restore mode, as the daemon does when the last package is done. */
  void stop(const IncomingCall &call) const {
    call.call_back("restore_enable_cb", text_arguments(0, "restore_stop", req_));
  }
  void tell_restored(const std::string &package) {
    tell(package, R"("outcome":"restored","result":0)");
  }

  static PrivateBus *bus_;
  std::unique_ptr<FakeDaemon> daemon_;
  FakeDaemon::Script enabled_; /**< what happens once restore mode is on */
  int reply_ = 0;
  int on_ = -1;
  int client_ = -1;
  std::string serial_;
  std::string packages_;
  std::uint32_t req_ = 0;
};

PrivateBus *QuarnctlRestore::bus_ = nullptr;

TEST_F(QuarnctlRestore, OnNamesEveryPackageOfTheSetWhenNoneIsGiven) {
  const Outcome outcome = run({"restore", "on", "--from", kSerial});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out, "restore mode is on for 3 packages of 350000000000001\n");
  EXPECT_EQ(on_, 1);
  EXPECT_EQ(client_, 0);
  EXPECT_EQ(serial_, kSerial);
  EXPECT_EQ(packages_, R"(["org.example.notes","org.example.photos","org.example.bank"])");
}

TEST_F(QuarnctlRestore, OnKeepsTheOrderOfTheNamedPackagesAndNamesEachOnce) {
  EXPECT_EQ(run({"restore", "on", "org.example.photos", "--from=350000000000001",
                 "org.example.notes", "org.example.photos"})
                .exit,
            0);
  EXPECT_EQ(packages_, R"(["org.example.photos","org.example.notes"])");
}

TEST_F(QuarnctlRestore, OnRefusesWhatTheCloudDoesNotHold) {
  Outcome outcome = run({"restore", "on", "--from", "nobody"});
  EXPECT_EQ(outcome.exit, QUARN_BAD_ARGUMENT);
  EXPECT_EQ(outcome.err,
            "quarnctl: the cloud holds no backup of a device nobody; quarnctl sets shows the "
            "devices\n");
  outcome = run({"restore", "on", "--from", kSerial, "org.example.chess"});
  EXPECT_EQ(outcome.exit, QUARN_BAD_ARGUMENT);
  EXPECT_EQ(outcome.err,
            "quarnctl: the backup of 350000000000001 holds no package org.example.chess\n");
  outcome = run({"restore", "on", "--from", "empty"});
  EXPECT_EQ(outcome.exit, QUARN_BAD_ARGUMENT);
  EXPECT_EQ(on_, -1);
}

TEST_F(QuarnctlRestore, OnNeedsADevice) {
  EXPECT_EQ(run({"restore", "on"}).exit, kUsage);
  EXPECT_EQ(run({"restore", "on", "--from", ""}).exit, kUsage);
}

TEST_F(QuarnctlRestore, ARefusedRestoreModeExitsWithTheReply) {
  reply_ = QUARN_REFUSED;
  EXPECT_EQ(run({"restore", "on", "--from", kSerial}).exit, QUARN_REFUSED);
  EXPECT_EQ(run({"restore", "off"}).exit, QUARN_REFUSED);
}

TEST_F(QuarnctlRestore, OffTurnsTheModeOff) {
  const Outcome outcome = run({"restore", "off"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out, "restore mode is off\n");
  EXPECT_EQ(on_, 0);
  EXPECT_EQ(packages_, "[]");
}

TEST_F(QuarnctlRestore, WatchEndsWhenEveryPackageIsToldOf) {
  enabled_ = [&](const IncomingCall &call) {
    tell_raw(R"("stage":"downloading","package":"org.example.notes")");
    tell("org.example.chess", R"("outcome":"failed","result":12)");
    tell_restored("org.example.notes");
    tell_restored("org.example.photos");
    tell("org.example.bank", R"("outcome":"skipped","result":41)");
    stop(call);
  };
  const Outcome outcome = run({"restore", "on", "--from", kSerial, "--watch"});
  EXPECT_EQ(outcome.exit, 0) << "a package without an archive cannot come back";
  EXPECT_EQ(outcome.out,
            "restore mode is on for 3 packages of 350000000000001\n"
            "org.example.notes: restored\n"
            "org.example.photos: restored\n"
            "org.example.bank: skipped (the package does not allow backup)\n"
            "PACKAGE             OUTCOME   SIZE  WHY\n"
            "org.example.notes   restored  -\n"
            "org.example.photos  restored  -\n"
            "org.example.bank    skipped   -     the package does not allow backup\n"
            "restore finished\n");
}

TEST_F(QuarnctlRestore, WatchTakesASignalThatComesBeforeTheReply) {
  daemon_->on("restore_enable", [&](const IncomingCall &call) {
    req_ = call.req_id();
    tell_restored("org.example.notes");
    call.reply(0);
    stop(call);
  });
  EXPECT_EQ(run({"restore", "on", "--from", kSerial, "org.example.notes", "--watch"}).exit, 0);
}

TEST_F(QuarnctlRestore, WatchExitsWithTheResultOfTheFirstPackageThatFailed) {
  enabled_ = [&](const IncomingCall &call) {
    tell("org.example.photos", R"("outcome":"rolled-back","result":36)");
    tell("org.example.notes", R"("outcome":"failed","result":12)");
    stop(call);
  };
  const Outcome outcome = run(
      {"restore", "on", "--from", kSerial, "--watch", "org.example.photos", "org.example.notes"});
  EXPECT_EQ(outcome.exit, QUARN_REFUSED);
  EXPECT_EQ(outcome.err,
            "quarnctl: not every package was restored: refused, or information or files could "
            "not be read or written (36)\n");
}

TEST_F(QuarnctlRestore, AFailureThatNamesNoResultExitsWith42) {
  enabled_ = [&](const IncomingCall &call) {
    tell("org.example.notes", R"("outcome":"failed")");
    stop(call);
  };
  EXPECT_EQ(run({"restore", "on", "--from", kSerial, "--watch", "org.example.notes"}).exit,
            QUARN_FAILED);
}

TEST_F(QuarnctlRestore, WatchEndsWithTheModeAndNamesWhatWasNotInstalled) {
  enabled_ = [&](const IncomingCall &call) {
    tell_restored("org.example.notes");
    stop(call);
  };
  const Outcome outcome = run({"restore", "on", "--from", kSerial, "--watch"});
  EXPECT_EQ(outcome.exit, QUARN_CANCELLED);
  EXPECT_NE(outcome.out.find("org.example.photos  skipped   -     restore mode ended before it was "
                             "installed\n"),
            std::string::npos)
      << outcome.out;
}

TEST_F(QuarnctlRestore, WatchEndsWithoutTheDaemonsLastMessageWhenEveryPackageIsToldOf) {
  for (const bool daemon_ends : {false, true}) {
    if (!daemon_) SetUp();
    enabled_ = [&, daemon_ends](const IncomingCall &) {
      tell_restored("org.example.notes");
      if (daemon_ends) daemon_->die();
    };
    EXPECT_EQ(run({"restore", "on", "--from", kSerial, "--watch", "org.example.notes"}).exit, 0);
    daemon_.reset();
  }
}

TEST_F(QuarnctlRestore, MessagesOfTheDaemonAreShown) {
  enabled_ = [&](const IncomingCall &call) {
    call.call_back("restore_enable_cb", text_arguments(12, "no\u202eway", req_), [&, call] {
      tell_restored("org.example.notes");
      stop(call);
    });
  };
  const Outcome outcome = run({"restore", "on", "--from", kSerial, "--watch", "org.example.notes"});
  EXPECT_NE(outcome.out.find("no\\u{202e}way: the transfer failed or Wi-Fi was lost (12)\n"),
            std::string::npos)
      << outcome.out;
}

TEST_F(QuarnctlRestore, ADaemonThatEndsBeforeTheLastPackageLeavesItsFateUnknown) {
  enabled_ = [&](const IncomingCall &) {
    tell_restored("org.example.notes");
    daemon_->die();
  };
  const Outcome outcome = run({"restore", "on", "--from", kSerial, "--watch", "--json"});
  EXPECT_EQ(outcome.exit, kDaemonEnded);
  EXPECT_EQ(outcome.err,
            "quarnctl: the daemon ended before it had told what became of org.example.photos "
            "org.example.bank\n");
  EXPECT_EQ(json_integer(json_parse(outcome.out).get(), "exit"), kDaemonEnded);
}

TEST_F(QuarnctlRestore, ADaemonThatReportsNothingIsSaidToHave) {
  enabled_ = [&](const IncomingCall &) { daemon_->die(); };
  const Outcome outcome = run({"restore", "on", "--from", kSerial, "--watch", "org.example.notes"});
  EXPECT_EQ(outcome.exit, kDaemonEnded);
  EXPECT_EQ(outcome.err,
            "quarnctl: the daemon ended before it had told what became of org.example.notes (it "
            "reported no progress at all)\n");
}

TEST_F(QuarnctlRestore, AnInterruptEndsTheWatchingNotTheMode) {
  QuarnctlRun watching(*bus_, {"restore", "on", "--from", kSerial, "--watch"});
  enabled_ = [&](const IncomingCall &call) {
    // Once this is answered, the reply has been taken and the watching has begun.
    call.call_back("restore_enable_cb", text_arguments(0, "watching", req_),
                   [&] { watching.signal(SIGINT); });
  };
  const Outcome outcome = watching.wait();
  EXPECT_EQ(outcome.exit, kInterrupted);
  EXPECT_EQ(outcome.err,
            "quarnctl: no longer watching; restore mode stays on (quarnctl restore off ends it)\n");
  EXPECT_EQ(daemon_->calls(), (std::vector<std::string>{"get_app_list", "restore_enable"}));
}

TEST_F(QuarnctlRestore, ATimeOutThatIsGivenBoundsTheWatching) {
  const Outcome outcome = run({"restore", "on", "--from", kSerial, "--watch", "--timeout", "0.5"});
  EXPECT_EQ(outcome.exit, kTimedOut);
  EXPECT_EQ(outcome.err,
            "quarnctl: not all packages were restored within 0.5 seconds; restore mode stays on "
            "(quarnctl restore off ends it)\n");
}

TEST_F(QuarnctlRestore, ProgressIsABarOnATerminal) {
  daemon_->on("restore_enable", [&](const IncomingCall &call) {
    tell_restored("org.example.notes");
    req_ = call.req_id();
    call.reply(0);
    tell_restored("org.example.photos");
    stop(call);
  });
  const Outcome outcome = QuarnctlRun(*bus_,
                                      {"restore", "on", "--from", kSerial, "--watch",
                                       "org.example.notes", "org.example.photos"},
                                      80)
                              .wait();
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_NE(
      outcome.out.find("\r\033[K[############------------]  50%  finished  org.example.notes"),
      std::string::npos)
      << outcome.out;
}

}  // namespace
