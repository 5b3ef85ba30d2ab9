#include "quarn_d_memps.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "log_capture.h"
#include "quarn_d_lifecycle.h"

namespace {

struct Termination {
  double delay;
  bool restart;
};
std::vector<Termination> terminations;

std::string fake_smaps;
std::string fake_release;
int opened_pid = 0;

}  // namespace

void request_quarn_terminate(double delay, bool restart) {
  terminations.push_back({delay, restart});
}

namespace {

using ::testing::internal::CaptureStdout;
using ::testing::internal::GetCapturedStdout;

constexpr std::chrono::seconds kPatience(10);
constexpr char kMalformed[] = "mi get error\n";

int open_fake_smaps(int pid) {
  opened_pid = pid;
  const int fd = memfd_create("smaps", MFD_CLOEXEC);
  EXPECT_EQ(write(fd, fake_smaps.data(), fake_smaps.size()),
            static_cast<ssize_t>(fake_smaps.size()));
  lseek(fd, 0, SEEK_SET);
  return fd;
}

int fake_kernel_name(struct utsname *name) {
  if (fake_release.empty()) return -1;
  std::snprintf(name->release, sizeof name->release, "%s", fake_release.c_str());
  return 0;
}

struct MapsDeleter {
  void operator()(mapinfo *maps) const { free_maps(maps); }
};
using Maps = std::unique_ptr<mapinfo, MapsDeleter>;

/** One entry as kernels before 3.10 print it. */
std::string old_entry(const std::string &header, int pss) {
  const std::string n = std::to_string(pss);
  return header + "\nSize:           " + n + " kB\nRss:            " + n +
         " kB\nPss:            " + n + " kB\nShared_Clean:   " + n + " kB\nShared_Dirty:   " + n +
         " kB\nPrivate_Clean:  " + n + " kB\nPrivate_Dirty:  " + n +
         " kB\nReferenced:     0 kB\nAnonymous:      0 kB\nAnonHugePages:  0 kB\nSwap:           0 "
         "kB\nPSwap:          0 kB\nKernelPageSize: 4 kB\nMMUPageSize:    4 kB\nLocked:         0 "
         "kB\n";
}

/** One entry as a current kernel prints it. */
std::string new_entry(const std::string &header, int pss) {
  const std::string n = std::to_string(pss);
  return header + "\nSize:               " + n +
         " kB\nKernelPageSize:        4 kB\nMMUPageSize:           4 kB\nRss:                " + n +
         " kB\nPss:                " + n +
         " kB\nPss_Dirty:             1 kB\nShared_Clean:       " + n +
         " kB\nShared_Dirty:       " + n + " kB\nPrivate_Clean:      " + n +
         " kB\nPrivate_Dirty:      " + n +
         " kB\nReferenced:            0 kB\nAnonymous:             0 kB\nKSM:                   0 "
         "kB\nLazyFree:              0 kB\nAnonHugePages:         0 kB\nShmemPmdMapped:        0 "
         "kB\nFilePmdMapped:         0 kB\nShared_Hugetlb:        0 kB\nPrivate_Hugetlb:       0 "
         "kB\nSwap:                  0 kB\nSwapPss:               0 kB\nLocked:                0 "
         "kB\nTHPeligible:           0\nProtectionKey:         0\nVmFlags: rd mr mw me \n";
}

const std::string kLibText = "b6e00000-b6f00000 r-xp 00000000 b3:02 1234       /usr/lib/libone.so";
const std::string kLibData = "b6f00000-b6f01000 rw-p 00100000 b3:02 1234       /usr/lib/libone.so";
const std::string kOtherLib = "b6f10000-b6f20000 r-xp 00000000 b3:02 1235       /usr/lib/libtwo.so";
const std::string kAnon = "b6f20000-b6f21000 rw-p 00000000 00:00 0 ";
const std::string kHeap = "01000000-01100000 rw-p 00000000 00:00 0          [heap]";

class MempsTest : public ::testing::Test {
 protected:
  MempsTest() {
    clear_captured_log();
    terminations.clear();
    fake_smaps.clear();
    fake_release = "6.1.0-18-amd64";
    memps_facts = {fake_kernel_name, open_fake_smaps};
  }
  ~MempsTest() override { memps_facts = real_facts; }

  /** Names of the records, in the order of the text. */
  static std::vector<std::string> names(const mapinfo *maps) {
    std::vector<std::string> all;
    for (; maps != nullptr; maps = maps->next) all.insert(all.begin(), maps->name);
    return all;
  }

  const memps_source real_facts = memps_facts;
};

using Names = std::vector<std::string>;

/* ---- the ceiling ---- */

TEST_F(MempsTest, UsageOfExactlyTheCeilingDoesNotRestart) {
  fake_smaps = new_entry(kLibText, 20000) + new_entry(kHeap, 480);
  check_memps_status();
  EXPECT_TRUE(terminations.empty());
  EXPECT_EQ(opened_pid, getpid());
}

TEST_F(MempsTest, OneKilobyteAboveTheCeilingRestartsAtOnce) {
  fake_smaps = new_entry(kLibText, 20000) + new_entry(kHeap, 481);
  check_memps_status();
  ASSERT_EQ(terminations.size(), 1U);
  EXPECT_EQ(terminations[0].delay, 0.0);
  EXPECT_TRUE(terminations[0].restart);
  EXPECT_EQ(count_logged(DLOG_INFO, "=== memps(20481KB) exceed 20480KB, so quarn will restart ==="),
            1);
}

TEST_F(MempsTest, UnreadableSmapsNeverRestarts) {
  memps_facts.open_smaps = [](int) { return -1; };
  EXPECT_EQ(get_memory_usage(getpid()), 0);
  check_memps_status();
  EXPECT_TRUE(terminations.empty());
}

TEST_F(MempsTest, ASmapsThatFailsToReadIsUnreadable) {
  memps_facts.open_smaps = [](int) { return open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC); };
  EXPECT_EQ(load_maps(getpid()), nullptr);
  EXPECT_EQ(get_memory_usage(getpid()), 0);
}

TEST_F(MempsTest, AnEmptySmapsHasNoMappings) { EXPECT_EQ(load_maps(getpid()), nullptr); }

/* ---- entries ---- */

TEST_F(MempsTest, AnEntryOfAnOldKernelIsReadWhole) {
  std::string text = kLibText +
                     "\nSize: 11 kB\nRss: 12 kB\nPss: 13 kB\nShared_Clean: 14 kB\nShared_Dirty: 15 "
                     "kB\nPrivate_Clean: 16 kB\nPrivate_Dirty: 17 kB\nReferenced: 18 kB\n";
  char *cursor = text.data();
  const Maps info(read_mapinfo(&cursor, 1));
  ASSERT_NE(info, nullptr);
  EXPECT_EQ(info->start, 0xb6e00000U);
  EXPECT_EQ(info->end, 0xb6f00000U);
  EXPECT_EQ(info->perm, "r-xp");
  EXPECT_EQ(info->name, "/usr/lib/libone.so");
  EXPECT_EQ(info->size, 11);
  EXPECT_EQ(info->rss, 12);
  EXPECT_EQ(info->pss, 13);
  EXPECT_EQ(info->shared_clean, 14);
  EXPECT_EQ(info->shared_dirty, 15);
  EXPECT_EQ(info->private_clean, 16);
  EXPECT_EQ(info->private_dirty, 17);
  EXPECT_EQ(read_mapinfo(&cursor, 1), nullptr);
}

TEST_F(MempsTest, AddressesOfSixtyFourBitsAreWhole) {
  fake_smaps = new_entry(
      "7ffd5b7e1000-7ffd5b802000 rw-p 00000000 00:00 0                          [stack]", 5);
  fake_smaps += new_entry(
      "ffffffffff600000-ffffffffff601000 --xp 00000000 00:00 0                  [vsyscall]", 0);
  const Maps maps(load_maps(getpid()));
  EXPECT_EQ(names(maps.get()), (Names{"[stack]", "[vsyscall]"}));
  EXPECT_EQ(maps->start, 0xffffffffff600000U);
  EXPECT_EQ(maps->next->start, 0x7ffd5b7e1000U);
  EXPECT_EQ(maps->next->end, 0x7ffd5b802000U);
  EXPECT_EQ(maps->next->pss, 5);
}

TEST_F(MempsTest, AMappingWithoutANameIsAnonymous) {
  fake_smaps = old_entry(kAnon, 1);
  const Maps maps(load_maps(getpid()));
  EXPECT_EQ(names(maps.get()), Names{"[anon]"});
}

TEST_F(MempsTest, ANameMayHoldSpaces) {
  fake_smaps =
      new_entry("7f0000000000-7f0000001000 r--p 00000000 fe:00 99      /tmp/a name (deleted)", 1);
  const Maps maps(load_maps(getpid()));
  EXPECT_EQ(names(maps.get()), Names{"/tmp/a name (deleted)"});
}

TEST_F(MempsTest, EntriesMayHaveAnyNumberOfLines) {
  fake_smaps =
      old_entry(kLibText, 1) + new_entry(kOtherLib, 2) + new_entry(kHeap, 4) + old_entry(kAnon, 8);
  for (const int extra : {0, 4, 7, 8, 100}) {
    smaps_lines = extra;
    const Maps maps(load_maps(getpid()));
    EXPECT_EQ(names(maps.get()),
              (Names{"/usr/lib/libone.so", "/usr/lib/libtwo.so", "[heap]", "[anon]"}));
  }
  EXPECT_EQ(get_memory_usage(getpid()), 15);
}

TEST_F(MempsTest, AnEntryWithoutPssCountsAsNothing) {
  fake_smaps = kLibText +
               "\nSize: 11 kB\nRss: 12 kB\nShared_Clean: 14 kB\nShared_Dirty: 15 kB\n"
               "Private_Clean: 16 kB\nPrivate_Dirty: 17 kB\n" +
               old_entry(kOtherLib, 3);
  const Maps maps(load_maps(getpid()));
  EXPECT_EQ(names(maps.get()), (Names{"/usr/lib/libone.so", "/usr/lib/libtwo.so"}));
  EXPECT_EQ(maps->next->private_dirty, 17);
  EXPECT_EQ(get_memory_usage(getpid()), 3);
}

TEST_F(MempsTest, AMalformedEntryEndsTheParsingAndThoseBeforeItCount) {
  for (const char *missing :
       {"Size:", "Rss:", "Shared_Clean:", "Shared_Dirty:", "Private_Clean:", "Private_Dirty:"}) {
    std::string broken = old_entry(kOtherLib, 2);
    broken.replace(broken.find(missing), 1, "x");
    fake_smaps = old_entry(kLibText, 1) + broken + old_entry(kHeap, 4);
    CaptureStdout();
    EXPECT_EQ(get_memory_usage(getpid()), 1) << missing;
    EXPECT_EQ(GetCapturedStdout(), kMalformed) << missing;
  }
}

TEST_F(MempsTest, ACounterThatIsNoNumberIsMalformed) {
  std::string broken = old_entry(kLibText, 1);
  broken.replace(broken.find("Rss:            1"), 17, "Rss:            x");
  fake_smaps = broken;
  CaptureStdout();
  EXPECT_EQ(load_maps(getpid()), nullptr);
  EXPECT_EQ(GetCapturedStdout(), kMalformed);
}

TEST_F(MempsTest, AnEntryThatIsCutOffIsMalformed) {
  fake_smaps = old_entry(kLibText, 1) + kOtherLib + "\nSize: 4 kB\nRss: 4";
  CaptureStdout();
  EXPECT_EQ(get_memory_usage(getpid()), 1);
  EXPECT_EQ(GetCapturedStdout(), kMalformed);
}

TEST_F(MempsTest, ATextThatDoesNotBeginWithAMappingIsMalformed) {
  for (const char *first : {"no mapping", "-1000 rw-p", "1000- rw-p", "1000-2000"}) {
    fake_smaps = old_entry(first, 1);
    CaptureStdout();
    EXPECT_EQ(load_maps(getpid()), nullptr) << first;
    EXPECT_EQ(GetCapturedStdout(), kMalformed) << first;
  }
}

TEST_F(MempsTest, AnEmptyLineEndsTheParsing) {
  fake_smaps = old_entry(kLibText, 1) + "\n" + old_entry(kOtherLib, 2);
  CaptureStdout();
  EXPECT_EQ(get_memory_usage(getpid()), 1);
  EXPECT_EQ(GetCapturedStdout(), "");
}

/* ---- merging ---- */

TEST_F(MempsTest, AdjacentMappingsOfOneLibraryAreOneRecord) {
  fake_smaps = old_entry(kLibText, 3) + old_entry(kLibData, 4) + old_entry(kOtherLib, 5);
  const Maps maps(load_maps(getpid()));
  EXPECT_EQ(names(maps.get()), (Names{"/usr/lib/libone.so", "/usr/lib/libtwo.so"}));
  const mapinfo *merged = maps->next;
  EXPECT_EQ(merged->start, 0xb6e00000U);
  EXPECT_EQ(merged->end, 0xb6f01000U);
  EXPECT_EQ(merged->perm, "rw-p");
  for (const int value : {merged->size, merged->rss, merged->pss, merged->shared_clean,
                          merged->shared_dirty, merged->private_clean, merged->private_dirty}) {
    EXPECT_EQ(value, 7);
  }
}

TEST_F(MempsTest, TwoAnonymousMappingsStayApart) {
  fake_smaps =
      old_entry(kAnon, 1) + old_entry(kAnon, 2) + old_entry(kHeap, 3) + old_entry(kHeap, 4);
  const Maps maps(load_maps(getpid()));
  EXPECT_EQ(names(maps.get()), (Names{"[anon]", "[anon]", "[heap]", "[heap]"}));
}

TEST_F(MempsTest, MappingsOfALibraryWithAnotherBetweenStayApart) {
  fake_smaps = old_entry(kLibText, 1) + old_entry(kAnon, 2) + old_entry(kLibData, 4);
  const Maps maps(load_maps(getpid()));
  EXPECT_EQ(names(maps.get()), (Names{"/usr/lib/libone.so", "[anon]", "/usr/lib/libone.so"}));
}

TEST_F(MempsTest, ATextLargerThanTheBuffersStepsIsReadWhole) {
  const std::string pair = new_entry(kLibText, 1) + new_entry(kOtherLib, 1);
  int entries = 0;
  while (fake_smaps.size() < 3 * 524288) {
    fake_smaps += pair;
    entries += 2;
  }
  EXPECT_EQ(get_memory_usage(getpid()), entries);
  fake_smaps = new_entry(kHeap, 9);
  EXPECT_EQ(get_memory_usage(getpid()), 9);
}

/* ---- the kernel's version ---- */

class KernelTest : public MempsTest,
                   public ::testing::WithParamInterface<std::pair<const char *, int>> {};

TEST_P(KernelTest, TellsHowManyLinesFollow) {
  smaps_lines = -1;
  fake_release = GetParam().first;
  check_kernel_version();
  EXPECT_EQ(smaps_lines, GetParam().second);
}

INSTANTIATE_TEST_SUITE_P(Versions, KernelTest,
                         ::testing::Values(std::pair("3.4.0", 7), std::pair("3.9.11", 7),
                                           std::pair("3.10.0-1160", 8), std::pair("3.18", 8),
                                           std::pair("3", 7), std::pair("4.0", 4),
                                           std::pair("2.6.35", 4), std::pair("6.1.0-18-amd64", 4)));

TEST_F(MempsTest, WithoutAKernelNameTheLineCountStays) {
  smaps_lines = 8;
  fake_release.clear();
  check_kernel_version();
  EXPECT_EQ(smaps_lines, 8);
}

/* ---- the running kernel ---- */

/** A process that holds still while it is measured. */
class StillProcess {
 public:
  StillProcess() : pid_(fork()) {
    if (pid_ == 0) {
      raise(SIGSTOP);
      _exit(EXIT_SUCCESS);
    }
    int status = 0;
    EXPECT_EQ(waitpid(pid_, &status, WUNTRACED), pid_);
    EXPECT_TRUE(WIFSTOPPED(status));
  }
  ~StillProcess() {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  int pid() const { return pid_; }

 private:
  const pid_t pid_;
};

/** The kernel's own sum. */
int rollup_pss(pid_t pid) {
  std::ifstream file("/proc/" + std::to_string(pid) + "/smaps_rollup");
  std::string line;
  int pss = 0;
  while (std::getline(file, line)) {
    if (std::sscanf(line.c_str(), "Pss: %d kB", &pss) == 1) break;
  }
  return pss;
}

TEST_F(MempsTest, TheSumIsTheKernelsOwnWithinItsRounding) {
  memps_facts = real_facts;
  const StillProcess process;
  int mappings = 0;
  std::string line;
  std::ifstream maps_file("/proc/" + std::to_string(process.pid()) + "/maps");
  while (std::getline(maps_file, line)) ++mappings;
  ASSERT_GT(mappings, 0);

  // What other processes map at the same time changes the shares: measure again
  // until nothing moved between the kernel's two answers.
  const auto deadline = std::chrono::steady_clock::now() + kPatience;
  int rollup = 0;
  int usage = -1;
  int rollup_after = -1;
  CaptureStdout();
  do {
    rollup = rollup_pss(process.pid());
    usage = get_memory_usage(process.pid());
    rollup_after = rollup_pss(process.pid());
  } while (rollup != rollup_after && std::chrono::steady_clock::now() < deadline);
  EXPECT_EQ(GetCapturedStdout(), "");
  ASSERT_EQ(rollup, rollup_after);
  ASSERT_GT(rollup, 0);
  // Each mapping is rounded down to a kilobyte on its own, the roll-up once.
  EXPECT_LE(usage, rollup);
  EXPECT_GE(usage, rollup - mappings);
}

TEST_F(MempsTest, TheRunningProcessHasAStackAmongItsMappings) {
  memps_facts = real_facts;
  const Maps maps(load_maps(getpid()));
  EXPECT_THAT(names(maps.get()), ::testing::Contains("[stack]"));
  EXPECT_GT(get_memory_usage(getpid()), 0);
}

TEST_F(MempsTest, AProcessThatDoesNotExistUsesNothing) {
  memps_facts = real_facts;
  int pid = 0;
  {
    const StillProcess process;
    pid = process.pid();
  }
  EXPECT_EQ(get_memory_usage(pid), 0);
}

}  // namespace
