// The turn belongs to a process, so each case is played by processes of its own.
#include "quarn_d_turn.h"

#include <fcntl.h>
#include <glib.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <thread>

#include "run_until.h"
#include "temp_dir.h"

namespace {

constexpr int kDeadlineMs = 20000;

/** A process that holds the lock until it is let go; it tells of SIGUSR1 and of lines. */
class Holder {
 public:
  enum class Begin { kAtOnce, kWhenTold };
  explicit Holder(const std::string &lock, Begin when = Begin::kAtOnce) {
    EXPECT_EQ(pipe2(hold_, O_CLOEXEC), 0);
    EXPECT_EQ(pipe2(tell_, O_CLOEXEC), 0);
    pid_ = fork();
    if (pid_ == 0) hold(lock);
    close(hold_[0]);
    close(tell_[1]);
    if (when == Begin::kAtOnce) begin();
  }
  void begin() const {
    EXPECT_EQ(write(hold_[1], "B", 1), 1);
    EXPECT_EQ(read_told(), 'H');
  }
  ~Holder() { let_go(); }
  Holder(const Holder &) = delete;
  Holder &operator=(const Holder &) = delete;
  char read_told() const {
    char told = 0;
    while (read(tell_[0], &told, 1) < 0 && errno == EINTR) {
    }
    return told;
  }
  void let_go() {
    if (pid_ <= 0) return;
    // Not by its pipe: a holder that was forked later has an end of that, too.
    kill(pid_, SIGKILL);
    close(hold_[1]);
    waitpid(pid_, nullptr, 0);
    close(tell_[0]);
    pid_ = 0;
  }

 private:
  static void on_signal(int) { static_cast<void>(!write(told_fd, "C", 1)); }
  static void on_lines(int) { static_cast<void>(!write(lines_fd, "L", 1)); }
  static void tell_lines() {
    for (const std::string &line : take_quarn_turn_lines()) {
      static_cast<void>(!write(told_fd, line.data(), line.size()));
    }
  }
  [[noreturn]] void hold(const std::string &lock) {
    close(hold_[1]);
    told_fd = tell_[1];
    std::signal(SIGUSR1, on_signal);
    int lines[2] = {-1, -1};
    if (pipe2(lines, O_CLOEXEC) != 0) _exit(1);
    lines_fd = lines[1];
    std::signal(SIGUSR2, on_lines);
    char nothing = 0;
    if (read(hold_[0], &nothing, 1) != 1) _exit(1);
    begin_quarn_turn(lock.c_str(), nullptr, nullptr);
    if (is_quarn_turn()) on_signal_ready();
    for (;;) {
      pollfd ready[] = {{hold_[0], POLLIN, 0}, {lines[0], POLLIN, 0}};
      if (poll(ready, 2, -1) < 0) continue;
      if ((ready[1].revents & POLLIN) != 0 && read(lines[0], &nothing, 1) == 1) tell_lines();
      if (ready[0].revents != 0) break;
    }
    _exit(0);
  }
  static void on_signal_ready() { static_cast<void>(!write(told_fd, "H", 1)); }
  static int told_fd;
  static int lines_fd;
  int hold_[2] = {-1, -1};
  int tell_[2] = {-1, -1};
  pid_t pid_ = 0;
};

int Holder::told_fd = -1;
int Holder::lines_fd = -1;

bool turn_told = false;
void on_turn() { turn_told = true; }

void check(bool holds, const char *what) {
  if (holds) return;
  std::fprintf(stderr, "failed: %s;", what);
  _exit(1);
}

void take_a_free_turn() {
  const TempDir folder;
  const std::string lock = folder / "lock";
  begin_quarn_turn(lock.c_str(), nullptr, on_turn);
  check(is_quarn_turn(), "the turn is there");
  check(wait_for_quarn_turn(0), "nothing to wait for");
  check(!signal_quarn_predecessor(SIGUSR1), "nobody is before it");
  struct stat status {};
  check(stat((folder / "lock").c_str(), &status) == 0 && (status.st_mode & 07777) == 0600,
        "the lock is the owner's alone");
  run_pending();
  check(!turn_told, "a turn that is there is not told of");
  end_quarn_turn();
  check(access(lock.c_str(), F_OK) != 0, "the lock is removed, and its folder");
  check(rmdir(lock.substr(0, lock.rfind('/')).c_str()) != 0, "with it");
  _exit(::testing::Test::HasFailure() ? 1 : 0);
}

/** Whether this process waits for a lock, or does so soon. */
bool is_waited_for() {
  const std::string own = " " + std::to_string(getpid()) + " ";
  for (int waited = 0; waited < kDeadlineMs; waited += 10) {
    std::ifstream locks("/proc/locks");
    for (std::string line; std::getline(locks, line);) {
      if (line.find("-> POSIX") != std::string::npos && line.find(own) != std::string::npos) {
        return true;
      }
    }
    usleep(10000);
  }
  return false;
}

/** The earlier process takes its lock away while others wait for it, and a later one makes another.
 */
void wait_for_a_lock_that_is_removed() {
  const TempDir folder;
  const std::string lock = folder / "lock";
  Holder first(lock);
  Holder later(lock, Holder::Begin::kWhenTold);
  begin_quarn_turn(lock.c_str(), nullptr, on_turn);
  check(is_waited_for(), "the lock is waited for");
  unlink(lock.c_str());
  later.begin();
  first.let_go();
  check(!wait_for_quarn_turn(200), "the later one is before it");
  later.let_go();
  check(wait_for_quarn_turn(kDeadlineMs), "the turn has come");
  unlink(lock.c_str());
  _exit(::testing::Test::HasFailure() ? 1 : 0);
}

void wait_for_the_turn() {
  const TempDir folder;
  Holder holder(folder / "lock");
  const std::string lock = folder / "lock";
  begin_quarn_turn(lock.c_str(), nullptr, on_turn);
  check(!is_quarn_turn(), "another has it");
  check(!wait_for_quarn_turn(10), "it keeps it");
  check(signal_quarn_predecessor(SIGUSR1), "it can be told");
  check(holder.read_told() == 'C', "it is told");
  std::thread waiter([] { check(wait_for_quarn_turn(kDeadlineMs), "a thread gets its turn"); });
  holder.let_go();
  waiter.join();
  check(is_quarn_turn(), "the turn has come");
  while (!turn_told) g_main_context_iteration(nullptr, TRUE);
  check(!signal_quarn_predecessor(SIGUSR1), "nobody is before it any more");
  unlink((folder / "lock").c_str());
  _exit(::testing::Test::HasFailure() ? 1 : 0);
}

void leave_lines() {
  const TempDir folder;
  const std::string lock = folder / "lock";
  Holder holder(lock);
  begin_quarn_turn(lock.c_str(), nullptr, on_turn);
  check(tell_quarn_predecessor("a", SIGUSR2), "it can be told");
  check(holder.read_told() == 'a', "it reads the line");
  check(tell_quarn_predecessor("b", SIGUSR2), "it can be told again");
  check(holder.read_told() == 'b', "each line is read once");
  holder.let_go();
  check(wait_for_quarn_turn(kDeadlineMs) || is_quarn_turn(), "the turn comes");
  check(!tell_quarn_predecessor("c", SIGUSR2), "nobody is before it any more");
  unlink(lock.c_str());
  _exit(0);
}

void go_without_a_lock() {
  begin_quarn_turn("/nowhere/at/all/lock", nullptr, on_turn);
  check(is_quarn_turn(), "it is always one's turn");
  check(!signal_quarn_predecessor(SIGUSR1), "nobody is known");
  check(!tell_quarn_predecessor("a", SIGUSR2), "nor told");
  check(take_quarn_turn_lines().empty(), "and nobody tells");
  _exit(0);
}

enum class Squat { kFile, kLink, kHardLink, kPipe, kDirectory };

/** Somebody else lies where the lock is to be, and keeps what can be kept of it. */
void take_the_turn_in_spite_of(Squat squat) {
  const TempDir folder;
  const std::string lock = folder / "lock";
  const std::string other = lock + ".other";
  const int file = open(other.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  check(file >= 0, "another's file is made");
  switch (squat) {
    case Squat::kFile:
      check(rename(other.c_str(), lock.c_str()) == 0 && chmod(lock.c_str(), 0666) == 0, "a file");
      break;
    case Squat::kLink:
      check(symlink(other.c_str(), lock.c_str()) == 0, "a link");
      break;
    case Squat::kHardLink:
      check(link(other.c_str(), lock.c_str()) == 0, "a hard link");
      break;
    case Squat::kPipe:
      check(mkfifo(lock.c_str(), 0600) == 0, "a pipe");
      break;
    case Squat::kDirectory:
      check(mkdir(lock.c_str(), 0700) == 0, "a directory");
      break;
  }
  const pid_t keeper = fork();
  if (keeper == 0) {
    struct flock whole {};
    whole.l_type = F_WRLCK;
    const int held = open(squat == Squat::kFile ? lock.c_str() : other.c_str(), O_RDWR);
    if (fcntl(held, F_SETLK, &whole) != 0) _exit(1);
    kill(getpid(), SIGSTOP);
    _exit(0);
  }
  int status = 0;
  waitpid(keeper, &status, WUNTRACED);
  check(WIFSTOPPED(status), "the other's file is locked");
  begin_quarn_turn(lock.c_str(), nullptr, on_turn);
  const bool taken = is_quarn_turn();
  struct stat made {};
  const bool ours = lstat(lock.c_str(), &made) == 0 && S_ISREG(made.st_mode) &&
                    made.st_nlink == 1 && (made.st_mode & 07777) == 0600;
  kill(keeper, SIGKILL);
  waitpid(keeper, &status, 0);
  unlink(lock.c_str());
  struct stat untouched {};
  check(fstat(file, &untouched) == 0 && untouched.st_size == 0, "nothing is written to it");
  unlink(other.c_str());
  check(taken, "nobody else can hold the daemon's lock");
  check(ours, "the lock is a file of the daemon's alone");
  _exit(0);
}

class SquatDeathTest : public ::testing::TestWithParam<Squat> {
 protected:
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_P(SquatDeathTest, NobodyElseHoldsTheTurn) {
  EXPECT_EXIT(take_the_turn_in_spite_of(GetParam()), ::testing::ExitedWithCode(0), "");
}

INSTANTIATE_TEST_SUITE_P(Things, SquatDeathTest,
                         ::testing::Values(Squat::kFile, Squat::kLink, Squat::kHardLink,
                                           Squat::kPipe, Squat::kDirectory));

class TurnDeathTest : public ::testing::Test {
 protected:
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(TurnDeathTest, IsThereWhenNobodyElseHasIt) {
  EXPECT_EXIT(take_a_free_turn(), ::testing::ExitedWithCode(0), "");
}

TEST_F(TurnDeathTest, ComesWhenTheEarlierProcessEnds) {
  EXPECT_EXIT(wait_for_the_turn(), ::testing::ExitedWithCode(0), "");
}

TEST_F(TurnDeathTest, HasLinesOfThoseWhoWaitForIt) {
  EXPECT_EXIT(leave_lines(), ::testing::ExitedWithCode(0), "");
}

TEST_F(TurnDeathTest, IsNotHadByALockThatWasRemoved) {
  EXPECT_EXIT(wait_for_a_lock_that_is_removed(), ::testing::ExitedWithCode(0), "");
}

TEST_F(TurnDeathTest, IsAlwaysThereWithoutALock) {
  EXPECT_EXIT(go_without_a_lock(), ::testing::ExitedWithCode(0), "");
}

}  // namespace
