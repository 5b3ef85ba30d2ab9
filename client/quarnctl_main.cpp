#include <clocale>
#include <cstdio>
#include <string>
#include <vector>

#include "arguments.h"
#include "rules.h"
#include "session.h"

int main(int argc, char **argv) {
  std::setlocale(LC_ALL, "");
  quarn_client::Command command;
  std::string error;
  const std::vector<std::string> arguments(argv + (argc > 0 ? 1 : 0), argv + argc);
  if (!quarn_client::parse_arguments(arguments, command, error)) {
    return quarn_client::report_usage_error(command, error);
  }
  if (command.verb == quarn_client::Verb::help) {
    std::fputs(command.help.c_str(), stdout);
    return 0;
  }
  if (command.verb == quarn_client::Verb::version) {
    std::puts("quarnctl " QUARN_VERSION);
    return 0;
  }
  if (command.verb == quarn_client::Verb::rules_check) {
    return rules_command({"check", command.packages[0]}, command.json);
  }
  if (command.verb == quarn_client::Verb::rules_explain) {
    return rules_command({"explain", command.packages[0], command.packages[1]}, command.json);
  }
  return quarn_client::run_command(command);
}
