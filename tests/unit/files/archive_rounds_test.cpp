#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <cstdint>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "codec_choice.h"
#include "log_capture.h"
#include "mock_platform.h"
#include "noise.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "temp_dir.h"
#include "zip_bytes.h"

namespace {

using ::testing::NiceMock;

constexpr char kPackage[] = "org.example.notes";

/** Run a shell command, which gets the archive as $1 and a directory as $2. @return its status */
int shell(const std::string &command, const std::string &archive, const std::string &dir) {
  const std::string line = "set -- '" + archive + "' '" + dir + "'; " + command;
  const int status = std::system(line.c_str());
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

constexpr char kPythonUnpacks[] =
    "python3 -c 'import sys, zipfile\n"
    "with zipfile.ZipFile(sys.argv[1]) as archive:\n"
    "    assert archive.testzip() is None\n"
    "    archive.extractall(sys.argv[2])' \"$1\" \"$2\"";

class ArchiveRounds : public ::testing::TestWithParam<ArchiveCodec> {
 protected:
  void SetUp() override {
    ON_CALL(platform_, smack_getlabel)
        .WillByDefault([](const char *, char **label, smack_label_type) {
          *label = strdup("App::Label");
          return 0;
        });
    files_ = {{"data/empty", ""},
              {"data/one", "1"},
              {"data/deep/er/text", std::string(100000, 'a') + "end"},
              {"data/noise", noise(300000)},
              {"data/large", noise(1000) + std::string(2 << 20, 'x')},
              {"shared/trusted/two words", "text"},
              {"shared/data/gr\xc3\xbc\xc3\x9f"
               "e",
               "greetings"}};
    for (const auto &[name, content] : files_) root_.file(name, content);
    clear_captured_log();
  }
  void TearDown() override { choose_codec(ArchiveCodec::kIsal); }

  void pack(ArchiveCodec codec) {
    choose_codec(codec);
    int error = 0;
    make_zip_data(kPackage, root_.path().c_str(), archive_.c_str(), &error);
    ASSERT_EQ(error, 0);
  }
  void expect_unpacked(const std::string &below) const {
    for (const auto &[name, content] : files_) {
      EXPECT_TRUE(read_text(below + "/" + name) == content) << name;
    }
  }

  NiceMock<MockPlatform> platform_;
  TempDir root_;
  TempDir place_;
  TempDir out_;
  std::vector<std::pair<std::string, std::string>> files_;
  const std::string archive_ = place_ / "archive.zip";
};

INSTANTIATE_TEST_SUITE_P(Codec, ArchiveRounds,
                         ::testing::Values(ArchiveCodec::kIsal, ArchiveCodec::kZlib),
                         [](const auto &info) {
                           return info.param == ArchiveCodec::kIsal ? "Isal" : "Zlib";
                         });

TEST_P(ArchiveRounds, EitherCodecReadsTheArchive) {
  pack(GetParam());
  for (const ArchiveCodec reader : {ArchiveCodec::kIsal, ArchiveCodec::kZlib}) {
    const TempDir out;
    choose_codec(reader);
    unzip_report report;
    EXPECT_EQ(unzip_data(kPackage, out.path().c_str(), archive_.c_str(), &report), QUARN_OK);
    EXPECT_TRUE(report.complete());
    EXPECT_EQ(report.extracted, files_.size() + 1);
    expect_unpacked(out.path());
    EXPECT_NE(read_text(out / "shared/data/org.example.notes.perm").find("data\\/deep\\/er"),
              std::string::npos);
  }
}

TEST_P(ArchiveRounds, UnzipReadsTheArchive) {
  // It takes names of an archive that no system signed for those of a DOS code page.
  unlink((root_ / files_.back().first).c_str());
  files_.pop_back();
  pack(GetParam());
  EXPECT_EQ(shell("unzip -tqq \"$1\" && unzip -qq \"$1\" -d \"$2\"", archive_, out_.path()), 0);
  expect_unpacked(out_.path());
}

TEST_P(ArchiveRounds, BsdtarReadsTheArchive) {
  pack(GetParam());
  EXPECT_EQ(shell("LC_ALL=C.UTF-8 bsdtar -x -f \"$1\" -C \"$2\"", archive_, out_.path()), 0);
  expect_unpacked(out_.path());
}

TEST_P(ArchiveRounds, PythonReadsTheArchive) {
  pack(GetParam());
  EXPECT_EQ(shell(kPythonUnpacks, archive_, out_.path()), 0);
  expect_unpacked(out_.path());
}

TEST_P(ArchiveRounds, ArchivesOfOtherProgramsAreRead) {
  choose_codec(GetParam());
  const std::pair<const char *, const char *> writers[] = {
      {"zip", "cd \"$2\" && zip -q -D -r \"$1\" data shared"},
      {"zip to a pipe", "cd \"$2\" && zip -q -D -r - data shared | cat >\"$1\""},
      {"bsdtar",
       "cd \"$2\" && find data shared -type f -print0 |"
       " LC_ALL=C.UTF-8 bsdtar -c --null -T - --format zip -f \"$1\""},
      {"Python",
       "cd \"$2\" && find data shared -type f -print0 | xargs -0 python3 -c 'import sys, zipfile\n"
       "with zipfile.ZipFile(sys.argv[1], \"w\", zipfile.ZIP_DEFLATED) as archive:\n"
       "    for name in sys.argv[2:]: archive.write(name)' \"$1\""}};
  for (const auto &[name, command] : writers) {
    unlink(archive_.c_str());
    ASSERT_EQ(shell(command, archive_, root_.path()), 0) << name;
    const TempDir out;
    unzip_report report;
    EXPECT_EQ(unzip_data(kPackage, out.path().c_str(), archive_.c_str(), &report), QUARN_OK);
    EXPECT_TRUE(report.complete()) << name;
    EXPECT_EQ(report.extracted, files_.size()) << name;
    expect_unpacked(out.path());
  }
}

TEST_P(ArchiveRounds, AnApplicationWithoutDataYieldsItsTableAlone) {
  std::filesystem::remove_all(root_ / "data");
  std::filesystem::remove_all(root_ / "shared");
  for (const char *dir : {"data", "shared/data", "shared/trusted"}) root_.dir(dir);
  pack(GetParam());
  EXPECT_EQ(unzip_data(kPackage, out_.path().c_str(), archive_.c_str()), QUARN_OK);
  EXPECT_EQ(read_text(out_ / "shared/data/org.example.notes.perm"),
            R"({ "quarn_symbolic_info": [ ] })");
  EXPECT_FALSE(exists(out_ / "data"));
}

}  // namespace
