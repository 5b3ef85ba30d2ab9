#include "progress.h"

#include <gtest/gtest.h>

namespace {

using namespace quarn_client;

ProgressEvent event(const std::string &text) {
  const auto parsed = parse_progress(text);
  EXPECT_TRUE(parsed) << text;
  return parsed.value_or(ProgressEvent());
}

TEST(ParseProgress, RefusesWhatIsNotAnEvent) {
  for (const char *text :
       {"", "x", "null", "[]", "{}", R"({"kind":"backup"})", R"({"kind":1,"stage":"checking"})",
        R"({"kind":"backup","stage":null})"}) {
    EXPECT_FALSE(parse_progress(text)) << text;
  }
}

TEST(ParseProgress, TakesMembersOfOtherTypesAsMissing) {
  const ProgressEvent read =
      event(R"({"kind":"backup","stage":"uploading","run":"1","package":3,"index":[],)"
            R"("count":null,"bytes_done":-5,"bytes_total":"x","size":-1,"cap":{},"result":true})");
  EXPECT_EQ(read.package, "");
  EXPECT_EQ(read.bytes_done, 0U);
  EXPECT_EQ(read.bytes_total, 0U);
  EXPECT_FALSE(read.size);
  EXPECT_FALSE(read.cap);
  EXPECT_FALSE(read.result);
}

TEST(ProgressBoard, DrawsNoBarWhileTheEndIsNotKnown) {
  ProgressBoard board;
  board.feed(event(R"({"kind":"backup","stage":"archiving","package":"a","index":2,"count":0})"));
  EXPECT_EQ(board.bar(80), "making archives  2 done  a");
}

TEST(ProgressBoard, CountsPackagesWhereBytesAreNotKnown) {
  ProgressBoard board;
  board.feed(event(R"({"kind":"backup","stage":"archiving","package":"a","index":1,"count":4})"));
  EXPECT_EQ(board.bar(80), "[######------------------]  25%  making archives  1 of 4  a");
}

TEST(ProgressBoard, CountsTheBytesOfUploads) {
  ProgressBoard board;
  board.feed(event(R"({"kind":"backup","stage":"uploading","index":1,"count":9,)"
                   R"("bytes_done":1024,"bytes_total":2048})"));
  EXPECT_EQ(board.bar(80),
            "[############------------]  50%  uploading  1 of 9  1.0 KiB of 2.0 KiB");
}

TEST(ProgressBoard, NeverRunsBackOrBeyondTheEnd) {
  ProgressBoard board;
  board.feed(
      event(R"({"kind":"backup","stage":"uploading","bytes_done":9,"bytes_total":2,"count":1})"));
  EXPECT_EQ(board.bar(80).substr(0, 31), "[########################] 100%");
  board.feed(
      event(R"({"kind":"backup","stage":"uploading","bytes_done":0,"bytes_total":2,"count":1})"));
  EXPECT_EQ(board.bar(80).substr(0, 31), "[########################] 100%");
}

TEST(ProgressBoard, SurvivesNumbersThatMakeNoSense) {
  ProgressBoard board;
  board.feed(
      event(R"({"kind":"backup","stage":"archiving","index":9223372036854775807,"count":1})"));
  EXPECT_EQ(board.bar(80).substr(0, 31), "[########################] 100%");
  board.feed(
      event(R"({"kind":"backup","stage":"cleaning","index":-9223372036854775808,"count":3})"));
  EXPECT_EQ(board.bar(80).substr(0, 31), "[------------------------]   0%");
}

TEST(ProgressBoard, AnotherRunBeginsAnew) {
  ProgressBoard board;
  board.feed(event(R"({"run":1,"kind":"backup","stage":"uploading","package":"a",)"
                   R"("outcome":"uploaded"})"));
  board.feed(event(R"({"run":2,"kind":"backup","stage":"checking"})"));
  EXPECT_TRUE(board.outcomes().empty());
}

TEST(ProgressBoard, RestoresCountThePackagesThatAreExpected) {
  ProgressBoard board(4);
  board.feed(event(R"({"kind":"restore","stage":"unpacking","package":"a"})"));
  EXPECT_EQ(board.bar(80), "[------------------------]   0%  unpacking  a");
  board.feed(event(R"({"kind":"restore","stage":"finished","package":"a","outcome":"restored"})"));
  EXPECT_EQ(board.bar(80), "[######------------------]  25%  finished  a");
}

TEST(ProgressBoard, TheBarFitsTheTerminal) {
  ProgressBoard board;
  board.feed(event(R"({"kind":"backup","stage":"archiving","package":")" + std::string(500, 'p') +
                   R"(","index":1,"count":1})"));
  EXPECT_EQ(board.bar(39).size(), 39U);
}

TEST(ProgressBoard, TheLastOutcomeOfAPackageStands) {
  ProgressBoard board;
  board.feed(event(R"({"kind":"restore","stage":"downloading","package":"a","outcome":"failed"})"));
  board.feed(event(R"({"kind":"restore","stage":"finished","package":"a","outcome":"restored"})"));
  ASSERT_EQ(board.outcomes().size(), 1U);
  EXPECT_EQ(board.outcome_of("a")->outcome, "restored");
  EXPECT_EQ(board.outcome_of("b"), nullptr);
}

TEST(ProgressBoard, SaysAStageOnce) {
  ProgressBoard board;
  const char checking[] = R"({"kind":"backup","stage":"checking"})";
  EXPECT_EQ(board.feed(event(checking)), "checking the application list in the cloud");
  EXPECT_EQ(board.feed(event(checking)), "");
}

TEST(ProgressBoard, WithoutOutcomesThereIsNoTable) { EXPECT_EQ(ProgressBoard().table(), ""); }

TEST(ReasonText, HasWordsForEveryReason) {
  for (const char *reason : {"unchanged", "external", "too-large", "no-space", "disabled",
                             "unreadable", "upload-failed", "not-installed", "rules",
                             "too-many-files", "names-too-long", "table-too-large", "too-deep"}) {
    PackageOutcome outcome;
    outcome.reason = reason;
    EXPECT_NE(reason_text(outcome), reason);
  }
}

TEST(ReasonText, TellsTheSizesThatDidNotFit) {
  PackageOutcome outcome;
  outcome.size = 2097152;
  outcome.cap = 1048576;
  outcome.reason = "too-large";
  EXPECT_EQ(reason_text(outcome), "2.0 MiB of data, at most 1.0 MiB");
  outcome.reason = "no-space";
  EXPECT_EQ(reason_text(outcome), "2.0 MiB of data, 1.0 MiB are free");
}

TEST(ReasonText, TellsBytesWhereTheUnitsHideTheDifference) {
  PackageOutcome outcome;
  outcome.reason = "too-large";
  outcome.size = 26214401;
  outcome.cap = 26214400;
  EXPECT_EQ(reason_text(outcome), "26214401 B of data, at most 26214400 B");
}

TEST(ReasonText, FallsBackToTheReasonItselfAndThenToTheResult) {
  PackageOutcome outcome;
  outcome.reason = "moonlight";
  EXPECT_EQ(reason_text(outcome), "moonlight");
  outcome.reason = "";
  outcome.outcome = "failed";
  outcome.result = 31;
  EXPECT_EQ(reason_text(outcome), "the archive or its file-info table is unreadable");
}

TEST(StageText, HasWordsForEveryStage) {
  for (const char *stage : {"archiving", "listing", "cleaning", "snapshot", "attributes"}) {
    EXPECT_NE(stage_text("backup", stage), stage);
  }
  EXPECT_EQ(stage_text("backup", "dancing"), "dancing");
}

}  // namespace
