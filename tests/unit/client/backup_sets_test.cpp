#include "backup_sets.h"

#include <gtest/gtest.h>

namespace {

using namespace quarn_client;

TEST(BackupSets, AreFoundByTheirSerialAndPackagesByTheirId) {
  std::string error;
  const auto sets =
      parse_backup_sets(R"({"format_ver":1,"model_list":[{"backup_info":{"serial_number":"1"},)"
                        R"("pkg_list":[{"pkg_id":"a","version":"1","crc":2}]}]})",
                        error);
  ASSERT_TRUE(sets);
  const BackupSet *set = find_set(*sets, "1");
  ASSERT_NE(set, nullptr);
  EXPECT_EQ(find_set(*sets, "2"), nullptr);
  ASSERT_NE(find_package(*set, "a"), nullptr);
  EXPECT_EQ(find_package(*set, "a")->crc, 2);
  EXPECT_EQ(find_package(*set, "b"), nullptr);
  EXPECT_EQ(set->time_ms, std::nullopt);
}

TEST(BackupSets, AnotherFormatIsNotReadAsIfUnderstood) {
  std::string error;
  EXPECT_FALSE(parse_backup_sets(R"({"format_ver":2,"model_list":[]})", error));
  EXPECT_EQ(error, "the application list has a format that this program does not know");
}

TEST(BackupSets, EveryCutOfAListIsReadOrRefused) {
  const std::string text =
      R"({"format_ver":1,"model_list":[{"backup_info":{"timestamp":1,"serial_number":"1",)"
      R"("model_name":"m"},"pkg_list":[{"pkg_id":"a","version":"1","crc":2}]}]})";
  for (std::size_t size = 0; size < text.size(); ++size) {
    std::string error;
    EXPECT_FALSE(parse_backup_sets(text.substr(0, size), error)) << size;
    EXPECT_NE(error, "");
  }
}

TEST(CrcText, IsEightDigitsOrADash) {
  EXPECT_EQ(crc_text(0), "-");
  EXPECT_EQ(crc_text(1), "00000001");
  EXPECT_EQ(crc_text(-1), "ffffffff");
}

}  // namespace
