// Uploads to a WebDAV server that cannot move, where other devices and odd servers come in between.
#include "dav_test.h"

#include "webdav/dav_client.h"

using namespace harness;
using front::Fault;
using front::Response;
using front::Rule;
using front::Spoil;

namespace {

class InPlaceTest : public DavTest {
 protected:
  InPlaceTest() { model.refuse("MOVE", 405); }

  static Rule cut(std::size_t at, int last, bool keeps_part) {
    Fault fault;
    fault.spoil = Spoil::reset_request;
    fault.at = at;
    return {"PUT", kObject, "", "", 1, last, keeps_part, fault};
  }
};

class RefusedMove : public InPlaceTest, public ::testing::WithParamInterface<int> {};

TEST_P(RefusedMove, IsRemembered) {
  model.refuse("MOVE", GetParam());
  EXPECT_EQ(cloud.put(kObject, "one"), 0);
  EXPECT_EQ(cloud.put(kObject, "two"), 0);
  EXPECT_EQ(cloud.put("/f/p", "three"), 0);
  EXPECT_EQ(model.content(), (Content{{kObject, "two"}, {"/f/p", "three"}}));
  EXPECT_EQ(requests("MOVE", ""), 1);
  EXPECT_EQ(requests("PUT", ""), 4);
  EXPECT_EQ(clock.pauses().size(), 0U);
}

INSTANTIATE_TEST_SUITE_P(Statuses, RefusedMove, ::testing::Values(405, 501));

TEST_F(InPlaceTest, ServerThatHasMovedBeforeIsExpectedToAgain) {
  model.refuse("MOVE", 0);
  ASSERT_EQ(cloud.put(kObject, "one"), 0);
  model.refuse("MOVE", 501);
  EXPECT_EQ(cloud.put(kObject, "two"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(model.content(), (Content{{kObject, "one"}}));
  model.refuse("MOVE", 0);
  EXPECT_EQ(cloud.put(kObject, "three"), 0);
  EXPECT_EQ(requests("MOVE", ""), 4);
}

TEST_F(InPlaceTest, FolderInItsPlaceIsNoReasonNotToMove) {
  model.put("/f/o/inside", "x");
  EXPECT_EQ(cloud.put(kObject, "one"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(requests("MOVE", ""), 1);
  model.refuse("MOVE", 0);
  EXPECT_EQ(cloud.put("/f/p", "two"), 0);
  EXPECT_EQ(requests("MOVE", ""), 2);
  EXPECT_EQ(model.content(), (Content{{"/f/o/inside", "x"}, {"/f/p", "two"}}));
}

TEST_F(InPlaceTest, FolderInItsPlaceStays) {
  ASSERT_EQ(cloud.put("/f/p", "one"), 0);
  model.put("/f/o/inside", "x");
  const AnswerPtr plain = cloud.upload(cloud.file("two"), kObject);
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(plain->code, BACKUP_TRANS_ERROR_SERVER);
  ASSERT_EQ(cloud.get(kObject, BACKUP_TRANS_OPTION_BASIS), "<12>");
  EXPECT_EQ(cloud.put(kObject, "three"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(model.content(), (Content{{"/f/o/inside", "x"}, {"/f/p", "one"}}));
}

TEST_F(InPlaceTest, ObjectOfAnotherDeviceThatCameInBetweenStaysWithoutLocks) {
  model.refuse("LOCK", 501);
  read_as_basis("old");
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  // After the last comparison.
  server.set_rules({after("GET", 1, [&](Response *) { model.put(kObject, kForeign); })});
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(model.content().at(kObject), kForeign);
  EXPECT_EQ(requests("PUT", kObject), 1);
}

TEST_F(InPlaceTest, ObjectOfAnotherDeviceThatWasMadeInBetweenStaysWithoutLocks) {
  model.refuse("LOCK", 405);
  ASSERT_EQ(cloud.get(kObject, BACKUP_TRANS_OPTION_BASIS), "<12>");
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  server.set_rules({after("GET", 1, [&](Response *) { model.put(kObject, kForeign); })});
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(model.content().at(kObject), kForeign);
}

TEST_F(InPlaceTest, ConditionThatFailsWithoutReasonIsTriedAgainAndThenLeftOut) {
  model.refuse("LOCK", 501);
  read_as_basis("old");
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  Fault refusal;
  refusal.spoil = Spoil::answer;
  refusal.answer = 412;
  server.set_rules({{"PUT", kObject, "if-match", "", 1, 0, false, {}},
                    {"PUT", kObject, "", "", 1, 1, false, refusal}});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(model.content().at(kObject), "new");
  EXPECT_EQ(clock.pauses().size(), 1U);
  // The second one came without a tag.
  EXPECT_EQ(server.count(0), 1);
}

class LockThatEnded : public InPlaceTest, public ::testing::WithParamInterface<int> {};

TEST_P(LockThatEnded, IsNotReliedOn) {
  model.refuse("MOVE", GetParam());
  read_as_basis("old");
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  server.set_rules({after("GET", 1, [&](Response *) { clock.pass(transport::kLockDuration); })});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(model.content(), (Content{{kObject, "new"}, {"/f/p", "x"}}));
  EXPECT_EQ(clock.pauses().size(), 1U);
  EXPECT_EQ(model.locks(), 0U);
}

// Before a move, and before an upload in place.
INSTANTIATE_TEST_SUITE_P(Moves, LockThatEnded, ::testing::Values(0, 501));

TEST_F(InPlaceTest, FolderWhoseLockEndedIsABrokenCondition) {
  Fault refusal;
  refusal.spoil = Spoil::answer;
  refusal.answer = 424;
  read_as_basis("old");
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  server.set_rules({{"PUT", kObject, "", "", 1, 1, false, refusal}});
  EXPECT_EQ(cloud.put(kObject, "new"), 0);
  EXPECT_EQ(model.content().at(kObject), "new");
  EXPECT_EQ(clock.pauses().size(), 1U);
  // A plain one shows no proof.
  server.set_rules({{"PUT", kObject, "", "", 1, 1, false, refusal}});
  EXPECT_EQ(cloud.put(kObject, "newer"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(clock.pauses().size(), 1U);
}

TEST_F(InPlaceTest, ObjectThatAnotherDevicePutWhereAPartMightLieStays) {
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  server.set_rules({cut(60000, front::kForEver, false),
                    after("HEAD", 2, [&](Response *) { model.put(kObject, kForeign); })});
  EXPECT_EQ(cloud.put(kObject, bytes(100000)), BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(model.content().at(kObject), kForeign);
}

TEST_F(InPlaceTest, OldObjectComesBackWhereItWasReadAsABasis) {
  const std::string old_content = bytes(70000, 1);
  read_as_basis(old_content);
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  // Refused from then on, until the old one is put back.
  Fault refusal;
  refusal.spoil = Spoil::answer;
  refusal.answer = 403;
  server.set_rules(
      {cut(60000, 1, true),
       {"PUT", kObject, "content-length", "100000", 1, front::kForEver, false, refusal}});
  EXPECT_EQ(cloud.put(kObject, bytes(100000, 2)), BACKUP_TRANS_ERROR_AUTHENTICATION);
  EXPECT_TRUE(model.content().at(kObject) == old_content);
}

TEST_F(InPlaceTest, OldObjectThatIsTheNewOnesBeginningIsNoPartOfIt) {
  const std::string longer = bytes(100000, 1);
  const std::string old_content = longer.substr(0, 50000);
  read_as_basis(old_content);
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  server.set_rules({cut(60000, front::kForEver, true)});
  EXPECT_EQ(cloud.put(kObject, longer), BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_TRUE(model.content().at(kObject) == old_content);
}

TEST_F(InPlaceTest, LargeOldObjectIsNotKept) {
  const std::string old_content = bytes((1 << 20) + 1, 1);
  read_as_basis(old_content);
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  server.set_rules({cut(60000, front::kForEver, true)});
  const AnswerPtr answer = cloud.upload(cloud.file(bytes(100000, 2)), kObject);
  ASSERT_TRUE(cloud.settle());
  EXPECT_NE(answer->code, 0);
  EXPECT_EQ(model.content(), (Content{{"/f/p", "x"}}));
}

TEST_F(InPlaceTest, WrongLengthAfterItIsLookedAtAgain) {
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  server.set_rules(
      {after("HEAD", 2, [](Response *answer) { answer->headers["Content-Length"] = "1"; })});
  EXPECT_EQ(cloud.put(kObject, "content"), 0);
  EXPECT_EQ(model.content().at(kObject), "content");
  EXPECT_EQ(requests("PUT", kObject), 1);
  EXPECT_EQ(clock.pauses().size(), 1U);
}

TEST_F(InPlaceTest, LocalFileThatChangesIsNotLeftInTheStore) {
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  for (const bool with_basis : {false, true}) {
    if (with_basis) read_as_basis("old");
    const std::string local = cloud.file("content");
    server.set_rules({after("PUT", 1, [&](Response *) { write_file(local, "CONTENT"); })});
    const AnswerPtr answer = cloud.upload(local, kObject);
    ASSERT_TRUE(cloud.settle());
    EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_LOCAL_FILE);
    EXPECT_EQ(model.content(),
              with_basis ? (Content{{kObject, "old"}, {"/f/p", "x"}}) : (Content{{"/f/p", "x"}}));
  }
}

TEST_F(InPlaceTest, SameContentAgainNeedsNoChange) {
  ASSERT_EQ(cloud.put(kObject, "content"), 0);
  EXPECT_EQ(cloud.put(kObject, "content"), 0);
  EXPECT_EQ(cloud.put(kObject, ""), 0);
  EXPECT_EQ(cloud.put(kObject, ""), 0);
  EXPECT_EQ(model.content().at(kObject), "");
  EXPECT_EQ(clock.pauses().size(), 0U);
}

TEST_F(InPlaceTest, FullStoreIsToldAndNoProbeStays) {
  model.put(kObject, "old");
  ASSERT_EQ(cloud.put("/f/p", "x"), 0);
  Fault full;
  full.spoil = Spoil::answer;
  full.answer = 500;
  server.set_rules({{"PUT", kObject, "", "", 1, front::kForEver, false, full}});
  EXPECT_EQ(cloud.put(kObject, "new"), BACKUP_TRANS_ERROR_QUOTA);
  EXPECT_EQ(model.content(), (Content{{kObject, "old"}, {"/f/p", "x"}}));
}

}  // namespace
