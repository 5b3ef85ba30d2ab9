#include "restore_fixture.h"

namespace {

class ReportTest : public RestoreTest {
 protected:
  using Answers = std::vector<Outside::Answer>;
  static Outside::Answer stop(unsigned int req_id) {
    return {"restore_enable_cb", 0, "restore_stop", req_id};
  }
};

TEST_F(ReportTest, TheKeptClientIsToldOfTheEndFromTheMainLoop) {
  keep_restore_record(make_record(3));
  end_restore_report();
  EXPECT_TRUE(outside.answers.empty());
  run_main_context();
  EXPECT_EQ(outside.answers, Answers{stop(3)});
  EXPECT_EQ(g_restore_cb_data, nullptr);
  end_restore_report();
  run_main_context();
  EXPECT_EQ(outside.answers.size(), 1U);
}

TEST_F(ReportTest, WithoutAKeptClientNobodyIsTold) {
  end_restore_report();
  run_main_context();
  EXPECT_TRUE(outside.answers.empty());
}

TEST_F(ReportTest, TheEndWaitsForTheRestoresThatAreUnderWay) {
  keep_restore_record(make_record(3));
  count_outstanding_restore(1);
  count_outstanding_restore(1);
  end_restore_report();
  run_main_context();
  count_outstanding_restore(-1);
  run_main_context();
  EXPECT_TRUE(outside.answers.empty());
  count_outstanding_restore(-1);
  run_main_context();
  EXPECT_EQ(outside.answers, Answers{stop(3)});
}

TEST_F(ReportTest, ALaterRecordReplacesTheEarlierWithoutACallback) {
  keep_restore_record(make_record(3));
  keep_restore_record(make_record(4));
  end_restore_report();
  run_main_context();
  EXPECT_EQ(outside.answers, Answers{stop(4)});
}

TEST_F(ReportTest, AClientWhoseModeIsOverGetsItsEndBeforeItIsReplaced) {
  keep_restore_record(make_record(3));
  count_outstanding_restore(1);
  end_restore_report();
  keep_restore_record(make_record(4));
  run_main_context();
  EXPECT_EQ(outside.answers, Answers{stop(3)});
  count_outstanding_restore(-1);
  run_main_context();
  EXPECT_EQ(outside.answers.size(), 1U) << "the second client's mode goes on";
}

TEST_F(ReportTest, WithoutASinkProgressGoesNowhere) {
  report_restore_step("a", restore_stage::snapshot);
  report_restore_end("a", restore_outcome::restored, 0);
  static int steps;
  steps = 0;
  set_restore_progress_sink([](const restore_progress &) { ++steps; });
  report_restore_step("a", restore_stage::snapshot);
  EXPECT_EQ(steps, 1);
}

}  // namespace
