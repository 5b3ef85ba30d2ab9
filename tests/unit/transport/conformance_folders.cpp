#include <glib.h>

#include <algorithm>

#include "conformance.h"

using namespace harness;

namespace {

using Content = std::map<std::string, std::string>;

TEST_P(Conformance, FolderThatDoesNotExistHasNoChildren) {
  EXPECT_TRUE(cloud.children("/").empty());
  EXPECT_TRUE(cloud.children("/nothing").empty());
  EXPECT_TRUE(cloud.children("/nothing/deep/").empty());
  ASSERT_EQ(cloud.put("/object", "x"), 0);
  EXPECT_TRUE(cloud.children("/object").empty());
}

TEST_P(Conformance, ListingHoldsDirectChildrenInTheOrderOfTheirBytes) {
  for (const char *path : {"/f/b", "/f/a/deep/er", "/f/a.txt", "/f/B", "/f/\xc3\xa4", "/f/a-",
                           "/f/z/1", "/f/z/2", "/g/other", "/ff"}) {
    ASSERT_EQ(cloud.put(path, path), 0) << path;
  }
  const std::vector<Child> expected = {{"/f/B", true, 4, 0},       {"/f/a", false, 0, 0},
                                       {"/f/a-", true, 5, 0},      {"/f/a.txt", true, 8, 0},
                                       {"/f/b", true, 4, 0},       {"/f/z", false, 0, 0},
                                       {"/f/\xc3\xa4", true, 5, 0}};
  EXPECT_EQ(cloud.children("/f"), expected);
  EXPECT_EQ(cloud.children("/f/"), expected);
  const std::vector<Child> top = {{"/f", false, 0, 0}, {"/ff", true, 3, 0}, {"/g", false, 0, 0}};
  EXPECT_EQ(cloud.children("/"), top);
}

TEST_P(Conformance, ListingsArePaged) {
  int stored = 0;
  for (const int size : {0, 1, 100, 101, 250}) {
    for (; stored < size; ++stored) {
      char name[32];
      g_snprintf(name, sizeof name, "/page/%04d/x", stored);
      store->put(name, "x");
    }
    std::vector<std::string> seen;
    int answers = 0;
    for (bool more = true; more; ++answers) {
      const AnswerPtr answer = cloud.list("/page", static_cast<int>(seen.size()), 100);
      ASSERT_TRUE(cloud.settle());
      ASSERT_EQ(answer->code, 0);
      EXPECT_LE(answer->children.size(), 100U);
      for (const Child &child : answer->children) seen.push_back(child.path);
      more = answer->more;
    }
    EXPECT_EQ(static_cast<int>(seen.size()), size);
    EXPECT_EQ(answers, std::max(1, (size + 99) / 100));
    EXPECT_TRUE(std::is_sorted(seen.begin(), seen.end()));
    EXPECT_EQ(std::adjacent_find(seen.begin(), seen.end()), seen.end());
  }
  const AnswerPtr middle = cloud.list("/page", 98, 3);
  const AnswerPtr last = cloud.list("/page", 249, 1);
  const AnswerPtr beyond = cloud.list("/page", 250, 100);
  ASSERT_TRUE(cloud.settle());
  ASSERT_EQ(middle->children.size(), 3U);
  EXPECT_EQ(middle->children[0].path, "/page/0098");
  EXPECT_EQ(middle->children[2].path, "/page/0100");
  EXPECT_TRUE(middle->more);
  ASSERT_EQ(last->children.size(), 1U);
  EXPECT_FALSE(last->more);
  EXPECT_TRUE(beyond->children.empty());
  EXPECT_FALSE(beyond->more);
}

TEST_P(Conformance, DeletedFolderIsGoneWithEverythingInIt) {
  for (const char *path : {"/s/p/1/p.zip", "/s/p/2/p.zip", "/s/p/2/deep/er/x", "/s/pp/1/pp.zip",
                           "/s/p.txt", "/s/q/1/q.zip"}) {
    ASSERT_EQ(cloud.put(path, "x"), 0);
  }
  const AnswerPtr answer = cloud.remove("/s/p/");
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, 0);
  ASSERT_TRUE(answer->has_info);
  EXPECT_EQ(answer->children[0].path, "/s/p");
  EXPECT_FALSE(answer->children[0].is_file);
  EXPECT_EQ(store->content(),
            (Content{{"/s/pp/1/pp.zip", "x"}, {"/s/p.txt", "x"}, {"/s/q/1/q.zip", "x"}}));
  EXPECT_EQ(cloud.get("/s/p/1/p.zip"), "<12>");
}

TEST_P(Conformance, DeletedFolderTakesParentsAlongThatHoldNothingElse) {
  ASSERT_EQ(cloud.put("/s/p/1/p.zip", "x"), 0);
  ASSERT_EQ(cloud.drop("/s/p/1"), 0);
  EXPECT_TRUE(store->content().empty());
  EXPECT_TRUE(cloud.children("/").empty());
  EXPECT_EQ(cloud.drop("/s"), BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
}

TEST_P(Conformance, DeletionOfWhatIsNoFolderIsReported) {
  ASSERT_EQ(cloud.put("/a/object", "x"), 0);
  const AnswerPtr absent = cloud.remove("/nothing");
  const AnswerPtr object = cloud.remove("/a/object");
  const AnswerPtr below = cloud.remove("/a/object/x");
  const AnswerPtr prefix = cloud.remove("/a/obj");
  ASSERT_TRUE(cloud.settle());
  for (const AnswerPtr &answer : {absent, object, below, prefix}) {
    EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
    EXPECT_TRUE(answer->has_info);
  }
  EXPECT_EQ(absent->children[0].path, "/nothing");
  EXPECT_EQ(cloud.get("/a/object"), "x");
}

TEST_P(Conformance, FolderWithManyObjectsIsDeletedWhole) {
  for (int i = 0; i < 1100; ++i) store->put("/many/" + std::to_string(i), "");
  store->put("/other", "x");
  EXPECT_EQ(cloud.drop("/many"), 0);
  EXPECT_EQ(store->content(), (Content{{"/other", "x"}}));
}

TEST_P(Conformance, OddNamesAreNamesLikeOthers) {
  const std::string long_name(200, 'n');
  const std::vector<std::string> names = {"with space",
                                          "per%cent",
                                          "per%41cent",
                                          "%2F",
                                          "%",
                                          "hash#tag",
                                          "quest?ion=1&b=2",
                                          "plus+plus",
                                          "semi;colon",
                                          "quote\"s'",
                                          "<angle>&amp;",
                                          "back\\slash",
                                          "co:lon",
                                          "at@sign",
                                          "comma,",
                                          "(paren)[brackets]{braces}",
                                          "tilde~",
                                          "star*",
                                          "dollar$",
                                          "equal=",
                                          "exclam!",
                                          "pipe|",
                                          "caret^",
                                          "back`tick",
                                          ".hidden",
                                          "..dots",
                                          "trailing.",
                                          "trailing ",
                                          " leading",
                                          "\xc3\xa4\xc3\xb6\xc3\xbc",
                                          "\xe6\x97\xa5\xe6\x9c\xac\xe8\xaa\x9e",
                                          "\xf0\x9f\x98\x80",
                                          "a\xcc\x88 decomposed",
                                          long_name};
  Content expected;
  for (const std::string &name : names) {
    const std::string path = "/odd " + name + "/" + name;
    ASSERT_EQ(cloud.put(path, name), 0) << name;
    expected[path] = name;
  }
  EXPECT_EQ(store->content(), expected);
  for (const std::string &name : names) {
    const std::string folder = "/odd " + name;
    EXPECT_EQ(cloud.get(folder + "/" + name), name);
    const std::vector<Child> only = {{folder + "/" + name, true, name.size(), 0}};
    EXPECT_EQ(cloud.children(folder), only);
  }
  EXPECT_EQ(cloud.children("/").size(), names.size());
  for (const std::string &name : names) {
    EXPECT_EQ(cloud.drop("/odd " + name), 0) << name;
    expected.erase("/odd " + name + "/" + name);
    EXPECT_EQ(store->content(), expected) << name;
  }
}

}  // namespace
