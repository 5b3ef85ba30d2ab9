#include "quarn_d_gate.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "glib_handles.h"
#include "log_capture.h"
#include "quarn_common.h"
#include "quarn_d_credentials.h"
#include "scripted_client.h"

namespace {

using Texts = std::vector<std::string>;

class Gate : public ::testing::Test {
 protected:
  void SetUp() override {
    clear_captured_log();
    set_caller_source([this](const std::string &sender, caller_work answer) {
      questions_.emplace_back(sender, std::move(answer));
    });
  }
  void TearDown() override {
    set_caller_source(nullptr);
    forget_callers();
  }
  void call(const std::string &sender, const std::string &what) {
    with_caller(nullptr, sender, [this, sender, what](const quarn_caller &caller) {
      served_.push_back(sender + " " + what + " " +
                        (caller.known ? std::to_string(caller.uid) : "unknown"));
    });
  }
  void answer(std::size_t question, const quarn_caller &caller) {
    questions_[question].second(caller);
  }

  std::vector<std::pair<std::string, caller_work>> questions_;
  Texts served_;
};

TEST_F(Gate, CallsOfAConnectionWaitForOneAnswerAndKeepTheirOrder) {
  call(":1.1", "a");
  call(":1.2", "a");
  call(":1.1", "b");
  ASSERT_EQ(questions_.size(), 2U) << "one question a connection";
  EXPECT_TRUE(served_.empty());
  EXPECT_TRUE(callers_are_asked_for());
  answer(1, {true, 5000, {}, ""});
  EXPECT_EQ(served_, Texts{":1.2 a 5000"}) << "nobody waits for another's answer";
  answer(0, {true, 0, {}, ""});
  EXPECT_EQ(served_, (Texts{":1.2 a 5000", ":1.1 a 0", ":1.1 b 0"}));
  EXPECT_FALSE(callers_are_asked_for());
  call(":1.1", "c");
  EXPECT_EQ(served_.back(), ":1.1 c 0") << "what is known is not asked for again";
  EXPECT_EQ(questions_.size(), 2U);
}

TEST_F(Gate, ACallThatComesWhileOthersAreServedIsServedAfterThem) {
  with_caller(nullptr, ":1.1", [this](const quarn_caller &) {
    served_.emplace_back("first");
    call(":1.1", "third");
  });
  call(":1.1", "second");
  answer(0, {true, 0, {}, ""});
  EXPECT_EQ(served_, (Texts{"first", ":1.1 second 0", ":1.1 third 0"}));
}

TEST_F(Gate, WhoIsNotToldOfIsAskedForAgain) {
  call(":1.1", "a");
  answer(0, {});
  EXPECT_EQ(served_, Texts{":1.1 a unknown"});
  call(":1.1", "b");
  EXPECT_EQ(questions_.size(), 2U);
  EXPECT_FALSE(known_caller(":1.1").known);
}

TEST_F(Gate, RemembersABoundedNumberOfConnections) {
  for (std::size_t i = 0; i <= kMostCallersKnown; ++i) {
    call(":1." + std::to_string(i), "a");
    answer(i, {true, 0, {}, ""});
  }
  EXPECT_FALSE(known_caller(":1.0").known) << "the one that is known longest";
  EXPECT_TRUE(known_caller(":1.1").known);
}

GVariant *credentials(const char *text) {
  GVariant *value = g_variant_parse(G_VARIANT_TYPE("(a{sv})"), text, nullptr, nullptr, nullptr);
  EXPECT_NE(value, nullptr) << text;
  return value;
}

quarn_caller read(const char *text) {
  const GVariantPtr value(g_variant_ref_sink(credentials(text)));
  return read_credentials(value.get());
}

TEST(Credentials, AreWhatTheBusTells) {
  const quarn_caller caller = read(
      "({'UnixUserID': <uint32 5000>, 'UnixGroupIDs': <[uint32 5000, 7001]>, 'ProcessID': <uint32 "
      "1>, 'LinuxSecurityLabel': <b'org.example.notes'>},)");
  EXPECT_TRUE(caller.known);
  EXPECT_EQ(caller.uid, 5000U);
  EXPECT_EQ(caller.groups, (std::vector<gid_t>{5000, 7001}));
  EXPECT_EQ(caller.label, "org.example.notes") << "without the NUL at its end";
}

TEST(Credentials, WithoutAUserNothingIsKnown) {
  EXPECT_FALSE(read("(@a{sv} {},)").known);
  EXPECT_FALSE(read("({'UnixUserID': <'root'>},)").known);
  EXPECT_FALSE(read("({'ProcessID': <uint32 1>},)").known);
}

TEST(Credentials, GroupsThatTheBusDoesNotTellAreTheUsersOwn) {
  const quarn_caller caller = read("({'UnixUserID': <uint32 1>},)");
  EXPECT_EQ(caller.groups, std::vector<gid_t>{1}) << "daemon's, who is known everywhere";
  EXPECT_TRUE(read("({'UnixUserID': <uint32 4123456789>},)").groups.empty());
}

TEST(Credentials, ALabelOfMoreThanATextIsNone) {
  EXPECT_EQ(read("({'UnixUserID': <uint32 5000>, 'UnixGroupIDs': <@au []>, 'LinuxSecurityLabel': "
                 "<[byte 0x61, 0, 0x62, 0]>},)")
                .label,
            "");
  EXPECT_EQ(read("({'UnixUserID': <uint32 5000>, 'UnixGroupIDs': <@au []>, 'LinuxSecurityLabel': "
                 "<@ay []>},)")
                .label,
            "");
}

TEST(Subject, IsTakenFromTheArgumentsOfItsOwnInterfaceOnly) {
  const auto of = [](const char *interface_name, const char *member, const char *arguments) {
    const GVariantPtr value(
        g_variant_ref_sink(g_variant_parse(nullptr, arguments, nullptr, nullptr, nullptr)));
    return subject_of_call(interface_name, member, value.get());
  };
  EXPECT_EQ(of(kQuarnInterface, "make_app_data", "('a',)").package, "a");
  EXPECT_EQ(of(kQuarnInterface, "app_data_backup_start", "('a', uint32 1)").package, "a");
  EXPECT_EQ(of(kQuarnInterface, "get_app_list", "(1, uint32 1)").client, 1);
  const quarn_subject on = of(kQuarnInterface, "restore_enable", "(1, 1, 's', '[]', uint32 1)");
  EXPECT_TRUE(on.switches_on);
  EXPECT_EQ(on.client, 1);
  EXPECT_FALSE(of(kQuarnInterface, "restore_enable", "(0, 1, 's', '[]', uint32 1)").switches_on);
  EXPECT_EQ(of("org.example.Other", "make_app_data", "('a',)").package, "");
  EXPECT_EQ(of(kQuarnInterface, "get_app_list", "('a',)").client, -1);
  EXPECT_EQ(subject_of_call(kQuarnInterface, "make_app_data", nullptr).package, "");
}

TEST(Verdict, ARefusalIsLoggedWithItsCallerAndMethod) {
  set_client_group(7001);
  clear_captured_log();
  const quarn_subject asked{kQuarnInterface, "backup_enable", "", -1, false};
  const caller_verdict verdict = judge_call({true, 1, {1}, ""}, ":1.7", asked, false);
  EXPECT_FALSE(verdict.allowed);
  EXPECT_EQ(count_logged(DLOG_ERROR,
                         "refused : backup_enable of (:1.7) : it is for root and the group quarn"),
            1);
  EXPECT_EQ(refusal_text(asked, verdict),
            "backup_enable is refused: it is for root and the group quarn");
  EXPECT_TRUE(judge_call({true, 1, {7001}, ""}, ":1.7", asked, false).allowed);
  EXPECT_EQ(captured_log().size(), 1U);
}

gint64 moment = 0;

/** Callers that ask again and again for what they may not have. */
class Flood : public ::testing::Test {
 protected:
  void SetUp() override {
    forget_callers();
    set_client_group(7001);
    set_refusal_clock([] { return moment; });
    clear_captured_log();
  }
  void TearDown() override {
    forget_callers();
    set_refusal_clock(nullptr);
  }
  static void refuse(unsigned int times, const quarn_caller &caller = {true, 1, {1}, ""}) {
    const quarn_subject asked{kQuarnInterface, "backup_enable", "", -1, false};
    for (unsigned int i = 0; i < times; ++i) {
      static_cast<void>(judge_call(caller, ":1." + std::to_string(i), asked, false));
    }
  }
};

TEST_F(Flood, ACallersRefusalsHaveABoundedNumberOfLinesHoweverManyConnectionsItHas) {
  refuse(100'000);
  ASSERT_EQ(captured_log().size(), kMostRefusalLines);
  EXPECT_EQ(count_logged(DLOG_ERROR,
                         "refused : backup_enable of (:1.59) : it is for root and the group quarn"),
            1)
      << "the last one that is told";
}

TEST_F(Flood, NobodyHidesWhatOthersAreRefused) {
  refuse(1'000);
  clear_captured_log();
  refuse(1, {true, 2, {2}, ""});
  refuse(1, {true, 1, {1}, "org.example.notes"});
  refuse(1, {});
  EXPECT_EQ(captured_log().size(), 3U);
}

TEST_F(Flood, WhatWasLeftOutIsToldWhenThePeriodIsOver) {
  refuse(kMostRefusalLines + 5);
  clear_captured_log();
  moment += kRefusalPeriod - 1;
  refuse(1);
  EXPECT_TRUE(captured_log().empty());
  moment += 1;
  refuse(1, {true, 2, {2}, ""});
  EXPECT_EQ(count_logged(DLOG_ERROR, "refused : 6 more calls of user 1"), 1);
  clear_captured_log();
  refuse(1);
  EXPECT_EQ(captured_log().size(), 1U) << "a new period has lines of its own";
}

TEST_F(Flood, WhatWasLeftOutIsToldAtTheEnd) {
  refuse(kMostRefusalLines + 1, {true, 5000, {}, "org.example.notes"});
  clear_captured_log();
  forget_callers();
  EXPECT_EQ(
      count_logged(DLOG_ERROR, "refused : 1 more calls of user 5000, label org.example.notes"), 1);
  clear_captured_log();
  forget_callers();
  EXPECT_TRUE(captured_log().empty());
}

/** On a real bus. */
class AskedBus : public ::testing::Test {
 protected:
  void SetUp() override { connection_ = connect_to_private_bus(); }
  void TearDown() override { forget_callers(); }
  bool known(const std::string &sender) {
    bool told = false;
    quarn_caller found;
    with_caller(connection_.get(), sender, [&](const quarn_caller &caller) {
      found = caller;
      told = true;
    });
    EXPECT_TRUE(run_until([&told] { return told; }));
    return found.known && found.uid == getuid();
  }
  ConnectionHandle connection_;
};

TEST_F(AskedBus, TellsOfAClientAndItIsForgottenWhenItLeaves) {
  auto client = std::make_unique<ScriptedClient>();
  const std::string name = client->name();
  EXPECT_TRUE(known(name));
  EXPECT_TRUE(known_caller(name).known);
  EXPECT_EQ(ask_caller_now(connection_.get(), name, 1000).uid, getuid());
  client.reset();
  EXPECT_TRUE(run_until([&name] { return !known_caller(name).known; }));
  clear_captured_log();
  EXPECT_FALSE(known(name));
  EXPECT_FALSE(captured_log().empty());
  EXPECT_FALSE(ask_caller_now(connection_.get(), name, 1000).known);
}

}  // namespace
