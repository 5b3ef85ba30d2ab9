#include <malloc.h>
#include <unistd.h>

#include <filesystem>
#include <set>

#include "quarn_d_restore/archive_table.h"
#include "quarn_d_restore/attributes.h"
#include "quarn_d_utils/table_reader.h"
#include "restore_fixture.h"

namespace {

std::string parsed(const char *text) {
  const JsonPtr table(parse_file_info_table(text));
  return table == nullptr ? "none" : json_object_to_json_string_ext(table.get(), 0);
}

TEST(TableTest, ReadsWhatTheWriterWrites) {
  const JsonPtr whole(json_tokener_parse(
      R"({"quarn_symbolic_info": [{"real_name": "data\/l", "lnk": "t",
          "perm": {"0": 1, "1": 2, "2": 3, "3": "x"}}],
          "data\/\u00e4 \"q\"": {"0": 420, "1": 5000, "2": 4294967295, "3": "a"},
          "data\/b": {"0": 420, "1": 5000, "2": 5000, "3": ""}})"));
  ASSERT_NE(whole, nullptr);
  for (const int flags :
       {JSON_C_TO_STRING_PLAIN, JSON_C_TO_STRING_SPACED, JSON_C_TO_STRING_PRETTY}) {
    const std::string text = json_object_to_json_string_ext(whole.get(), flags);
    const JsonPtr table(parse_file_info_table(text.c_str()));
    EXPECT_TRUE(json_object_equal(table.get(), whole.get())) << text;
  }
}

TEST(TableTest, ReadsAnEmptyObject) {
  EXPECT_EQ(parsed("{}"), "{}");
  EXPECT_EQ(parsed(" {\n} "), "{}");
}

TEST(TableTest, ALaterEntryReplacesAnEarlierOfItsName) {
  EXPECT_EQ(parsed(R"({"a": 1, "b": 2, "a": 3})"), R"({"a":3,"b":2})");
}

TEST(TableTest, WhatIsNoWholeObjectIsNoTable) {
  for (const char *text : {"",
                           " ",
                           "x",
                           "[]",
                           "\"a\"",
                           "7",
                           "null",
                           "{",
                           "{\"a\"",
                           "{\"a\":",
                           "{\"a\": 1",
                           "{\"a\": 1,",
                           "{\"a\": 1,}",
                           "{\"a\" 1}",
                           "{1: 1}",
                           "{\"a\": 1 \"b\": 2}",
                           "{,}",
                           "{\"a\": tru}",
                           "{\"a\": \"x}",
                           "{\"a\": [1, }"}) {
    EXPECT_EQ(parsed(text), "none") << text;
  }
}

TEST(TableTest, AValueThatIsNestedTooDeeplyIsRefused) {
  EXPECT_EQ(parsed(("{\"a\": " + std::string(1000, '[') + std::string(1000, ']') + "}").c_str()),
            "none");
}

TEST(TableTest, EntriesWithEqualAttributesShareThem) {
  std::string text = "{\"quarn_symbolic_info\": []";
  for (int i = 0; i < 20000; ++i) {
    text += ", \"data/file" + std::to_string(i) + "\": {\"0\": " + (i % 2 == 0 ? "420" : "384") +
            ", \"1\": 5000, \"2\": 5000, \"3\": \"app\"}";
  }
  text += "}";
  const JsonPtr table(parse_file_info_table(text.c_str()));
  ASSERT_EQ(json_object_object_length(table.get()), 20001);
  std::set<json_object *> objects;
  json_object_object_foreach(table.get(), key, value) {
    static_cast<void>(key);
    objects.insert(value);
  }
  EXPECT_EQ(objects.size(), 3U);
  json_object *entry = json_object_object_get(table.get(), "data/file19999");
  EXPECT_EQ(json_object_get_int(json_object_object_get(entry, "0")), 384);
}

TEST(TableTest, MoreKindsOfAttributesThanAreRememberedAreKeptApart) {
  std::string text = "{\"a\": 0";
  for (int i = 0; i < 100; ++i) {
    const std::string n = std::to_string(i);
    text += ", \"" + n + "\": {\"0\": " + n + "}";
  }
  text += "}";
  const JsonPtr table(parse_file_info_table(text.c_str()));
  for (int i = 0; i < 100; ++i) {
    json_object *entry = json_object_object_get(table.get(), std::to_string(i).c_str());
    EXPECT_EQ(json_object_get_int(json_object_object_get(entry, "0")), i);
  }
}

TEST(TableTest, FromAFileEveryMemberIsFoundHoweverManyDiffer) {
  const TempDir dir;
  const std::string path = dir / "table";
  constexpr int kMembers = 5000;
  std::string text = "{\"quarn_symbolic_info\": [{\"real_name\": \"data/l\"}]";
  for (int i = 0; i < kMembers; ++i) {
    text += ", \"data/" + std::to_string(i) + "\": {\"0\": " + std::to_string(i) +
            ", \"1\": 2, \"2\": 3, \"3\": \"a" + std::to_string(i) + "\"}";
  }
  text += R"(, "data/text": "{\"0\": 1, \"1\": 2, \"2\": 3, \"3\": \"a\"}")";
  write_text(path, text + "}");
  const std::size_t before = mallinfo2().uordblks;
  const archive_table read = read_archive_table(path.c_str());
  ASSERT_NE(read.table, nullptr);
  EXPECT_LT(mallinfo2().uordblks - before, 400U * kMembers);
  int mode = -1;
  unsigned int uid = 0;
  unsigned int gid = 0;
  char *label = nullptr;
  for (int i = kMembers - 1; i >= 0; --i) {
    const std::string file = "/root/data/" + std::to_string(i);
    ASSERT_EQ(get_file_info_from_backup(read.table.get(), "org.example.notes", "/root",
                                        file.c_str(), &mode, &uid, &gid, &label),
              0);
    EXPECT_EQ(mode, i);
    EXPECT_EQ(uid, 2U);
    EXPECT_EQ(gid, 3U);
    EXPECT_EQ(label, "a" + std::to_string(i));
  }
  EXPECT_EQ(get_file_info_from_backup(read.table.get(), "org.example.notes", "/root",
                                      "/root/data/text", &mode, &uid, &gid, &label),
            31)
      << "a text is no attributes";
  write_text(path, text);
  const archive_table cut = read_archive_table(path.c_str());
  EXPECT_TRUE(cut.readable);
  EXPECT_EQ(cut.table, nullptr);
  std::filesystem::remove(path);
  EXPECT_FALSE(read_archive_table(path.c_str()).readable);
}

TEST(TableTest, WhatIsBeyondItsBoundsCostsNoMemory) {
  const TempDir dir;
  const std::string path = dir / "table";
  std::string members = "{";
  for (int i = 0; i < 300000; ++i) members += "\"" + std::to_string(i) + "\":[],";
  for (const std::string &text :
       {members, "{\"a\":[" + std::string(33U << 20, ','),
        "{\"a\":\"" + std::string(33U << 20, 'x'), "{" + std::string(33U << 20, ' ') + "}",
        "{\"" + std::string(33U << 20, 'k')}) {
    write_text(path, text);
    const std::size_t before = mallinfo2().uordblks;
    const archive_table read = read_archive_table(path.c_str());
    EXPECT_TRUE(read.readable);
    EXPECT_EQ(read.table, nullptr);
    EXPECT_LT(mallinfo2().uordblks, before + (1U << 20));
  }
}

TEST(TableTest, AWholeOneMayBeReadInPiecesOfAnySize) {
  const std::string text =
      R"( {"quarn_symbolic_info": [{"real_name": "data\/l", "lnk": "\"]}", "perm": {"0": 1}}, 7],)"
      R"( "data\/\u00e4 \"q\"": {"0": 420, "3": "a}"}, "b": null , "c":-1.5e3,"d":[1,{}] } more)";
  for (std::size_t piece = 1; piece < text.size(); ++piece) {
    TableReader reader;
    TableText table(kArchiveTableBounds, &reader);
    for (std::size_t at = 0; at < text.size(); at += piece) {
      ASSERT_TRUE(table.take(text.data() + at, std::min(piece, text.size() - at))) << at;
    }
    EXPECT_EQ(table.end(), table_state::whole) << piece;
    const JsonPtr whole(json_tokener_parse(text.c_str()));
    EXPECT_TRUE(json_object_equal(reader.take().get(), whole.get())) << piece;
  }
}

TEST(TableTest, TheBoundsAreCounted) {
  const auto state = [](const std::string &text, const table_bounds &bounds) {
    TableText table(bounds);
    table.take(text.data(), text.size());
    return table.end();
  };
  const std::string three = R"({"quarn_symbolic_info":[{},{}],"a":{}})";
  EXPECT_EQ(state(three, {three.size(), 3}), table_state::whole);
  EXPECT_EQ(state(three, {three.size() - 1, 3}), table_state::beyond);
  EXPECT_EQ(state(three, {three.size(), 2}), table_state::beyond);
  EXPECT_EQ(state(R"({"a":[[[[1]]]]})", kNoTableBounds), table_state::whole);
  EXPECT_EQ(state(R"({"a":[[[[[1]]]]]})", kNoTableBounds), table_state::beyond);
  EXPECT_EQ(state(R"({"a":")" + std::string(2046, 'x') + R"("})", kNoTableBounds),
            table_state::whole);
  EXPECT_EQ(state(R"({"a":")" + std::string(2047, 'x') + R"("})", kNoTableBounds),
            table_state::beyond);
  EXPECT_EQ(state(R"({"a":[1}})", kNoTableBounds), table_state::malformed);
  EXPECT_EQ(state("{'a':1}", kNoTableBounds), table_state::malformed);
  EXPECT_EQ(state("{\"a\":[1/*,*/]}", kNoTableBounds), table_state::malformed);
  EXPECT_EQ(state(std::string("{\"a\0\":1}", 9), kNoTableBounds), table_state::malformed);
}

}  // namespace
