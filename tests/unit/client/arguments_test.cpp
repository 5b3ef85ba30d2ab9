#include "arguments.h"

#include <gtest/gtest.h>

namespace {

using namespace quarn_client;

Command parsed(const std::vector<std::string> &arguments) {
  Command command;
  std::string error;
  EXPECT_TRUE(parse_arguments(arguments, command, error)) << error;
  return command;
}

std::string error_of(const std::vector<std::string> &arguments) {
  Command command;
  std::string error;
  EXPECT_FALSE(parse_arguments(arguments, command, error));
  EXPECT_NE(error, "");
  return error;
}

TEST(Arguments, EveryVerbIsKnown) {
  EXPECT_EQ(parsed({"status"}).verb, Verb::status);
  EXPECT_EQ(parsed({"activate"}).verb, Verb::activate);
  EXPECT_EQ(parsed({"deactivate"}).verb, Verb::deactivate);
  EXPECT_EQ(parsed({"backup"}).verb, Verb::backup);
  EXPECT_EQ(parsed({"cancel"}).verb, Verb::cancel);
  EXPECT_EQ(parsed({"auto", "on"}).verb, Verb::auto_backup);
  EXPECT_EQ(parsed({"last-time"}).verb, Verb::last_time);
  EXPECT_EQ(parsed({"list"}).verb, Verb::list);
  EXPECT_EQ(parsed({"sets"}).verb, Verb::sets);
  EXPECT_EQ(parsed({"app", "backup", "a"}).verb, Verb::app_backup);
  EXPECT_EQ(parsed({"app", "restore", "a"}).verb, Verb::app_restore);
  EXPECT_EQ(parsed({"app", "export", "a"}).verb, Verb::app_export);
  EXPECT_EQ(parsed({"restore", "on", "--from", "1"}).verb, Verb::restore_on);
  EXPECT_EQ(parsed({"restore", "off"}).verb, Verb::restore_off);
  EXPECT_EQ(parsed({"transfer", "list"}).verb, Verb::transfer_list);
  EXPECT_TRUE(parsed({"restore", "on", "--transfer", "a"}).transfer);
  EXPECT_EQ(parsed({"rules", "check", "a"}).verb, Verb::rules_check);
  EXPECT_EQ(parsed({"rules", "explain", "a", "data/b"}).verb, Verb::rules_explain);
}

TEST(Arguments, ATransferNamesItsPackages) {
  EXPECT_EQ(error_of({"restore", "on", "--transfer"}),
            "restore on --transfer needs the packages' names");
  EXPECT_EQ(error_of({"restore", "off", "--transfer"}), "--transfer belongs to restore on");
  EXPECT_EQ(error_of({"restore", "on", "--transfer", "a", "--from", "1"}),
            "restore on takes either --from or --transfer");
}

TEST(Arguments, OptionsMayStandAnywhere) {
  const Command command =
      parsed({"--json", "restore", "--timeout=2.5", "on", "a", "--from", "1", "--watch", "b"});
  EXPECT_TRUE(command.json);
  EXPECT_TRUE(command.watch);
  EXPECT_TRUE(command.timeout_given);
  EXPECT_EQ(command.timeout, 2.5);
  EXPECT_EQ(command.serial, "1");
  EXPECT_EQ(command.packages, (std::vector<std::string>{"a", "b"}));
}

TEST(Arguments, AfterTwoDashesNothingIsAnOption) {
  EXPECT_EQ(parsed({"app", "backup", "--", "--json"}).packages[0], "--json");
}

TEST(Arguments, ABackupWaitsWithoutALimitAndOthersDoNot) {
  EXPECT_EQ(parsed({"backup"}).timeout, 0);
  EXPECT_GT(parsed({"list"}).timeout, 0);
  EXPECT_GT(parsed({"activate"}).timeout, 0);
  EXPECT_EQ(parsed({"list", "--timeout", "0"}).timeout, 0);
}

TEST(Arguments, ATimeOutIsANumberOfSeconds) {
  for (const char *value : {"", "x", "5s", "-1", "inf", "nan", "1e12"}) {
    EXPECT_EQ(error_of({"list", "--timeout", value}), "--timeout takes a number of seconds")
        << value;
  }
  EXPECT_EQ(error_of({"list", "--timeout"}), "--timeout needs a value");
}

TEST(Arguments, WhatIsNotUnderstoodIsNamed) {
  EXPECT_EQ(error_of({}), "no verb is given; quarnctl --help lists them");
  EXPECT_EQ(error_of({"fly"}), "unknown verb fly; quarnctl --help lists them");
  EXPECT_EQ(error_of({"app"}), "unknown verb app; quarnctl --help lists them");
  EXPECT_EQ(error_of({"backup", "--fast"}), "unknown option --fast");
  EXPECT_EQ(error_of({"list", "--fromage"}), "unknown option --fromage");
  EXPECT_EQ(error_of({"auto"}), "usage: quarnctl auto on|off");
  EXPECT_EQ(error_of({"auto", "maybe"}), "usage: quarnctl auto on|off");
  EXPECT_EQ(error_of({"app", "backup"}), "usage: quarnctl app backup PKGID");
  EXPECT_EQ(error_of({"app", "backup", "a", "b"}), "usage: quarnctl app backup PKGID");
  EXPECT_EQ(error_of({"app", "backup", ""}), "an argument is empty");
  EXPECT_EQ(error_of({"backup", "--watch"}), "--watch belongs to restore on");
  EXPECT_EQ(error_of({"restore", "off", "--from", "1"}), "--from belongs to restore on");
  EXPECT_EQ(error_of({"restore", "on"}),
            "restore on needs --from SERIAL; quarnctl sets shows the devices");
}

TEST(Arguments, TextThatIsNotUtf8IsRefusedBeforeTheBusWould) {
  EXPECT_EQ(error_of({"app", "backup", "\xff"}), "an argument is not UTF-8 text");
}

TEST(Arguments, EveryVerbHasHelp) {
  const std::vector<std::vector<std::string>> verbs = {
      {"status"},        {"activate"},      {"deactivate"},     {"backup"},
      {"cancel"},        {"auto"},          {"last-time"},      {"list"},
      {"sets"},          {"app", "backup"}, {"app", "restore"}, {"app", "export"},
      {"restore", "on"}, {"restore", "off"}};
  for (std::vector<std::string> verb : verbs) {
    const std::string name = verb.size() == 2 ? verb[0] + " " + verb[1] : verb[0];
    std::vector<std::string> other = verb;
    verb.emplace_back("--help");
    other.insert(other.begin(), "help");
    const Command command = parsed(verb);
    EXPECT_EQ(command.verb, Verb::help);
    EXPECT_EQ(command.help.rfind("usage: quarnctl " + name, 0), 0U) << command.help;
    EXPECT_EQ(parsed(other).help, command.help);
  }
  EXPECT_NE(parsed({"--help"}).help.find("restore on --from SERIAL"), std::string::npos);
  EXPECT_EQ(parsed({"help"}).help, parsed({"-h"}).help);
}

}  // namespace
