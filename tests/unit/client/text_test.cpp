#include "text.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <limits>

#include "json_read.h"

namespace {

using namespace std::string_literals;
using namespace quarn_client;

TEST(Printable, LeavesPrintableTextAlone) {
  EXPECT_EQ(printable("org.example.notes"), "org.example.notes");
  EXPECT_EQ(printable("Größe 写真 🙂"), "Größe 写真 🙂");
}

TEST(Printable, MakesControlsVisible) {
  EXPECT_EQ(printable("a\x1b[31mb\r\n\t\x7f"), "a\\x1b[31mb\\x0d\\x0a\\x09\\x7f");
  EXPECT_EQ(printable("a\0b"s), "a\\x00b");
  EXPECT_EQ(printable("\u009b2J"), "\\u{9b}2J");
}

TEST(Printable, MakesDirectionMarksAndOtherFormatCharactersVisible) {
  EXPECT_EQ(printable("\u202e\u2066\u200b"), "\\u{202e}\\u{2066}\\u{200b}");
}

TEST(Printable, WritesBytesThatAreNotUtf8AsEscapes) {
  EXPECT_EQ(printable("a\xff\xc3"), "a\\xff\\xc3");
  EXPECT_EQ(printable("\xed\xa0\x80"), "\\xed\\xa0\\x80");
}

TEST(DisplayWidth, CountsColumnsNotBytes) {
  EXPECT_EQ(display_width("abc"), 3U);
  EXPECT_EQ(display_width("写真"), 4U);
  EXPECT_EQ(display_width("e\u0301"), 1U);
}

TEST(Clipped, ShortensToTheColumns) {
  EXPECT_EQ(clipped("abcdefgh", 8), "abcdefgh");
  EXPECT_EQ(clipped("abcdefghi", 8), "abcde...");
  EXPECT_EQ(clipped("写真写真写", 8), "写真...");
  EXPECT_EQ(clipped("abcdefghi", 2), "..");
  EXPECT_EQ(clipped("abcdefghi", 0), "");
}

TEST(LocalTime, IsIsoWithTheOffset) {
  setenv("TZ", "Europe/Berlin", 1);
  const std::string berlin = local_time(1709208300000);
  setenv("TZ", "UTC", 1);
  EXPECT_EQ(local_time(1709208300000), "2024-02-29T12:05:00+00:00");
  EXPECT_EQ(berlin.size(), std::string("2024-02-29T13:05:00+01:00").size());
}

TEST(LocalTime, IsADashOutOfRange) {
  EXPECT_EQ(local_time(std::numeric_limits<std::int64_t>::max()), "-");
  EXPECT_EQ(local_time(std::numeric_limits<std::int64_t>::min()), "-");
}

TEST(SizeText, ChoosesAUnit) {
  EXPECT_EQ(size_text(0), "0 B");
  EXPECT_EQ(size_text(1023), "1023 B");
  EXPECT_EQ(size_text(1024), "1.0 KiB");
  EXPECT_EQ(size_text(26214400), "25.0 MiB");
  EXPECT_EQ(size_text(std::numeric_limits<std::uint64_t>::max()), "16.0 EiB");
}

TEST(TableText, AlignsColumnsByWhatIsSeen) {
  EXPECT_EQ(table_text({"A", "B"}, {{"写真", "1"}, {"x", "\x1b"}}),
            "A     B\n"
            "写真  1\n"
            "x     \\x1b\n");
}

TEST(JsonText, EscapesWhatATerminalWouldObey) {
  const JsonPtr object(json_object_new_object());
  json_add(object.get(), "a", "\x1b\u009b\u202e\U000e0001 é");
  EXPECT_EQ(json_text(object.get()), R"({"a":"\u001b\u009b\u202e\udb40\udc01 é"})");
  EXPECT_EQ(json_string(json_parse(json_text(object.get())).get(), "a"),
            "\x1b\u009b\u202e\U000e0001 é");
}

TEST(JsonText, ReplacesBytesThatAreNotUtf8) {
  const JsonPtr object(json_object_new_object());
  json_add(object.get(), "a", "\xff");
  EXPECT_EQ(json_text(object.get()), R"({"a":"\ufffd"})");
}

TEST(JsonParse, RefusesWhatIsNotOneDocument) {
  for (const char *text : {"", "{", "{}{}", "{} x", "nul", "{\"a\":}"}) {
    EXPECT_FALSE(json_parse(text)) << text;
  }
  EXPECT_TRUE(json_parse(" {\"a\":1} \n"));
}

TEST(JsonRead, AnswersNothingForAnotherType) {
  const JsonPtr object = json_parse(R"({"text":"a\u0000b","number":3,"null":null})");
  EXPECT_EQ(json_string(object.get(), "text"), "a\0b"s);
  EXPECT_EQ(json_integer(object.get(), "number"), 3);
  EXPECT_FALSE(json_string(object.get(), "number"));
  EXPECT_FALSE(json_string(object.get(), "null"));
  EXPECT_FALSE(json_integer(object.get(), "text"));
  EXPECT_FALSE(json_integer(object.get(), "missing"));
  EXPECT_FALSE(json_integer(nullptr, "number"));
}

}  // namespace
