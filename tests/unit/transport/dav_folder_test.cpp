// What a WebDAV server says of folders, and when it does not say it.
#include "dav_test.h"

using namespace harness;
using front::Rule;

namespace {

// The question whether there is a folder is answered with an error once.
class UnknownFolder : public DavTest {
 protected:
  static Rule unknown(const char *folder) { return refusal("PROPFIND", folder, 503); }
};

TEST_F(UnknownFolder, IsNoReasonToMissAnObject) {
  model.put(kObject, "content");
  server.set_rules({unknown("/f/")});
  EXPECT_EQ(cloud.get(kObject), "content");
  EXPECT_EQ(clock.pauses().size(), 1U);
}

TEST_F(UnknownFolder, ThatStaysSoIsTheServersFailure) {
  model.put(kObject, "content");
  server.set_rules({refusal("PROPFIND", "/f/", 503, front::kForEver)});
  const AnswerPtr answer = cloud.download(kObject, cloud.place());
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_SERVER);
}

TEST_F(UnknownFolder, IsAskedForAgainWhereAnObjectWasAskedFor) {
  model.put("/f/o/inside", "x");
  server.set_rules({unknown(kObject), refusal("GET", kObject, 405, front::kForEver)});
  EXPECT_EQ(cloud.get(kObject), "<12>");
  EXPECT_EQ(clock.pauses().size(), 1U);
}

TEST_F(UnknownFolder, IsNotReplacedByAMove) {
  model.put("/f/o/inside", "x");
  server.set_rules({unknown(kObject), {"MOVE", "/f/", "overwrite", "T"}});
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(server.count(1), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.content(), (Content{{"/f/o/inside", "x"}}));
}

TEST_F(UnknownFolder, IsAskedForAgainBeforeTheObjectIsReplaced) {
  model.put(kObject, "old");
  server.set_rules({unknown(kObject)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.content(), (Content{{kObject, "new"}}));
}

TEST_F(UnknownFolder, IsAskedForAgainAfterTheMove) {
  model.put("/f/p", "x");
  server.set_rules({unknown(kObject), refusal("HEAD", kObject, 404)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.content(), (Content{{kObject, "new"}, {"/f/p", "x"}}));
}

TEST_F(UnknownFolder, IsAskedForAgainAfterARefusedPut) {
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  server.set_rules({unknown("/f/"), refusal("PUT", "/f/", 500)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(requests("PUT", "/f/"), 3);
}

TEST_F(UnknownFolder, IsAskedForAgainBeforeAnUploadInPlace) {
  model.refuse("MOVE", 501);
  model.put("/f/x", "x");
  server.set_rules({unknown(kObject)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(requests("MOVE", ""), 2);
  server.set_rules({unknown(kObject)});
  EXPECT_EQ(cloud.put(kObject, "newer"), 0);
  EXPECT_EQ(clock.pauses().size(), 2U);
  EXPECT_EQ(model.content(), (Content{{kObject, "newer"}, {"/f/x", "x"}}));
}

TEST_F(UnknownFolder, IsAskedForAgainWhenTheMoveFindsNone) {
  model.put("/f/o/inside", "x");
  server.set_rules({unknown(kObject), refusal("MOVE", "/f/", 409)});
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.content(), (Content{{"/f/o/inside", "x"}}));
}

TEST_F(UnknownFolder, IsNoneWhereTheQuestionIsTooOdd) {
  model.put(kObject, "old");
  server.set_rules({refusal("PROPFIND", kObject, 400, front::kForEver)});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(model.content(), (Content{{kObject, "new"}}));
}

TEST_F(UnknownFolder, IsNotAnsweredByWhoAsksForAPassword) {
  model.put(kObject, "content");
  server.set_rules({refusal("PROPFIND", "/f/", 401)});
  const AnswerPtr answer = cloud.download(kObject, cloud.place());
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_AUTHENTICATION);
}

TEST_F(UnknownFolder, IsNotAnsweredByAnythingElse) {
  model.put(kObject, "content");
  Rule garbage = refusal("PROPFIND", "/f/", 207);
  server.set_rules({garbage});
  const AnswerPtr answer = cloud.download(kObject, cloud.place());
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_SERVER);
}

}  // namespace
