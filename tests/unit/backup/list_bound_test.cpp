// A list that is written can be read again.
#include "quarn_d_backup/list_bound.h"

#include "quarn_d_backup/app_list.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/run_notes.h"
#include "run_fixture.h"

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Not;
using ::testing::StartsWith;

namespace {

constexpr char kBegin[] = R"({"format_ver":1,"model_list":[{"backup_info":{"serial_number":")";
constexpr char kMiddle[] = R"("},"pkg_list":[],"x":")";

/** Another device's list of exactly @p size bytes. */
std::string list_of_size(std::uint64_t size) {
  std::string text = std::string(kBegin) + "B" + kMiddle;
  const std::string end = R"("}]})";
  text.append(size - text.size() - end.size(), 'x');
  return text + end;
}

class ListBound : public Runs {
 protected:
  /** What a run's own entry adds to a list, with one package. */
  std::uint64_t growth() {
    const std::string text = list_of_size(2000);
    cloud_.objects[kAppListInCloud] = text;
    automatic();
    const std::uint64_t size = cloud_.objects[kAppListInCloud].size();
    cloud_.objects.clear();
    steps().clear();
    settings_.clear();
    clear_captured_log();
    return size - text.size();
  }
  std::vector<std::string> notices() const {
    std::vector<std::string> all;
    for (const SeenStep &step : steps()) {
      if (!step.notice.empty()) all.push_back(step.notice);
    }
    return all;
  }
};

TEST_F(ListBound, AListOfExactlyTheBoundIsWrittenAndReadAgain) {
  const FakePackage &a = install("org.a");
  const std::uint64_t added = growth();
  cloud_.objects[kAppListInCloud] = list_of_size(kMaxAppListSize - added);
  automatic();
  EXPECT_EQ(cloud_.objects[kAppListInCloud].size(), kMaxAppListSize);
  automatic();
  EXPECT_EQ(info("auto backup successful!"), 2);
  EXPECT_TRUE(in_cloud(a.object()));
}

TEST_F(ListBound, OneByteMoreEndsTheRunWith42BeforeAnyUploadAndTheListStands) {
  const FakePackage &a = install("org.a");
  const std::uint64_t added = growth();
  const std::string before = list_of_size(kMaxAppListSize - added + 1);
  cloud_.objects[kAppListInCloud] = before;
  manual();
  EXPECT_EQ(sent_statuses().back().err, 42);
  EXPECT_EQ(error("app list would have 4194305 bytes, but at the most 4194304 can be read again"),
            1);
  EXPECT_EQ(cloud_.count_requests("upload " + a.object()), 1) << "that of the run before";
  EXPECT_EQ(cloud_.objects[kAppListInCloud], before);
  EXPECT_EQ(steps().back().cause, "list-too-large");
  EXPECT_FALSE(steps().back().list_written);
  EXPECT_FALSE(exists(a.staged()));
}

TEST_F(ListBound, AListThatIsNearlyFullIsSaidToBe) {
  install("org.a");
  const std::uint64_t added = growth();
  cloud_.objects[kAppListInCloud] = list_of_size(kNearlyFullAppListSize - added - 1);
  automatic();
  EXPECT_THAT(notices(), IsEmpty());
  cloud_.objects[kAppListInCloud] = list_of_size(kNearlyFullAppListSize - added);
  automatic();
  EXPECT_THAT(notices(), ElementsAre("list-nearly-full"));
  EXPECT_EQ(count_logged(DLOG_WARN, "app list is nearly full : 3145728 of 4194304 bytes"), 1);
  EXPECT_EQ(info("auto backup successful!"), 2);
}

TEST_F(ListBound, AListBeyondTheBoundInTheCloudIsSaidToBeThat) {
  install("org.a");
  const std::string before = list_of_size(kMaxAppListSize + 1);
  cloud_.objects[kAppListInCloud] = before;
  manual();
  EXPECT_EQ(sent_statuses().back().err, 13);
  EXPECT_EQ(steps().back().cause, "list-too-large");
  EXPECT_EQ(cloud_.objects[kAppListInCloud], before);
}

TEST_F(ListBound, TheCompanionsListHasTheSameBound) {
  const BackupContextPtr ctx(new backup_context);
  ctx->for_pellix = true;
  ctx->serial_number = kSerial;
  ASSERT_TRUE(create_app_list_info(ctx.get()));
  const std::string version(1000, 'v');
  for (std::uint64_t i = 0; i <= kMaxAppListSize / version.size(); ++i) {
    add_pkg_info_to_app_list(ctx.get(), "org.a", version.c_str(), 1);
  }
  EXPECT_FALSE(save_app_list_to_file(ctx.get()));
  EXPECT_EQ(notes_of(ctx.get()).cause, request_cause::list_too_large);
}

}  // namespace
