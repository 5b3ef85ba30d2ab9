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

}  // namespace
