#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "log_capture.h"
#include "mock_platform.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "temp_dir.h"

namespace {

using ::testing::NiceMock;

int run(const std::string &command) { return std::system(command.c_str()); }

/** The only file is a hole, which takes no room, and compresses to little. */
TEST(LargeArchive, AFileOfMoreThanFourGibibytesIsReadByOtherPrograms) {
  NiceMock<MockPlatform> platform;
  ON_CALL(platform, smack_getlabel).WillByDefault([](const char *, char **label, smack_label_type) {
    *label = strdup("App::Label");
    return 0;
  });
  const TempDir root;
  const TempDir place;
  for (const char *dir : {"data", "shared/data", "shared/trusted"}) root.dir(dir);
  constexpr off_t kSize = (off_t{4} << 30) + 12345;
  const std::string large = root.file("data/large", "");
  ASSERT_EQ(truncate(large.c_str(), kSize), 0);
  root.file("shared/data/small", "after it");
  const std::string archive = place / "archive.zip";
  int error = 0;
  make_zip_data("org.example.notes", root.path().c_str(), archive.c_str(), &error);
  EXPECT_EQ(error, QUARN_OK);
  EXPECT_EQ(run("unzip -l '" + archive + "' | grep -qw " + std::to_string(kSize)), 0);
  EXPECT_EQ(run("unzip -p '" + archive + "' shared/data/small | grep -qx 'after it'"), 0);
  EXPECT_EQ(
      run("python3 -c 'import sys, zipfile\n"
          "with zipfile.ZipFile(sys.argv[1]) as archive:\n"
          "    sizes = [entry.file_size for entry in archive.infolist()]\n"
          "    assert sizes[:2] == [" +
          std::to_string(kSize) +
          ", 8], sizes\n"
          "    assert archive.read(\"shared/data/small\") == b\"after it\"\n"
          "    with archive.open(\"data/large\") as large: assert large.read(9) == bytes(9)' '" +
          archive + "'"),
      0);
}

}  // namespace
