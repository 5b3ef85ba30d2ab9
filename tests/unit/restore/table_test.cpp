#include <set>

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

}  // namespace
