// Archives that an earlier release made (plain, names), and others that a common program made of
// what was in one of them (folders, descriptors): what could be restored then can be restored now.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <json-c/json.h>
#include <sys/stat.h>

#include <filesystem>
#include <string>

#include "json_ptr.h"
#include "log_capture.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/file.h"
#include "temp_dir.h"

namespace {

constexpr char kPackage[] = "org.example.notes";
constexpr char kTable[] = "shared/data/org.example.notes.perm";

class ArchiveFixtures : public ::testing::Test {
 protected:
  /** Unpack one that must hold so many files. */
  void unpack(const std::string &name, unsigned int files) {
    clear_captured_log();
    unzip_report report;
    const std::string archive = QUARN_ARCHIVES + name;
    EXPECT_EQ(unzip_data(kPackage, root_.path().c_str(), archive.c_str(), &report), QUARN_OK);
    EXPECT_TRUE(report.complete());
    EXPECT_EQ(report.extracted, files);
    EXPECT_TRUE(captured_texts().empty()) << captured_texts()[0];
  }
  std::string text(const std::string &name) const { return read_text(root_ / name); }
  /** Whether the unpacked table has such a member. */
  bool recorded(const std::string &name) const {
    const JsonPtr table(json_tokener_parse(text(kTable).c_str()));
    return json_object_object_get_ex(table.get(), name.c_str(), nullptr) != 0;
  }

  TempDir root_;
};

TEST_F(ArchiveFixtures, OfEveryKindOfFile) {
  unpack("plain.zip", 6);
  EXPECT_EQ(text("data/settings.ini"), "[view]\nzoom=2\n");
  EXPECT_EQ(text("data/db/app.db").size(), 64U * 256U);
  EXPECT_TRUE(exists(root_ / "data/empty"));
  EXPECT_EQ(text("shared/data/card.json"), "{\"a\": 1}\n");
  EXPECT_EQ(text("shared/trusted/key"), std::string(1000, 'k'));
  EXPECT_TRUE(recorded("data/db"));
  EXPECT_NE(text(kTable).find(R"("real_name": "data\/link", "lnk": "db\/app.db")"),
            std::string::npos);
}

TEST_F(ArchiveFixtures, OfLongAndOddNames) {
  unpack("names.zip", 8);
  EXPECT_EQ(text("data/" + std::string(255, 'n')), "255 bytes");
  std::string deep = "data";
  for (int i = 0; i < 120; ++i) {
    const std::string number = std::to_string(i);
    deep += "/long-directory-name-" + std::string(3 - number.size(), '0') + number;
  }
  EXPECT_EQ(text(deep + "/end"), "deep");
  EXPECT_TRUE(recorded(deep));
  EXPECT_EQ(text("data/line\nbreak"), "newline");
  EXPECT_EQ(text("data/gr\xc3\xbc\xc3\x9f"
                 "e"),
            "utf-8");
  EXPECT_EQ(text("data/\xff\xfe"), "no text");
  EXPECT_EQ(text("data/back\\slash \"quoted\" \x01\x7f"), "signs");
  EXPECT_TRUE(recorded("data/back\\slash \"quoted\" \x01\x7f"));
  EXPECT_EQ(text("data/per%cent %s"), "format");
}

TEST_F(ArchiveFixtures, RepackedWithFoldersAndWithDescriptors) {
  for (const char *name : {"folders.zip", "descriptors.zip"}) {
    unpack(name, 5);
    EXPECT_EQ(text("data/a"), "one") << name;
    EXPECT_EQ(text("data/dir/sub/b").size(), 3000U) << name;
    EXPECT_EQ(text("shared/data/c"), "three") << name;
    EXPECT_TRUE(exists(root_ / "shared/trusted/d")) << name;
    EXPECT_TRUE(std::filesystem::is_directory(root_ / "data/empty")) << name;
    EXPECT_TRUE(recorded("data/dir/sub/b")) << name;
    std::filesystem::remove_all(root_ / "data");
  }
}

}  // namespace
