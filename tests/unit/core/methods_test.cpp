#include "quarn_d_methods.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "glib_handles.h"
#include "test_files.h"

namespace {

/** A row of the page's table of methods, up to its reply. */
std::string row_of(const quarn_method &method) {
  std::string row = "\n| `" + std::string(method.name) + "` |";
  const char *before = " ";
  for (const quarn_argument *argument = method.arguments; argument->name != nullptr; ++argument) {
    row += std::string(before) + "`" + argument->type + "` " + argument->name;
    before = ", ";
  }
  row += " | ";
  return row + (method.answer.name == nullptr ? std::string("empty")
                                              : std::string("`") + method.answer.type + "`");
}

/** The cells that the page's table of rights has for it, in each of its rows. */
std::string rights_of(const quarn_method &method) {
  switch (method.rights) {
    case method_rights::trusted:
      return " | yes | | | |";
    case method_rights::own_package:
      return " | yes | its own package | its own package | |";
    case method_rights::as_companion:
      return " | yes | as client 1 | | |";
    case method_rights::companions_mode:
      return " | yes | as client 1";
  }
  return "?";
}

TEST(Documentation, HasEachMethodWithItsArgumentsAndReply) {
  const std::string page = read_text(QUARN_DBUS_PAGE);
  for (const quarn_method &method : kQuarnMethods) {
    EXPECT_NE(page.find(row_of(method)), std::string::npos) << row_of(method);
  }
}

TEST(Documentation, SaysWhoMayCallEachMethod) {
  const std::string page = read_text(QUARN_DBUS_PAGE);
  std::istringstream lines(page.substr(page.find("\n## Who may call")));
  std::vector<std::string> rows;
  for (std::string line; std::getline(lines, line);) {
    if (line.rfind('|', 0) == 0) rows.push_back(line);
  }
  for (const quarn_method &method : kQuarnMethods) {
    int found = 0;
    for (const std::string &row : rows) {
      if (row.find("`" + std::string(method.name) + "`") == std::string::npos) continue;
      ++found;
      EXPECT_NE(row.find(rights_of(method)), std::string::npos) << row;
    }
    EXPECT_EQ(found, method.rights == method_rights::companions_mode ? 2 : 1) << method.name;
  }
}

TEST(Arguments, AreReadByTheirNamesAndOfTheRightTypesOnly) {
  const auto read = [](const char *method, const char *text) {
    const GVariantPtr value(
        g_variant_ref_sink(g_variant_parse(nullptr, text, nullptr, nullptr, nullptr)));
    const auto arguments = read_quarn_arguments(method, value.get());
    return arguments ? std::to_string(arguments->on) + " " + std::to_string(arguments->client) +
                           " " + std::to_string(arguments->req_id)
                     : "none";
  };
  EXPECT_EQ(read("restore_enable", "(1, 0, 's', '[]', uint32 7)"), "1 0 7");
  EXPECT_EQ(read("manual_backup_start", "(uint32 7,)"), "0 -1 7");
  EXPECT_EQ(read("last_bu_time", "()"), "0 -1 0");
  EXPECT_EQ(read("manual_backup_start", "()"), "none");
  EXPECT_EQ(read("manual_backup_start", "(7,)"), "none");
  EXPECT_EQ(read("manual_backup_start", "(uint32 7, uint32 8)"), "none");
  EXPECT_EQ(read("fly", "(uint32 7,)"), "none");
  EXPECT_FALSE(read_quarn_arguments("last_bu_time", nullptr));
  EXPECT_TRUE(has_signature(kQuarnMethods[2], "iissu"));
  EXPECT_FALSE(has_signature(kQuarnMethods[2], "iiss"));
  EXPECT_FALSE(has_signature(kQuarnMethods[2], "iissuu"));
}

}  // namespace
