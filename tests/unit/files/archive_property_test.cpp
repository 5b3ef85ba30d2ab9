// Trees of everything that a file system lets an application make, through writer and reader:
// whatever is packed without an error comes back as it was.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <json-c/json.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "json_ptr.h"
#include "log_capture.h"
#include "mock_platform.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/file.h"
#include "temp_dir.h"

namespace {

using ::testing::NiceMock;

constexpr char kPackage[] = "org.example.notes";
constexpr char kTable[] = "shared/data/org.example.notes.perm";

/** Makes a tree, and remembers what must come back. */
class OddTree {
 public:
  OddTree(const TempDir &root, unsigned int seed) : root_(root), random_(seed) {
    for (const char *dir : {"data", "shared/data", "shared/trusted"})
      dirs_.push_back(root.dir(dir));
    for (std::string &dir : dirs_) dir = dir.substr(root.path().size() + 1);
  }

  void grow(int steps) {
    for (int i = 0; i < steps; ++i) {
      switch (number(0, 9)) {
        case 0:
        case 1:
          add_dir(name());
          break;
        case 2:
          add_link();
          break;
        case 3:
          add_hard_link();
          break;
        default:
          add_file();
      }
    }
  }
  /** The longest path that can be named, a link of the longest target, thousands of links. */
  void add_extremes() {
    std::string path = "data";
    const std::string part(200, 'p');
    while (root_.path().size() + path.size() + part.size() + 300 < PATH_MAX) {
      path += "/" + part;
      dirs_.push_back(path);
      ASSERT_EQ(mkdir((root_ / path).c_str(), 0755), 0);
    }
    remember_file(path + "/" + std::string(255, 'n'), "far");
    remember_link("shared/data/longest", std::string(1023, 't'));
    for (int i = 0; i < 3000; ++i) {
      remember_link("shared/trusted/link" + std::to_string(i), "target" + std::to_string(i));
    }
    remember_file("data/hole", "");
    ASSERT_EQ(truncate((root_ / "data/hole").c_str(), 3 << 20), 0);
    files["data/hole"] = std::string(3 << 20, '\0');
  }
  /** Modes and owners of everything, some with the bits that run as somebody else. */
  void dress() {
    for (const auto &[path, content] : files) dress(path, 07777);
    for (const std::string &path : dirs_) dress(path, 01777);
  }

  std::map<std::string, std::string> files;
  std::map<std::string, std::string> links;

 private:
  int number(int from, int to) { return std::uniform_int_distribution<int>(from, to)(random_); }

  /** A name of any bytes; often the longest, or one that looks like something else. */
  std::string name() {
    static const char *const kOdd[] = {"new\nline",   "C:\\con", "%s%n", "\xc3\xbc\xe2\x82\xac",
                                       "\xff\xfe",    "...",     " ",    "-rf",
                                       "\x7f\x1b[2J", "\"{}\", "};
    if (number(0, 3) == 0) return kOdd[number(0, 9)] + std::to_string(++serial_);
    std::string made = std::to_string(++serial_);
    const int length = number(0, 9) == 0 ? 255 : number(1, 40);
    while (static_cast<int>(made.size()) < length) {
      const char c = static_cast<char>(number(1, 255));
      if (c != '/') made += c;
    }
    return made;
  }
  std::string somewhere() { return dirs_[static_cast<std::size_t>(number(0, dirs_.size() - 1))]; }
  bool fits(const std::string &path) const {
    return root_.path().size() + path.size() + 1 < PATH_MAX;
  }

  void add_dir(const std::string &name) {
    const std::string path = somewhere() + "/" + name;
    if (fits(path) && mkdir((root_ / path).c_str(), 0755) == 0) dirs_.push_back(path);
  }
  void add_file() {
    std::string content(static_cast<std::size_t>(number(0, 4) == 0 ? 0 : number(0, 70000)), '\0');
    if (number(0, 1) == 0) {
      for (char &c : content) c = static_cast<char>(random_());
    }
    remember_file(somewhere() + "/" + name(), content);
  }
  void remember_file(const std::string &path, const std::string &content) {
    if (!fits(path)) return;
    std::ofstream out(root_ / path, std::ios::binary);
    out << content;
    ASSERT_TRUE(out.good()) << path;
    files[path] = content;
  }
  void add_link() {
    remember_link(somewhere() + "/" + name(), number(0, 5) == 0 ? "/no/where" : name());
  }
  void remember_link(const std::string &path, const std::string &target) {
    if (!fits(path)) return;
    ASSERT_EQ(symlink(target.c_str(), (root_ / path).c_str()), 0) << path;
    links[path] = target;
  }
  void add_hard_link() {
    if (files.empty()) return;
    const auto &[path, content] = *std::next(files.begin(), number(0, files.size() - 1));
    const std::string again = somewhere() + "/" + name();
    if (fits(again) && link((root_ / path).c_str(), (root_ / again).c_str()) == 0) {
      files[again] = content;
    }
  }
  void dress(const std::string &path, int modes) {
    ASSERT_EQ(chown((root_ / path).c_str(), kAppUid, kAppGid), 0);
    ASSERT_EQ(chmod((root_ / path).c_str(), static_cast<mode_t>(number(0, 07777) & modes)), 0);
  }

  const TempDir &root_;
  std::mt19937 random_;
  std::vector<std::string> dirs_;
  int serial_ = 0;
};

class OddTrees : public ::testing::TestWithParam<unsigned int> {
 protected:
  OddTrees() {
    ON_CALL(platform_, smack_getlabel).WillByDefault(label_it);
    ON_CALL(platform_, smack_lgetlabel).WillByDefault(label_it);
  }
  static int label_it(const char *, char **label, smack_label_type) {
    *label = strdup("App::Label");
    return 0;
  }
  /** Pack within the bounds of a backup, and unpack. */
  void round() {
    const std::string archive = place_ / "archive.zip";
    int error = 0;
    make_zip_data(kPackage, root_.path().c_str(), archive.c_str(), &error, kBackupBounds);
    ASSERT_EQ(error, QUARN_OK) << captured_texts().back();
    unzip_report report;
    ASSERT_EQ(unzip_data(kPackage, out_.path().c_str(), archive.c_str(), &report), QUARN_OK);
    ASSERT_TRUE(report.complete());
    table_.reset(json_tokener_parse(read_text(out_ / kTable).c_str()));
    ASSERT_NE(table_, nullptr);
  }
  void expect_files(const OddTree &tree) const {
    for (const auto &[path, content] : tree.files) {
      EXPECT_TRUE(read_text(out_ / path) == content) << path;
      expect_attributes(path);
    }
    std::size_t found = 0;
    for (const auto &entry : std::filesystem::recursive_directory_iterator(out_.path())) {
      if (!entry.is_directory()) ++found;
    }
    EXPECT_EQ(found, tree.files.size() + 1) << "and the table";
  }
  /** A member's, and those of every directory on the way to it. */
  void expect_attributes(std::string path) const {
    for (;
         path.rfind('/') != std::string::npos && path != "shared/data" && path != "shared/trusted";
         path.resize(path.rfind('/'))) {
      json_object *values = nullptr;
      ASSERT_TRUE(json_object_object_get_ex(table_.get(), path.c_str(), &values)) << path;
      struct stat status = {};
      ASSERT_EQ(lstat((root_ / path).c_str(), &status), 0);
      EXPECT_EQ(json_object_get_int(json_object_object_get(values, "0")),
                static_cast<int>(status.st_mode & 07777))
          << path;
      EXPECT_EQ(json_object_get_int(json_object_object_get(values, "1")), int{kAppUid});
      EXPECT_STREQ(json_object_get_string(json_object_object_get(values, "3")), "App::Label");
    }
  }
  void expect_links(const OddTree &tree) const {
    json_object *list = json_object_object_get(table_.get(), "quarn_symbolic_info");
    std::map<std::string, std::string> found;
    for (std::size_t i = 0; i < json_object_array_length(list); ++i) {
      json_object *link = json_object_array_get_idx(list, i);
      found[json_object_get_string(json_object_object_get(link, "real_name"))] =
          json_object_get_string(json_object_object_get(link, "lnk"));
    }
    EXPECT_TRUE(found == tree.links);
  }

  NiceMock<MockPlatform> platform_;
  TempDir root_;
  TempDir place_;
  TempDir out_;
  JsonPtr table_;
};

TEST_P(OddTrees, ComeBackAsTheyWere) {
  SCOPED_TRACE("seed " + std::to_string(GetParam()));
  OddTree tree(root_, GetParam());
  tree.grow(400);
  if (GetParam() % 2 == 0) tree.add_extremes();
  tree.dress();
  round();
  if (HasFatalFailure()) return;
  expect_files(tree);
  expect_links(tree);
}

TEST_P(OddTrees, MakeTheSameArchiveEachTime) {
  OddTree tree(root_, GetParam());
  tree.grow(200);
  tree.dress();
  std::set<std::string> archives;
  for (int i = 0; i < 3; ++i) {
    int error = 0;
    const std::string archive = place_ / std::to_string(i);
    make_zip_data(kPackage, root_.path().c_str(), archive.c_str(), &error, kBackupBounds);
    EXPECT_EQ(error, QUARN_OK);
    archives.insert(read_text(archive));
  }
  EXPECT_EQ(archives.size(), 1U);
}

INSTANTIATE_TEST_SUITE_P(Seeds, OddTrees, ::testing::Range(1U, 7U));

TEST_P(OddTrees, ALinkWithALongerTargetThanTheTableTakesIsNoBackup) {
  for (const char *dir : {"data", "shared/data", "shared/trusted"}) root_.dir(dir);
  root_.link("data/longer", std::string(1024, 't'));
  int error = 0;
  make_zip_data(kPackage, root_.path().c_str(), (place_ / "archive.zip").c_str(), &error,
                kBackupBounds);
  EXPECT_EQ(error, QUARN_REFUSED);
}

}  // namespace
