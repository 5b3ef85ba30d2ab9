// The fault matrix: what every request ends with when the network or the server fails.
#include <glib.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <cstdlib>
#include <filesystem>
#include <iostream>

#include "fault_world.h"
#include "network_kinds.h"

namespace {

using harness::milliseconds;

struct Kind {
  const char *name;
  std::unique_ptr<NetworkStore> (*make)();
  Expected FaultRow::*cells;
};

const std::vector<Kind> &kinds() {
  static const std::vector<Kind> all = {
      {"Dav", make_dav_network_store, &FaultRow::dav},
      {"DavInPlace", make_dav_in_place_store, &FaultRow::in_place},
      {"S3", make_s3_network_store, &FaultRow::s3}};
  return all;
}

struct Case {
  std::size_t row;
  Step step;
  const Kind *kind;
  const char *expected;
  std::string name;
};

std::ostream &operator<<(std::ostream &out, const Case &one) { return out << one.name; }

std::string name_of(const FaultRow &row, std::size_t step) {
  std::string result;
  bool up = true;
  for (const char c : row.name + " at " + kStepNames.at(step)) {
    const bool is_part = std::isalnum(static_cast<unsigned char>(c)) != 0;
    if (is_part) result += up ? static_cast<char>(std::toupper(static_cast<unsigned char>(c))) : c;
    up = !is_part;
  }
  return result;
}

// Shows what comes of every fault at every step, to make a table from.
bool discovering() { return std::getenv("DISCOVER_FAULTS") != nullptr; }

bool makes_sense(const FaultRow &row, Step step, const Kind &kind) {
  const bool is_first =
      step == Step::put || step == Step::get || step == Step::list || step == Step::remove;
  const bool concerns = !row.at_look || step == Step::put || step == Step::replace;
  return concerns && (is_first || (row.place == Place::plain && !row.refused_once)) &&
         !kind.make()->requests_of(step).method.empty();
}

std::vector<Case> all_cases() {
  std::vector<Case> cases;
  const auto rows = fault_table("");
  for (const Kind &kind : kinds()) {
    for (std::size_t row = 0; row < rows.size(); ++row) {
      for (std::size_t step = 0; step < kSteps; ++step) {
        const char *expected = (rows[row].*kind.cells).at(step);
        const bool shown = discovering() && makes_sense(rows[row], static_cast<Step>(step), kind);
        if (expected == nullptr && !shown) continue;
        cases.push_back(
            {row, static_cast<Step>(step), &kind, expected, kind.name + name_of(rows[row], step)});
      }
    }
  }
  return cases;
}

// Where a cancellation comes in between.
std::vector<Case> lasting_cases() {
  std::vector<Case> cases = all_cases();
  const auto rows = fault_table("");
  const auto ends = [&](const Case &one) {
    return rows[one.row].last != front::kForEver ||
           (one.step != Step::put && one.step != Step::get && one.step != Step::replace);
  };
  cases.erase(std::remove_if(cases.begin(), cases.end(), ends), cases.end());
  return cases;
}

std::string base64(const std::string &text) {
  char *code = g_base64_encode(reinterpret_cast<const guchar *>(text.data()), text.size());
  std::string result = code;
  g_free(code);
  return result;
}

// What other processes of this machine can see of this one.
std::string process_list() {
  std::string text =
      harness::read_file("/proc/self/cmdline") + harness::read_file("/proc/self/environ");
  std::error_code error;
  for (const auto &task : std::filesystem::directory_iterator("/proc/self/task", error))
    text += harness::read_file(task.path().string() + "/comm");
  return text;
}

class Faults : public ::testing::TestWithParam<Case> {
 protected:
  Faults()
      : rows(fault_table("http://127.0.0.1:" + std::to_string(elsewhere.port()))),
        row(rows.at(GetParam().row)) {
    ::testing::internal::CaptureStdout();
    ::testing::internal::CaptureStderr();
  }
  ~Faults() override {
    EXPECT_TRUE(elsewhere.log().empty());
    const std::string printed =
        ::testing::internal::GetCapturedStdout() + ::testing::internal::GetCapturedStderr();
    EXPECT_FALSE(gives_away(printed + process_list()));
    std::cout << printed << discovered;
  }

  static bool gives_away(const std::string &text) {
    const std::string basic = base64(std::string("device:") + NetworkStore::kSecret);
    return text.find(NetworkStore::kSecret) != std::string::npos ||
           text.find(basic) != std::string::npos || text.find("Signature=") != std::string::npos;
  }

  Stranger stranger;
  front::Front elsewhere{stranger};
  const std::vector<FaultRow> rows;
  const FaultRow &row;
  std::string discovered;
};

TEST_P(Faults, EndAsTheTableSays) {
  const Case &one = GetParam();
  FaultWorld world(row, one.step, one.kind->make());
  world.start();
  ASSERT_TRUE(world.finish());
  if (discovering()) {
    discovered = std::string("@") + one.kind->name + "@" + row.name + "@" +
                 kStepNames.at(static_cast<std::size_t>(one.step)) + "@" + world.summary() + "\n";
  } else {
    EXPECT_EQ(world.summary(), one.expected);
  }
  EXPECT_EQ(world.objection(), "");
  EXPECT_FALSE(gives_away(world.told())) << world.told();
}

class LastingFaults : public Faults {};

TEST_P(LastingFaults, EndWithinASecondWhenCancelled) {
  const Case &one = GetParam();
  FaultWorld world(row, one.step, one.kind->make(), FaultWorld::Time::stands);
  const harness::AnswerPtr answer = world.start();
  ASSERT_TRUE(world.wait_held_up());
  const auto start = std::chrono::steady_clock::now();
  backup_trans_cancel_request(world.cloud().handle);
  ASSERT_TRUE(world.cloud().settle());
  EXPECT_LT(answer->when - start, milliseconds(1000));
  ASSERT_TRUE(world.finish());
  EXPECT_EQ(world.damage(), "");
  EXPECT_FALSE(gives_away(world.told())) << world.told();
}

INSTANTIATE_TEST_SUITE_P(Matrix, Faults, ::testing::ValuesIn(all_cases()),
                         [](const auto &info) { return info.param.name; });
INSTANTIATE_TEST_SUITE_P(Matrix, LastingFaults, ::testing::ValuesIn(lasting_cases()),
                         [](const auto &info) { return info.param.name; });

TEST(RetryAfter, IsWaitedFor) {
  // A date has no fractions, and the server's clock goes on meanwhile.
  constexpr std::chrono::seconds kShortest{90};
  constexpr std::chrono::seconds kLongest{110};
  int found = 0;
  for (const FaultRow &row : fault_table("")) {
    if (row.name.find("Retry-After") == std::string::npos || row.last != 1) continue;
    ++found;
    for (const Kind &kind : kinds()) {
      FaultWorld world(row, Step::get, kind.make());
      world.start();
      ASSERT_TRUE(world.finish());
      ASSERT_EQ(world.clock().pauses().size(), 1U);
      EXPECT_GT(world.clock().pauses().front(), kShortest);
      EXPECT_LT(world.clock().pauses().front(), kLongest);
    }
  }
  EXPECT_EQ(found, 2);
}

// The document's tables are these; a failure shows what they should be.
TEST(FaultsDocument, ShowsTheTable) {
  const std::string document = harness::read_file(DOCS_DIR "/faults.md");
  for (const Kind &kind : kinds()) {
    const std::string table = fault_document(kind.cells);
    EXPECT_NE(document.find(table), std::string::npos) << kind.name << ":\n" << table;
  }
}

}  // namespace
