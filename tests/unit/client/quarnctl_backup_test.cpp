// What a backup would remove, and what its failure is told with.
#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>

#include "arguments.h"
#include "fake_daemon.h"
#include "json_read.h"
#include "quarn_common.h"

namespace {

using quarn_client::json_member;
using quarn_client::json_parse;
using quarn_client::json_string;

constexpr int kUnconfirmed = 65;
constexpr int kDaemonEnded = 70;
constexpr int kInterrupted = 130;
constexpr unsigned short kColumns = 200;

constexpr char kList[] =
    R"({"format_ver":1,"model_list":[)"
    R"({"backup_info":{"serial_number":"1"},"pkg_list":[)"
    R"({"pkg_id":"org.here","version":"1","crc":1},{"pkg_id":"org.gone","version":"1","crc":1},)"
    R"({"pkg_id":"org.gone","version":"2","crc":1},{"pkg_id":"org.waited","version":"1"}]},)"
    R"({"backup_info":{"serial_number":"2"},"pkg_list":[)"
    R"({"pkg_id":"org.others","version":"1","crc":1}]}]})";

class QuarnctlBackup : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { bus_ = new PrivateBus; }
  static void TearDownTestSuite() {
    delete bus_;
    bus_ = nullptr;
  }
  QuarnctlBackup() : daemon_(*bus_) {
    serve(true);
    daemon_.serve_kept_packages(g_variant_new_parsed("['org.here', 'org.waited']"));
    answer_list(0, kList);
    daemon_.on("manual_backup_start", [this](const IncomingCall &call) {
      const std::uint32_t req = call.req_id();
      for (const std::string &text : progress_) daemon_.publish(text);
      call.call_back("manual_backup_status",
                     status_arguments(
                         result_, result_ == 0 ? QUARN_BACKUP_SUCCEEDED : QUARN_BACKUP_FAILED, req),
                     [call] { call.reply(0); });
    });
  }

  void serve(bool wifi, const char *problem = "") {
    daemon_.serve_status(
        g_variant_new_parsed("{'WifiConnected': <%b>, 'SerialNumber': <'1'>, 'CloudProblem': <%s>}",
                             static_cast<gboolean>(wifi), problem));
  }
  void answer_list(int error, const std::string &text) {
    daemon_.on("get_app_list", [=](const IncomingCall &call) {
      const std::uint32_t req = call.req_id();
      call.reply(0);
      call.call_back("get_app_list_cb", text_arguments(error, text, req));
    });
  }
  void finish_with(int result, const std::string &members, const std::string &outcome = "") {
    result_ = result;
    progress_.clear();
    if (!outcome.empty()) {
      progress_.push_back(R"({"kind":"backup","run":1,"stage":"uploading","package":"org.here",)" +
                          outcome + "}");
    }
    progress_.push_back(R"({"kind":"backup","run":1,"stage":"finished","result":)" +
                        std::to_string(result) + members + "}");
  }
  std::string error_of_run() { return quarnctl(*bus_, {"backup", "--yes"}).err; }
  bool started() const {
    const auto &calls = daemon_.calls();
    return std::find(calls.begin(), calls.end(), "manual_backup_start") != calls.end();
  }

  static PrivateBus *bus_;
  FakeDaemon daemon_;
  int result_ = 0;
  std::vector<std::string> progress_;
};

PrivateBus *QuarnctlBackup::bus_ = nullptr;

/* ---- what would go ---- */

TEST_F(QuarnctlBackup, ThatWouldRemoveAPackageIsNotBegunWhereNobodyCanBeAsked) {
  const Outcome outcome = quarnctl(*bus_, {"backup"});
  EXPECT_EQ(outcome.exit, kUnconfirmed);
  EXPECT_EQ(outcome.err,
            "quarnctl: the backup would remove 1 package that is not installed from the cloud: "
            "org.gone; quarnctl backup --yes does, quarnctl restore on --from 1 gets them back as "
            "they are installed\n");
  EXPECT_FALSE(started());
}

TEST_F(QuarnctlBackup, ADaemonThatDiesWithTheListUntoldIsToldAtOnce) {
  daemon_.on("get_app_list", [this](const IncomingCall &call) {
    call.reply(0);
    daemon_.die();
  });
  const Outcome outcome = quarnctl(*bus_, {"backup"});
  EXPECT_EQ(outcome.exit, kDaemonEnded);
  EXPECT_EQ(outcome.err, "quarnctl: the daemon ended before it had answered\n");
  EXPECT_FALSE(started());
}

TEST_F(QuarnctlBackup, TheDocumentNamesWhatWouldGo) {
  const Outcome outcome = quarnctl(*bus_, {"backup", "--json"});
  EXPECT_EQ(outcome.exit, kUnconfirmed);
  const JsonPtr document = json_parse(outcome.out);
  json_object *names = json_member(document.get(), "would_remove", json_type_array);
  ASSERT_EQ(json_object_array_length(names), 1U);
  EXPECT_STREQ(json_object_get_string(json_object_array_get_idx(names, 0)), "org.gone");
  EXPECT_FALSE(started());
}

TEST_F(QuarnctlBackup, YesAsksNothing) {
  const Outcome outcome = quarnctl(*bus_, {"backup", "--yes"});
  EXPECT_EQ(outcome.exit, 0) << outcome.err;
  EXPECT_EQ(daemon_.calls(), std::vector<std::string>{"manual_backup_start"});
}

TEST_F(QuarnctlBackup, ThatRemovesNothingAsksNothing) {
  daemon_.serve_kept_packages(g_variant_new_parsed("['org.gone', 'org.here', 'org.waited']"));
  EXPECT_EQ(quarnctl(*bus_, {"backup"}).exit, 0);
  EXPECT_TRUE(started());
}

TEST_F(QuarnctlBackup, WhatCannotBeFoundOutIsNotAskedAbout) {
  for (const auto &[error, text] :
       {std::pair{1, "none"}, {0, "not a list"}, {0, R"({"format_ver":1,"model_list":[]})"}}) {
    answer_list(error, text);
    EXPECT_EQ(quarnctl(*bus_, {"backup"}).exit, 0) << text;
  }
  answer_list(0, kList);
  daemon_.serve_kept_packages(g_variant_new_parsed("'no list'"));
  EXPECT_EQ(quarnctl(*bus_, {"backup"}).exit, 0);
  serve(false);
  daemon_.serve_kept_packages(g_variant_new_parsed("@as []"));
  EXPECT_EQ(quarnctl(*bus_, {"backup"}).exit, 0);
  EXPECT_EQ(daemon_.calls().back(), "manual_backup_start");
}

TEST_F(QuarnctlBackup, AListThatCannotBeHadEndsItAsTheRunWouldEnd) {
  answer_list(1, "none");
  for (const auto &[problem, error] :
       {std::pair{"network",
                  "the cloud's application list could not be checked, or a request was "
                  "not accepted (13): the cloud cannot be reached"},
        {"device-full", "this device has no room left (13)"}}) {
    serve(true, problem);
    const Outcome outcome = quarnctl(*bus_, {"backup"});
    EXPECT_EQ(outcome.exit, 13);
    EXPECT_EQ(outcome.err, std::string("quarnctl: backup failed: ") + error + "\n");
  }
  answer_list(33, "failed");
  const Outcome outcome = quarnctl(*bus_, {"backup"});
  EXPECT_EQ(outcome.exit, 33);
  EXPECT_EQ(outcome.err, "quarnctl: backup failed: no Wi-Fi, or no session with the cloud (33)\n");
  EXPECT_FALSE(started());
}

TEST_F(QuarnctlBackup, OnATerminalItIsAsked) {
  struct {
    const char *typed;
    int exit;
  } const cases[] = {{"y\n", 0},
                     {"yes\n", 0},
                     {"n\n", kUnconfirmed},
                     {"\n", kUnconfirmed},
                     {"yesterday\n", kUnconfirmed},
                     {"\x04", kUnconfirmed}};
  for (const auto &one : cases) {
    QuarnctlRun run(*bus_, {"backup"}, kColumns);
    ASSERT_TRUE(run_until(
        [&] { return run.shown().find("back up and remove? [y/N] ") != std::string::npos; }));
    EXPECT_NE(run.shown().find("the backup would remove 1 package that is not installed from the "
                               "cloud: org.gone\r\n"),
              std::string::npos)
        << run.shown();
    run.type(one.typed);
    const Outcome outcome = run.wait();
    EXPECT_EQ(outcome.exit, one.exit) << one.typed;
    if (one.exit != 0) {
      EXPECT_EQ(outcome.err, "quarnctl: not confirmed; nothing was backed up\n");
    }
  }
}

TEST_F(QuarnctlBackup, AnInterruptAtTheQuestionLeavesAndCancelsNothing) {
  QuarnctlRun run(*bus_, {"backup"}, kColumns);
  ASSERT_TRUE(run_until([&] { return run.shown().find("[y/N] ") != std::string::npos; }));
  run.signal(SIGTERM);
  EXPECT_EQ(run.wait().exit, kInterrupted);
  EXPECT_EQ(daemon_.calls(), std::vector<std::string>{"get_app_list"});
}

TEST_F(QuarnctlBackup, YesBelongsToBackup) {
  const Outcome outcome = quarnctl(*bus_, {"list", "--yes"});
  EXPECT_EQ(outcome.exit, 64);
  EXPECT_EQ(outcome.err, "quarnctl: --yes belongs to backup\n");
}

/* ---- why it failed ---- */

TEST_F(QuarnctlBackup, TheDevicesAndTheListsCausesTakeThePlaceOfTheCodesWords) {
  const std::vector<std::pair<std::string, std::string>> words = {
      {"wifi", "Wi-Fi was lost"},
      {"device-full", "this device has no room left"},
      {"device-file", "a file on this device could not be read or written"},
      {"removed", "a package was removed while it was backed up"},
      {"list-foreign", "the cloud's application list is in a form that this device does not know"},
      {"list-too-large", "the application list is larger than what devices can read"},
      {"list-unreadable", "the application list could not be read"},
      {"list-changed", "another device changed the application list meanwhile"}};
  for (const int code : {12, 13, 42}) {
    for (const auto &[word, text] : words) {
      finish_with(code, R"(,"cause":")" + word + "\"");
      EXPECT_EQ(error_of_run(),
                "quarnctl: backup failed: " + text + " (" + std::to_string(code) + ")\n");
    }
  }
}

TEST_F(QuarnctlBackup, TheRunsCauseCountsWhateverTheStatusSaysByThen) {
  serve(true, "network");
  finish_with(12, R"(,"cause":"space")");
  EXPECT_EQ(error_of_run(),
            "quarnctl: backup failed: the transfer failed or Wi-Fi was lost (12): the cloud is "
            "full\n");
}

TEST_F(QuarnctlBackup, WithoutACauseOfTheRunTheStatusIsAsked) {
  serve(true, "device-full");
  finish_with(12, "");
  EXPECT_EQ(error_of_run(), "quarnctl: backup failed: this device has no room left (12)\n");
}

TEST_F(QuarnctlBackup, AnUploadErrorSaysThatNoListWasWritten) {
  for (const char *outcome :
       {R"("outcome":"uploaded")", R"("outcome":"failed","reason":"upload-failed")"}) {
    finish_with(12, R"(,"cause":"space","list_written":false)", outcome);
    EXPECT_EQ(error_of_run(),
              "quarnctl: no list was written: what this backup sent of changed packages cannot be "
              "restored yet; the next backup sends it again\n"
              "quarnctl: backup failed: the transfer failed or Wi-Fi was lost (12): the cloud is "
              "full\n");
  }
  finish_with(12, R"(,"list_written":true)", R"("outcome":"uploaded")");
  EXPECT_EQ(error_of_run(),
            "quarnctl: backup failed: the transfer failed or Wi-Fi was lost (12)\n");
}

TEST_F(QuarnctlBackup, TheDocumentHoldsCauseAndList) {
  finish_with(12, R"(,"cause":"removed","list_written":false)", R"("outcome":"uploaded")");
  const JsonPtr document = json_parse(quarnctl(*bus_, {"backup", "--yes", "--json"}).out);
  EXPECT_EQ(json_string(document.get(), "cloud_problem"), "removed");
  json_object *written = json_member(document.get(), "list_written", json_type_boolean);
  ASSERT_NE(written, nullptr);
  EXPECT_FALSE(json_object_get_boolean(written));
}

TEST_F(QuarnctlBackup, AListThatIsNearlyFullIsNoted) {
  finish_with(0, "");
  progress_.insert(progress_.begin(),
                   R"({"kind":"backup","run":1,"stage":"archiving","notice":"list-nearly-full",)"
                   R"("size":3145728,"cap":4194304})");
  const Outcome outcome = quarnctl(*bus_, {"backup", "--yes"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.err,
            "quarnctl: note: the application list is nearly full: 3.0 MiB of at most 4.0 MiB; once "
            "it is full no device of the account can back up\n");
}

TEST_F(QuarnctlBackup, ReasonsOfPackagesAreToldApart) {
  const std::vector<std::pair<std::string, std::string>> words = {
      {"external", "its data is on external storage"},
      {"disabled", "the application does not allow it"},
      {"removed", "it was removed meanwhile"},
      {"too-deep", "its folders are nested too deeply"},
      {"unreadable", "its data could not be read"},
      {"restoring", "a restore is to have its backup first"}};
  for (const auto &[reason, text] : words) {
    finish_with(0, "", R"("outcome":"skipped","reason":")" + reason + "\"");
    EXPECT_NE(quarnctl(*bus_, {"backup", "--yes"}).out.find("org.here: skipped (" + text + ")\n"),
              std::string::npos);
  }
}

TEST_F(QuarnctlBackup, AFullDevicesListIsNotAnEmptyOne) {
  serve(true, "device-full");
  answer_list(1, "none");
  const Outcome outcome = quarnctl(*bus_, {"list"});
  EXPECT_EQ(outcome.exit, 1);
  EXPECT_EQ(outcome.err,
            "quarnctl: getting the application list failed: this device has no room left (1)\n");
  EXPECT_NE(quarnctl(*bus_, {"status"}).out.find("last problem      this device has no room left"),
            std::string::npos);
}

}  // namespace
