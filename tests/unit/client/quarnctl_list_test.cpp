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

constexpr char kTwoDevices[] =
    R"({"format_ver":1,"model_list":[)"
    R"({"backup_info":{"timestamp":1709208300000,"serial_number":"350000000000001",)"
    R"("model_name":"Watch A"},"pkg_list":[)"
    R"({"pkg_id":"org.example.notes","version":"1.0.0","crc":-559038737},)"
    R"({"pkg_id":"org.example.bank","version":"2.1","crc":0}]},)"
    R"({"backup_info":{"timestamp":0,"serial_number":"350000000000002",)"
    R"("model_name":"Watch B"},"pkg_list":[]}]})";

class QuarnctlList : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { bus_ = new PrivateBus; }
  static void TearDownTestSuite() {
    delete bus_;
    bus_ = nullptr;
  }

  /** Asks a daemon that has @p text as its list. */
  static Outcome ask(const std::vector<std::string> &arguments, int error,
                     const std::string &text) {
    FakeDaemon daemon(*bus_);
    daemon.on("get_app_list", [=](const IncomingCall &call) {
      EXPECT_EQ(call.int_argument(0), 0);
      const std::uint32_t req = call.req_id();
      call.reply(0);
      call.call_back("get_app_list_cb", text_arguments(error, text, req));
    });
    return quarnctl(*bus_, arguments);
  }

  /** Asks a daemon that refuses, calling back before its reply. */
  static Outcome ask_refusing(const std::vector<std::string> &arguments, int error,
                              const std::string &text, int reply) {
    FakeDaemon daemon(*bus_);
    daemon.on("get_app_list", [=](const IncomingCall &call) {
      call.call_back("get_app_list_cb", text_arguments(error, text, call.req_id()),
                     [call, reply] { call.reply(reply); });
    });
    return quarnctl(*bus_, arguments);
  }

  static PrivateBus *bus_;
};

PrivateBus *QuarnctlList::bus_ = nullptr;

TEST_F(QuarnctlList, ListIsATableOfEveryPackage) {
  const Outcome outcome = ask({"list"}, 0, kTwoDevices);
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out,
            "DEVICE           PACKAGE            VERSION  CRC       TIME\n"
            "350000000000001  org.example.notes  1.0.0    deadbeef  2024-02-29T12:05:00+00:00\n"
            "350000000000001  org.example.bank   2.1      -         2024-02-29T12:05:00+00:00\n");
  EXPECT_EQ(outcome.err, "");
}

TEST_F(QuarnctlList, SetsIsATableOfTheDevices) {
  const Outcome outcome = ask({"sets"}, 0, kTwoDevices);
  EXPECT_EQ(outcome.exit, 0);
  EXPECT_EQ(outcome.out,
            "SERIAL           MODEL    TIME                       PACKAGES\n"
            "350000000000001  Watch A  2024-02-29T12:05:00+00:00  2\n"
            "350000000000002  Watch B  1970-01-01T00:00:00+00:00  0\n");
}

TEST_F(QuarnctlList, TheJsonFormsHoldTheSame) {
  const char devices[] =
      R"([{"serial":"350000000000001","model":"Watch A","time_ms":1709208300000,)"
      R"("time":"2024-02-29T12:05:00+00:00","packages":[)"
      R"({"package":"org.example.notes","version":"1.0.0","crc":-559038737},)"
      R"({"package":"org.example.bank","version":"2.1","crc":0}]},)"
      R"({"serial":"350000000000002","model":"Watch B","time_ms":0,)"
      R"("time":"1970-01-01T00:00:00+00:00","packages":[]}])";
  EXPECT_EQ(ask({"list", "--json"}, 0, kTwoDevices).out,
            std::string(R"({"verb":"list","devices":)") + devices +
                R"(,"exit":0,"message":"success"})" + "\n");
  EXPECT_EQ(ask({"sets", "--json"}, 0, kTwoDevices).out,
            std::string(R"({"verb":"sets","sets":)") + devices +
                R"(,"exit":0,"message":"success"})" + "\n");
}

TEST_F(QuarnctlList, AnAccountWithoutAListIsToldApartFromOtherFailures) {
  const Outcome outcome = ask({"list"}, QUARN_BAD_ARGUMENT, "none");
  EXPECT_EQ(outcome.exit, QUARN_BAD_ARGUMENT);
  EXPECT_EQ(outcome.err,
            "quarnctl: the cloud holds no application list yet, or it could not be fetched (1)\n");
}

TEST_F(QuarnctlList, ACompanionThatMayBeMissingIsNamed) {
  FakeDaemon daemon(*bus_);
  daemon.on("get_app_list", [](const IncomingCall &call) {
    EXPECT_EQ(call.int_argument(0), 1);
    call.call_back("get_app_list_cb", text_arguments(QUARN_FAILED, "failed", call.req_id()),
                   [call] { call.reply(QUARN_FAILED); });
  });
  const Outcome outcome = quarnctl(*bus_, {"transfer", "list"});
  EXPECT_EQ(outcome.exit, QUARN_FAILED);
  EXPECT_EQ(outcome.err,
            "quarnctl: making the archives failed: failed (42); is com.velmor.pellix-efl "
            "installed?\n");
}

TEST_F(QuarnctlList, ARefusalThatIsCalledBackBeforeTheReplyIsTheResult) {
  Outcome outcome = ask_refusing({"list"}, QUARN_NO_SESSION, "failed", QUARN_NO_SESSION);
  EXPECT_EQ(outcome.exit, QUARN_NO_SESSION);
  EXPECT_EQ(outcome.err,
            "quarnctl: getting the application list failed: no Wi-Fi, or no session with the "
            "cloud (33)\n");
  outcome = ask_refusing({"sets"}, QUARN_TRANSFER_FAILED, "none", QUARN_FAILED);
  EXPECT_EQ(outcome.exit, QUARN_TRANSFER_FAILED);
}

TEST_F(QuarnctlList, ARefusalWithoutACallbackIsTheResult) {
  FakeDaemon daemon(*bus_);
  daemon.on("get_app_list", [](const IncomingCall &call) { call.reply(QUARN_FAILED); });
  EXPECT_EQ(quarnctl(*bus_, {"list"}).exit, QUARN_FAILED);
}

TEST_F(QuarnctlList, AnUnusableListIsAnErrorNeverACrash) {
  const char *const texts[] = {"",
                               "none",
                               "null",
                               "[]",
                               "42",
                               "{",
                               "{\"format_ver\":1",
                               "{} tail",
                               R"({"format_ver":2,"model_list":[]})",
                               R"({"format_ver":"1","model_list":[]})",
                               R"({"format_ver":1})",
                               R"({"format_ver":1,"model_list":null})",
                               R"({"format_ver":1,"model_list":{"a":1}})"};
  for (const std::string text : texts) {
    const Outcome outcome = ask({"list", "--json"}, 0, text);
    EXPECT_EQ(outcome.exit, kUnusable) << text;
    EXPECT_EQ(json_integer(json_parse(outcome.out).get(), "exit"), kUnusable) << outcome.out;
    EXPECT_NE(outcome.err, "");
  }
  const Outcome deep = ask({"list"}, 0, std::string(100000, '['));
  EXPECT_EQ(deep.exit, kUnusable);
}

TEST_F(QuarnctlList, HostileEntriesAreLeftOutAndTheOthersShown) {
  const std::string text =
      R"({"format_ver":1,"model_list":[null,1,"x",[],{},)"
      R"({"backup_info":[]},{"backup_info":{"serial_number":null}},)"
      R"({"backup_info":{"serial_number":5}},{"backup_info":{"serial_number":""}},)"
      R"({"backup_info":{"serial_number":"1","model_name":{},"timestamp":"soon"},)"
      R"("pkg_list":[null,{"pkg_id":1},{"pkg_id":"a"},{"pkg_id":"","version":"1"},)"
      R"({"pkg_id":"a","version":"1","crc":"x"},)"
      R"({"pkg_id":"b","version":"2","crc":99999999999999999999999}]},)"
      R"({"backup_info":{"serial_number":"2","timestamp":9223372036854775807},)"
      R"("pkg_list":{"pkg_id":"c"}}]})";
  const Outcome list = ask({"list"}, 0, text);
  EXPECT_EQ(list.exit, 0);
  EXPECT_EQ(list.out,
            "DEVICE  PACKAGE  VERSION  CRC       TIME\n"
            "1       a        1        -         -\n"
            "1       b        2        ffffffff  -\n");
  EXPECT_EQ(list.err, "quarnctl: 13 unreadable entries are left out\n");
  const Outcome sets = ask({"sets", "--json"}, 0, text);
  EXPECT_EQ(json_integer(json_parse(sets.out).get(), "left_out"), 13);
}

TEST_F(QuarnctlList, TerminalEscapesAreNeverPrintedRaw) {
  const std::string text =
      R"({"format_ver":1,"model_list":[{"backup_info":{"timestamp":0,)"
      R"("serial_number":"1\u001b]0;owned\u0007","model_name":"\u009b31m\u202egnp.\r\n\u0000z"},)"
      R"("pkg_list":[{"pkg_id":"p\u001b[2J\u007f","version":"\t1","crc":1}]}]})";
  for (const std::vector<std::string> &arguments :
       std::vector<std::vector<std::string>>{{"list"}, {"sets"}, {"list", "--json"}}) {
    const Outcome outcome = ask(arguments, 0, text);
    EXPECT_EQ(outcome.exit, 0);
    for (const char *raw : {"\x1b", "\x07", "\x7f", "\r", "\t", "\xc2\x9b", "\xe2\x80\xae"}) {
      EXPECT_EQ(outcome.out.find(raw), std::string::npos) << outcome.out;
    }
  }
  EXPECT_NE(ask({"list"}, 0, text).out.find("p\\x1b[2J\\x7f"), std::string::npos);
  EXPECT_NE(ask({"sets"}, 0, text).out.find("\\u{9b}31m\\u{202e}gnp.\\x0d\\x0a\\x00z"),
            std::string::npos);
}

TEST_F(QuarnctlList, VeryLongNamesAreShortenedInTheTableOnly) {
  const std::string name(5000, 'n');
  const std::string text = R"({"format_ver":1,"model_list":[{"backup_info":{"serial_number":"1"},)"
                           R"("pkg_list":[{"pkg_id":")" +
                           name + R"(","version":"1"}]}]})";
  EXPECT_LT(ask({"list"}, 0, text).out.size(), 300U);
  EXPECT_NE(ask({"list", "--json"}, 0, text).out.find(name), std::string::npos);
}

}  // namespace
