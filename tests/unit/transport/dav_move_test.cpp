// Uploads to a WebDAV server that moves, where other devices and odd answers come in between.
#include "dav_test.h"

using namespace harness;
using front::Rule;
using front::Spoil;

namespace {

class RepeatedMove : public DavTest, public ::testing::WithParamInterface<int> {
 protected:
  // The first move is not done; then there is a pause.
  void refuse_first() { server.set_rules({refusal("MOVE", "/f/", GetParam())}); }
  void write_in_pause() {
    clock.set_on_pause([this] { model.put(kObject, kForeign); });
  }
};

TEST_P(RepeatedMove, LeavesWhatAnotherDeviceWroteMeanwhile) {
  read_as_basis("old");
  refuse_first();
  write_in_pause();
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(model.content(), (Content{{kObject, kForeign}}));
  EXPECT_EQ(model.locks(), 0U);
}

TEST_P(RepeatedMove, LeavesWhatAnotherDeviceMadeMeanwhile) {
  ASSERT_EQ(cloud.get(kObject, BACKUP_TRANS_OPTION_BASIS), "<12>");
  refuse_first();
  write_in_pause();
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(model.content(), (Content{{kObject, kForeign}}));
}

TEST_P(RepeatedMove, LeavesItWithoutLocksToo) {
  model.refuse("LOCK", 501);
  read_as_basis("old");
  refuse_first();
  write_in_pause();
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(model.content(), (Content{{kObject, kForeign}}));
}

TEST_P(RepeatedMove, IsAskedForLikeTheFirst) {
  for (const bool is_there : {true, false}) {
    if (is_there)
      read_as_basis("old");
    else
      ASSERT_EQ(cloud.get("/f/p", BACKUP_TRANS_OPTION_BASIS), "<12>");
    Rule first = refusal("MOVE", "/f/", GetParam());
    first.header = "overwrite";
    first.value = is_there ? "T" : "F";
    server.set_rules({first});
    EXPECT_EQ(cloud.put(is_there ? kObject : "/f/p", "new"), 0);
    EXPECT_EQ(server.count(0), 2);
  }
  EXPECT_EQ(model.content(), (Content{{kObject, "new"}, {"/f/p", "new"}}));
}

INSTANTIATE_TEST_SUITE_P(Answers, RepeatedMove, ::testing::Values(408, 423, 429, 500, 503));

class LostMove : public DavTest {
 protected:
  // The first move is done, and nobody is told.
  void lose_answer() {
    Rule rule{"MOVE", "/f/"};
    rule.last = 1;
    rule.takes_effect = true;
    rule.fault.spoil = Spoil::answer;
    rule.fault.answer = 504;
    server.set_rules({rule});
  }
};

TEST_F(LostMove, IsFound) {
  read_as_basis("old");
  lose_answer();
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(model.content(), (Content{{kObject, "new"}}));
  EXPECT_EQ(requests("MOVE", ""), 1);
}

TEST_F(LostMove, ThatAnotherDeviceFollowedIsAConflict) {
  read_as_basis("old");
  lose_answer();
  clock.set_on_pause([this] { model.put(kObject, kForeign); });
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(model.content(), (Content{{kObject, kForeign}}));
}

using Paths = std::vector<std::string>;

// Uploads that are cut off, and a server that then says nothing any more.
class LostConnection : public DavTest {
 protected:
  LostConnection() { model.put("/f/p", "x"); }
  void lose() {
    Rule cut{"PUT", "quarn-part-"};
    cut.takes_effect = true;
    cut.fault.spoil = Spoil::reset_request;
    cut.fault.at = 60000;
    Rule silence{"DELETE", ""};
    silence.fault.spoil = Spoil::reset_response;
    server.set_rules({cut, silence});
  }
  std::size_t leftovers() const {
    std::size_t found = 0;
    for (const auto &[path, ignored] : model.content())
      if (path.find("quarn-part-") != std::string::npos) ++found;
    return found;
  }
  Paths paths() const {
    Paths all;
    for (const auto &[path, ignored] : model.content()) all.push_back(path);
    return all;
  }

  const std::string content = bytes(100000);
};

TEST_F(LostConnection, LeavesNothingOnceAnUploadIsDone) {
  lose();
  EXPECT_EQ(cloud.put(kObject, content), BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_GT(leftovers(), 1U);
  server.set_rules({});
  EXPECT_EQ(cloud.put("/g", "new"), 0);
  EXPECT_EQ(paths(), (Paths{"/f/p", "/g"}));
}

TEST_F(LostConnection, LeavesNothingWhenItComesBackInTime) {
  lose();
  clock.set_on_pause([this] {
    if (leftovers() > 2) server.set_rules({});
  });
  EXPECT_EQ(cloud.put(kObject, content), 0);
  EXPECT_EQ(paths(), (Paths{kObject, "/f/p"}));
}

TEST_F(LostConnection, LeavesNoFolderThatWasMadeForIt) {
  model.drop("/f");
  model.put("/g", "x");
  lose();
  EXPECT_EQ(cloud.put(kObject, content), BACKUP_TRANS_ERROR_NETWORK);
  server.set_rules({});
  EXPECT_EQ(cloud.put("/g", "new"), 0);
  EXPECT_EQ(paths(), Paths{"/g"});
}

TEST_F(LostConnection, IsRememberedUntilTheServerAnswers) {
  lose();
  EXPECT_EQ(cloud.put(kObject, content), BACKUP_TRANS_ERROR_NETWORK);
  const std::size_t left = leftovers();
  server.set_rules({refusal("DELETE", "/f/", 503)});
  EXPECT_EQ(cloud.put("/g", "new"), 0);
  EXPECT_EQ(leftovers(), left);
  EXPECT_EQ(cloud.put("/g", "newer"), 0);
  EXPECT_EQ(leftovers(), 0U);
}

TEST_F(LostConnection, IsNotAskedAboutWhatItRefusesToDelete) {
  lose();
  EXPECT_EQ(cloud.put(kObject, content), BACKUP_TRANS_ERROR_NETWORK);
  server.set_rules({refusal("DELETE", "/f/", 403, front::kForEver)});
  EXPECT_EQ(cloud.put("/g", "new"), 0);
  const int asked = server.count(0);
  EXPECT_GT(asked, 1);
  EXPECT_EQ(cloud.put("/g", "newer"), 0);
  EXPECT_EQ(server.count(0), asked);
}

TEST_F(LostConnection, LeavesNoMoreThanCanBeRemembered) {
  constexpr std::size_t kRemembered = 64;
  lose();
  while (leftovers() <= kRemembered)
    ASSERT_EQ(cloud.put(kObject, content), BACKUP_TRANS_ERROR_NETWORK);
  const std::size_t left = leftovers();
  server.set_rules({});
  EXPECT_EQ(cloud.put("/g", "new"), 0);
  EXPECT_EQ(leftovers(), left - kRemembered);
}

TEST_F(LostConnection, ThatSentNothingIsNotTidiedUpAfter) {
  Rule silence{"MKCOL", ""};
  silence.fault.spoil = Spoil::reset_response;
  server.set_rules({silence});
  EXPECT_EQ(cloud.put("/new/o", content), BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(requests("DELETE", ""), 0);
}

}  // namespace
