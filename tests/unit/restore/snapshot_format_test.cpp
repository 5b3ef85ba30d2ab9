// docs/formats.md shows a snapshot as it is.
#include <unistd.h>

#include <filesystem>
#include <set>

#include "quarn_d_restore/snapshot.h"
#include "restore_fixture.h"

namespace {

class SnapshotFormat : public RestoreTest {
 protected:
  /** The example @p name of the page. */
  static std::string shown(const std::string &name) {
    const std::string page = read_text(QUARN_FORMATS_PAGE);
    const std::string head = "<!-- example: " + name + " -->\n```\n";
    const std::size_t begin = page.find(head);
    if (begin == std::string::npos) return "docs/formats.md has no example " + name;
    const std::size_t text = begin + head.size();
    return page.substr(text, page.find("```\n", text) - text);
  }

  std::string files_of_snapshot() const {
    std::set<std::string> names;
    for (const auto &entry : std::filesystem::recursive_directory_iterator(snapshot())) {
      if (entry.is_regular_file()) {
        names.insert(std::filesystem::relative(entry.path(), snapshot()).string());
      }
    }
    std::string text;
    for (const auto &name : names) text += name + "\n";
    return text;
  }
};

TEST_F(SnapshotFormat, IsThatOfThePage) {
  file("data/db/notes.db", "first note\n", 0600);
  dir("data/empty");
  file("shared/data/list.txt", "for others\n");
  file("shared/trusted/key", "0123456789abcdef", 04711);
  ASSERT_EQ(symlink("db/notes.db", at("data/current").c_str()), 0);
  ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  EXPECT_EQ(files_of_snapshot(), shown("snapshot"));
}

TEST_F(SnapshotFormat, TableHasEveryFileAndDirectoryAndNoLink) {
  file("data/db/notes.db", "first note\n", 0600);
  dir("data/empty");
  ASSERT_EQ(symlink("db/notes.db", at("data/current").c_str()), 0);
  ASSERT_EQ(temp_backup_initial_app_data(kPkg, root.c_str()), 0);
  const JsonPtr table(
      json_tokener_parse(read_text(snapshot() + "/shared/data/org.example.notes.perm").c_str()));
  std::set<std::string> names;
  json_object_object_foreach(table.get(), key, value) {
    if (json_object_is_type(value, json_type_object)) names.insert(key);
  }
  EXPECT_EQ(names, (std::set<std::string>{"data/db", "data/db/notes.db", "data/empty"}));
  EXPECT_EQ(json_object_array_length(json_object_object_get(table.get(), "quarn_symbolic_info")),
            0U);
}

}  // namespace
