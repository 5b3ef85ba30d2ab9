#include <gtest/gtest.h>

#include "fake_daemon.h"
#include "json_read.h"
#include "quarn_common.h"

namespace {

using quarn_client::json_integer;
using quarn_client::json_member;
using quarn_client::json_parse;
using quarn_client::json_string;

constexpr int kUnusable = 76;

class QuarnctlStatus : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { bus_ = new PrivateBus; }
  static void TearDownTestSuite() {
    delete bus_;
    bus_ = nullptr;
  }

  void SetUp() override { daemon_ = std::make_unique<FakeDaemon>(*bus_); }

  void serve(bool wifi) {
    daemon_->serve_status(g_variant_parse(
        G_VARIANT_TYPE_VARDICT,
        wifi ? "{'WifiConnected': <true>, 'SerialNumber': <'1'>, 'AutoBackup': <true>}"
             : "{'WifiConnected': <false>, 'SerialNumber': <'1'>, 'AutoBackup': <true>}",
        nullptr, nullptr, nullptr));
  }
  void answer_list(int error, const std::string &text) {
    daemon_->on("get_app_list", [=](const IncomingCall &call) {
      const std::uint32_t req = call.req_id();
      call.call_back("get_app_list_cb", text_arguments(error, text, req),
                     [call, error] { call.reply(error == QUARN_NO_SESSION ? error : 0); });
    });
  }

  static PrivateBus *bus_;
  std::unique_ptr<FakeDaemon> daemon_;
};

PrivateBus *QuarnctlStatus::bus_ = nullptr;

TEST_F(QuarnctlStatus, ShowsTheDaemonAndThisDevicesPackages) {
  serve(true);
  answer_list(0,
              R"({"format_ver":1,"model_list":[)"
              R"({"backup_info":{"serial_number":"2"},"pkg_list":[{"pkg_id":"b","version":"1"}]},)"
              R"({"backup_info":{"serial_number":"1"},)"
              R"("pkg_list":[{"pkg_id":"a","version":"1","crc":1}]}]})");
  const Outcome outcome = quarnctl(*bus_, {"status"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_NE(outcome.out.find("automatic backup  on\n"), std::string::npos);
  EXPECT_NE(outcome.out.find("packages          1 in the cloud's list\n"
                             "PACKAGE  VERSION  CRC\n"
                             "a        1        00000001\n"),
            std::string::npos)
      << outcome.out;
  const JsonPtr document = json_parse(quarnctl(*bus_, {"status", "--json"}).out);
  EXPECT_EQ(json_string(document.get(), "serial"), "1");
  json_object *packages = json_member(document.get(), "packages", json_type_array);
  ASSERT_NE(packages, nullptr);
  ASSERT_EQ(json_object_array_length(packages), 1U);
  EXPECT_EQ(json_string(json_object_array_get_idx(packages, 0), "package"), "a");
}

TEST_F(QuarnctlStatus, ADeviceThatIsNotInTheListHasNoPackages) {
  serve(true);
  answer_list(0, R"({"format_ver":1,"model_list":[]})");
  const Outcome outcome = quarnctl(*bus_, {"status"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_NE(outcome.out.find("packages          0 in the cloud's list\n"), std::string::npos);
}

TEST_F(QuarnctlStatus, WithoutWifiTheCloudIsNotAsked) {
  serve(false);
  const Outcome outcome = quarnctl(*bus_, {"status"});
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_NE(outcome.out.find("packages          not known without Wi-Fi\n"), std::string::npos);
  EXPECT_TRUE(daemon_->calls().empty());
}

TEST_F(QuarnctlStatus, AListThatCannotBeHadIsNoFailure) {
  serve(true);
  for (const auto &[error, text] :
       {std::pair{QUARN_NO_SESSION, "failed"}, std::pair{QUARN_BAD_ARGUMENT, "none"},
        std::pair{QUARN_OK, "not a list"}}) {
    answer_list(error, text);
    const Outcome outcome = quarnctl(*bus_, {"status"});
    EXPECT_EQ(outcome.exit, 0);
    EXPECT_NE(outcome.out.find("packages          not known: "), std::string::npos) << outcome.out;
  }
}

TEST_F(QuarnctlStatus, ADaemonWithoutAStatusObjectIsToldApart) {
  const Outcome outcome = quarnctl(*bus_, {"status"});
  EXPECT_EQ(outcome.exit, kUnusable);
}

/** What a failure is told with when the daemon names the cloud's part in it. */
class QuarnctlCloudProblem : public QuarnctlStatus {
 protected:
  Outcome fail_backup(int result, const std::string &problem, std::vector<std::string> arguments) {
    daemon_->serve_status(g_variant_new_parsed("{'CloudProblem': <%s>}", problem.c_str()));
    daemon_->on("manual_backup_start", [result](const IncomingCall &call) {
      const std::uint32_t req = call.req_id();
      call.call_back("manual_backup_status", status_arguments(result, QUARN_BACKUP_FAILED, req));
      call.reply(0);
    });
    return quarnctl(*bus_, std::move(arguments));
  }
};

TEST_F(QuarnctlCloudProblem, EachIsPutIntoWords) {
  const std::vector<std::pair<std::string, std::string>> words = {
      {"address", "there is no such store at the cloud's address"},
      {"certificate", "the cloud's certificate is not to be trusted"},
      {"password", "the cloud refused the user name or password"},
      {"space", "the cloud is full"},
      {"network", "the cloud cannot be reached"},
      {"server", "the cloud answered with an error"}};
  for (const auto &[problem, text] : words) {
    const Outcome outcome = fail_backup(QUARN_TRANSFER_FAILED, problem, {"backup"});
    EXPECT_EQ(outcome.exit, QUARN_TRANSFER_FAILED);
    EXPECT_EQ(outcome.err, "quarnctl: backup failed: the transfer failed or Wi-Fi was lost (12): " +
                               text + "\n");
  }
}

TEST_F(QuarnctlCloudProblem, ItIsInTheDocument) {
  const Outcome outcome = fail_backup(QUARN_LIST_CHECK_FAILED, "password", {"backup", "--json"});
  EXPECT_EQ(outcome.exit, QUARN_LIST_CHECK_FAILED);
  EXPECT_EQ(json_string(json_parse(outcome.out).get(), "cloud_problem"), "password");
}

TEST_F(QuarnctlCloudProblem, NoneAndUnknownOnesAddNothing) {
  for (const char *problem : {"", "mice"}) {
    const Outcome outcome = fail_backup(QUARN_TRANSFER_FAILED, problem, {"backup", "--json"});
    EXPECT_EQ(outcome.err, "quarnctl: backup failed: the transfer failed or Wi-Fi was lost (12)\n");
    EXPECT_EQ(json_string(json_parse(outcome.out).get(), "cloud_problem"), std::nullopt);
  }
}

TEST_F(QuarnctlCloudProblem, AFailureOfAnotherKindHasNoPartOfTheClouds) {
  const Outcome outcome = fail_backup(QUARN_NO_SESSION, "password", {"backup"});
  EXPECT_EQ(outcome.err, "quarnctl: backup failed: no Wi-Fi, or no session with the cloud (33)\n");
}

TEST_F(QuarnctlCloudProblem, AListThatCannotBeHadIsExplained) {
  daemon_->serve_status(g_variant_new_parsed("{'CloudProblem': <'certificate'>}"));
  answer_list(QUARN_BAD_ARGUMENT, "none");
  const Outcome outcome = quarnctl(*bus_, {"list"});
  EXPECT_EQ(outcome.exit, QUARN_BAD_ARGUMENT);
  EXPECT_EQ(outcome.err,
            "quarnctl: the cloud holds no application list yet, or it could not be fetched (1): "
            "the cloud's certificate is not to be trusted\n");
}

TEST_F(QuarnctlCloudProblem, TheStatusShowsIt) {
  daemon_->serve_status(
      g_variant_new_parsed("{'WifiConnected': <false>, 'CloudProblem': <'space'>}"));
  EXPECT_NE(quarnctl(*bus_, {"status"}).out.find("cloud             the cloud is full\n"),
            std::string::npos);
}

}  // namespace
