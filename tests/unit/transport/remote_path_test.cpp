#include "core/remote_path.h"

#include "harness.h"

using namespace transport;

namespace {

TEST(RemotePath, ObjectPaths) {
  for (const char *path : {"/a", "/a/b", "/.a", "/...", "/a..b/c", "/ ", "/%2e", "/\xc3\xa4"})
    EXPECT_TRUE(is_object_path(path)) << path;
  for (const char *path : {"", "/", "a", "/a/", "//", "/a//b", "/.", "/a/./b", "/..", "/\xff"})
    EXPECT_FALSE(is_object_path(path)) << path;
  EXPECT_FALSE(is_object_path(nullptr));
  EXPECT_TRUE(is_object_path(("/" + std::string(kMaxComponentBytes, 'x')).c_str()));
  EXPECT_FALSE(is_object_path(("/" + std::string(kMaxComponentBytes + 1, 'x')).c_str()));
  std::string longest;
  while (longest.size() + 2 <= kMaxPathBytes) longest += "/x";
  EXPECT_TRUE(is_object_path(longest.c_str()));
  EXPECT_FALSE(is_object_path((longest + "/x").c_str()));
}

TEST(RemotePath, FolderPathsLoseTheirSlash) {
  std::string folder = "before";
  EXPECT_TRUE(parse_folder_path("/a/b/", &folder));
  EXPECT_EQ(folder, "/a/b");
  EXPECT_TRUE(parse_folder_path("/a/b", &folder));
  EXPECT_EQ(folder, "/a/b");
  EXPECT_TRUE(parse_folder_path("/", &folder));
  EXPECT_EQ(folder, "");
  for (const char *path : {"", "a", "//", "/a//", "/a/../"})
    EXPECT_FALSE(parse_folder_path(path, &folder)) << path;
  EXPECT_FALSE(parse_folder_path(nullptr, &folder));
}

TEST(RemotePath, Parts) {
  EXPECT_EQ(split_path("/a/b c/d"), (std::vector<std::string>{"a", "b c", "d"}));
  EXPECT_TRUE(split_path("").empty());
  EXPECT_EQ(parent_of("/a/b"), "/a");
  EXPECT_EQ(parent_of("/a"), "");
  EXPECT_EQ(name_of("/a/b"), "b");
}

TEST(RemotePath, TemporaryNamesAreFreshAndNoObjects) {
  const std::string name = make_temporary_name();
  EXPECT_TRUE(is_temporary_name(name));
  EXPECT_NE(name, make_temporary_name());
  EXPECT_FALSE(is_object_path(("/a/" + name).c_str()));
  EXPECT_FALSE(is_object_path(("/" + name + "/a").c_str()));
  EXPECT_FALSE(is_temporary_name(name + "0"));
  EXPECT_TRUE(is_temporary_name(name + ".0000000020"));
  EXPECT_FALSE(is_object_path(("/a/" + name + ".0000000020").c_str()));
  EXPECT_FALSE(is_temporary_name(name.substr(1)));
  EXPECT_FALSE(is_temporary_name(name.substr(0, name.size() - 1) + "G"));
  EXPECT_FALSE(is_temporary_name(""));
}

}  // namespace
