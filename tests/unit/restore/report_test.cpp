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
  keep_restore_record(owned_record(3));
  end_restore_report();
  EXPECT_TRUE(outside.answers.empty());
  run_pending();
  EXPECT_EQ(outside.answers, Answers{stop(3)});
  EXPECT_EQ(g_restore_cb_data, nullptr);
  end_restore_report();
  run_pending();
  EXPECT_EQ(outside.answers.size(), 1U);
}

TEST_F(ReportTest, WithoutAKeptClientNobodyIsTold) {
  end_restore_report();
  run_pending();
  EXPECT_TRUE(outside.answers.empty());
}

TEST_F(ReportTest, TheEndWaitsForTheRestoresThatAreUnderWay) {
  keep_restore_record(owned_record(3));
  count_outstanding_restore(1);
  count_outstanding_restore(1);
  end_restore_report();
  run_pending();
  count_outstanding_restore(-1);
  run_pending();
  EXPECT_TRUE(outside.answers.empty());
  count_outstanding_restore(-1);
  run_pending();
  EXPECT_EQ(outside.answers, Answers{stop(3)});
}

TEST_F(ReportTest, AnEarlierRecordHasItsEndWhenALaterOneReplacesIt) {
  keep_restore_record(owned_record(3));
  keep_restore_record(owned_record(4));
  EXPECT_TRUE(outside.answers.empty()) << "not inside the call";
  EXPECT_TRUE(restore_report_pending());
  run_pending();
  EXPECT_EQ(outside.answers, Answers{stop(3)});
  EXPECT_FALSE(restore_report_pending());
  end_restore_report();
  run_pending();
  EXPECT_EQ(outside.answers, (Answers{stop(3), stop(4)}));
}

TEST_F(ReportTest, AWithdrawnModeEndsWithItsReason) {
  keep_restore_record(owned_record(3));
  EXPECT_TRUE(restore_record_is_of(":1.7"));
  EXPECT_FALSE(restore_record_is_of(":1.70"));
  count_outstanding_restore(1);
  set_restore_stop_result(17);
  end_restore_report();
  count_outstanding_restore(-1);
  EXPECT_FALSE(restore_record_is_of(":1.7"));
  keep_restore_record(owned_record(4));
  end_restore_report();
  run_pending();
  EXPECT_EQ(outside.answers, (Answers{{"restore_enable_cb", 17, "restore_stop", 3}, stop(4)}))
      << "the reason is of that one alone";
}

TEST_F(ReportTest, AClientWhoseModeIsOverGetsItsEndBeforeItIsReplaced) {
  keep_restore_record(owned_record(3));
  count_outstanding_restore(1);
  end_restore_report();
  keep_restore_record(owned_record(4));
  run_pending();
  EXPECT_EQ(outside.answers, Answers{stop(3)});
  count_outstanding_restore(-1);
  run_pending();
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

struct Told {
  std::string package;
  unsigned run;
  int index;
  int count;
  std::uint64_t size;
};
bool operator==(const Told &a, const Told &b) {
  return a.package == b.package && a.run == b.run && a.index == b.index && a.count == b.count &&
         a.size == b.size;
}
std::vector<Told> told;

TEST_F(ReportTest, AModeIsOneRunAndARequestOneOfItsOwn) {
  told.clear();
  set_restore_progress_sink([](const restore_progress &step) {
    told.push_back({step.package, step.run, step.index, step.count, step.size});
  });
  begin_restore_run(2);
  report_restore_step("a", restore_stage::downloading);
  const unsigned mode = told.back().run;
  begin_requested_restore("x");
  report_restore_step("x", restore_stage::downloading);
  const unsigned request = told.back().run;
  EXPECT_EQ(request, mode + 1);
  report_restore_step("a", restore_stage::unpacking, 70);
  report_restore_end("x", restore_outcome::failed, QUARN_TRANSFER_FAILED);
  report_restore_end("a", restore_outcome::restored, QUARN_OK, 70);
  report_restore_end("b", restore_outcome::skipped, QUARN_DISABLED);
  EXPECT_EQ(told, (std::vector<Told>{{"a", mode, 0, 2, 0},
                                     {"x", request, 0, 1, 0},
                                     {"a", mode, 0, 2, 70},
                                     {"x", request, 1, 1, 0},
                                     {"a", mode, 1, 2, 70},
                                     {"b", mode, 2, 2, 0}}));
  // The request is over: its package belongs to the mode again.
  report_restore_step("x", restore_stage::downloading);
  EXPECT_EQ(told.back().run, mode);
}

TEST_F(ReportTest, AnotherModeIsAnotherRun) {
  told.clear();
  set_restore_progress_sink([](const restore_progress &step) {
    told.push_back({step.package, step.run, step.index, step.count, step.size});
  });
  begin_restore_run(1);
  report_restore_end("a", restore_outcome::restored, QUARN_OK, 1);
  begin_restore_run(3);
  report_restore_step("b", restore_stage::downloading);
  EXPECT_EQ(told[1].run, told[0].run + 1);
  EXPECT_EQ(told[1].index, 0);
  EXPECT_EQ(told[1].count, 3);
}

}  // namespace
