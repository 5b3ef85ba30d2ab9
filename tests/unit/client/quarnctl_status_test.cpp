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

}  // namespace
