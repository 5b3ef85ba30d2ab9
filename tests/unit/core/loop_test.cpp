#include "quarn_d_loop.h"

#include <Ecore.h>
#include <alloca.h>
#include <fcntl.h>
#include <glib-unix.h>
#include <glib.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/select.h>
#include <unistd.h>

#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "glib_handles.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/nested_loop.h"
#include "run_until.h"
#include "this_process.h"

namespace {

constexpr double kShort = 0.02;
constexpr int kDeadlineSeconds = 10;

using Step = std::function<void()>;

gboolean run_step(gpointer data) {
  (*static_cast<Step *>(data))();
  return G_SOURCE_REMOVE;
}

void delete_step(gpointer data) { delete static_cast<Step *>(data); }

/** Run @p step once on the default context. */
void on_main_loop(Step step, unsigned int after_ms = 0) {
  g_timeout_add_full(G_PRIORITY_DEFAULT, after_ms, run_step, new Step(std::move(step)),
                     delete_step);
}

unsigned char quit_loop(void *fired) {
  ++*static_cast<int *>(fired);
  quarn_loop_quit();
  return 0;
}

gboolean too_late(gpointer) {
  ADD_FAILURE() << "the loop was not quit";
  quarn_loop_quit();
  return G_SOURCE_REMOVE;
}

class Loop : public ::testing::Test {
 protected:
  void SetUp() override { quarn_loop_init(); }
  void TearDown() override { quarn_loop_shutdown(); }

  static void run() {
    const guint deadline = g_timeout_add_seconds(kDeadlineSeconds, too_late, nullptr);
    quarn_loop_begin();
    g_source_remove(deadline);
  }
};

// What a request uses before it waits, and what it may keep then. The sanitizers keep books on
// every byte that was used, and give nothing back.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr std::size_t kBytesBefore = 16384;
constexpr std::size_t kBytesOfWaiting = 2097152;
#else
constexpr std::size_t kBytesBefore = 131072;
constexpr std::size_t kBytesOfWaiting = 12288;
#endif

/** Memory of this process that is in use. */
/** Write to that much of the stack. */
void use_stack(std::size_t bytes) {
  auto *const used = static_cast<volatile char *>(alloca(bytes));
  for (std::size_t i = 0; i < bytes; i += 512) used[i] = 1;
}

TEST_F(Loop, RunsTimersOfBothLoops) {
  bool glib_fired = false;
  int ecore_fired = 0;
  on_main_loop([&] { glib_fired = true; }, 1);
  ASSERT_NE(quarn_loop_timer_add(kShort, quit_loop, &ecore_fired), nullptr);
  run();
  EXPECT_TRUE(glib_fired);
  EXPECT_EQ(ecore_fired, 1);
}

TEST_F(Loop, DeletedTimerDoesNotFire) {
  int deleted = 0;
  int fired = 0;
  void *timer = quarn_loop_timer_add(kShort / 2, quit_loop, &deleted);
  quarn_loop_timer_add(kShort, quit_loop, &fired);
  quarn_loop_timer_del(timer);
  run();
  EXPECT_EQ(deleted, 0);
  EXPECT_EQ(fired, 1);
}

TEST_F(Loop, EcoreTimerAddedByAGLibSourceFires) {
  int fired = 0;
  on_main_loop([&] { quarn_loop_timer_add(kShort, quit_loop, &fired); });
  run();
  EXPECT_EQ(fired, 1);
}

TEST_F(Loop, QuitFromAGLibSourceEndsTheLoopWithoutAFurtherWait) {
  on_main_loop([] { quarn_loop_quit(); });
  run();
}

TEST_F(Loop, QuitBeforeAnyEventEndsTheNextRunOnly) {
  on_main_loop([] { quarn_loop_quit(); });
  run();
  bool again = false;
  on_main_loop([&] {
    again = true;
    quarn_loop_quit();
  });
  run();
  EXPECT_TRUE(again);
}

TEST_F(Loop, SourceOfAnotherThreadWakesTheWaitingLoop) {
  std::thread::id ran_on;
  std::thread other([&] {
    on_main_loop([&] {
      ran_on = std::this_thread::get_id();
      quarn_loop_quit();
    });
  });
  run();
  other.join();
  EXPECT_EQ(ran_on, std::this_thread::get_id());
}

TEST_F(Loop, OwnsTheDefaultContextForItsWholeLife) {
  EXPECT_TRUE(g_main_context_is_owner(nullptr));
  bool stolen = true;
  std::thread([&] { stolen = g_main_context_acquire(nullptr) != FALSE; }).join();
  EXPECT_FALSE(stolen);
  quarn_loop_shutdown();
  EXPECT_FALSE(g_main_context_is_owner(nullptr));
}

TEST_F(Loop, KeepsEcoreFromLoadingSystemModules) {
  EXPECT_STREQ(getenv("ECORE_NO_SYSTEM_MODULES"), "1");
}

Eina_Bool on_readable(void *data, Ecore_Fd_Handler *handler) {
  char byte = 0;
  *static_cast<int *>(data) +=
      static_cast<int>(read(ecore_main_fd_handler_fd_get(handler), &byte, sizeof byte));
  quarn_loop_quit();
  return ECORE_CALLBACK_CANCEL;
}

TEST_F(Loop, ServesEcoresOwnDescriptors) {
  int ends[2];
  ASSERT_EQ(pipe2(ends, O_CLOEXEC), 0);
  const UniqueFd reader(ends[0]);
  const UniqueFd writer(ends[1]);
  int bytes = 0;
  ecore_main_fd_handler_add(reader.get(), ECORE_FD_READ, on_readable, &bytes, nullptr, nullptr);
  on_main_loop([&] { ASSERT_EQ(write(writer.get(), "x", 1), 1); });
  run();
  EXPECT_EQ(bytes, 1);
}

gboolean on_far_descriptor(gint fd, GIOCondition, gpointer data) {
  char byte = 0;
  *static_cast<int *>(data) += static_cast<int>(read(fd, &byte, sizeof byte));
  quarn_loop_quit();
  return G_SOURCE_REMOVE;
}

TEST_F(Loop, ServesADescriptorThatNoFdSetHolds) {
  constexpr int kFar = FD_SETSIZE + 100;
  rlimit limit{};
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
  const rlimit before = limit;
  limit.rlim_cur = std::max<rlim_t>(limit.rlim_cur, kFar + 1);
  limit.rlim_max = std::max(limit.rlim_max, limit.rlim_cur);
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &limit), 0);
  int ends[2];
  ASSERT_EQ(pipe2(ends, O_CLOEXEC), 0);
  const UniqueFd reader(ends[0]);
  const UniqueFd writer(ends[1]);
  const UniqueFd far(fcntl(reader.get(), F_DUPFD_CLOEXEC, kFar));
  ASSERT_GE(far.get(), kFar);
  int bytes = 0;
  g_unix_fd_add(far.get(), G_IO_IN, on_far_descriptor, &bytes);
  on_main_loop([&] { ASSERT_EQ(write(writer.get(), "x", 1), 1); });
  run();
  EXPECT_EQ(bytes, 1);
  setrlimit(RLIMIT_NOFILE, &before);
}

TEST_F(Loop, DispatchedSourceMayWaitOnTheThreadsOwnStack) {
  std::vector<int> order;
  const GMainLoopPtr mark(new_wait_loop());
  on_main_loop([&] {
    order.push_back(1);
    run_nested_loop(mark.get());
    order.push_back(3);
    quarn_loop_quit();
  });
  on_main_loop(
      [&] {
        order.push_back(2);
        g_main_loop_quit(mark.get());
      },
      10);
  run();
  EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));
}

/** Wait on a fiber of its own, and say so when the wait is over. */
void wait_on_fiber_for(GMainLoop *mark, Step then) {
  run_on_fiber([mark, then = std::move(then)] {
    run_nested_loop(mark);
    then();
  });
}

TEST_F(Loop, EcoresTimersRunWhileARequestWaits) {
  const GMainLoopPtr mark(new_wait_loop());
  int fired = 0;
  bool answered = false;
  on_main_loop([&] {
    wait_on_fiber_for(mark.get(), [&] {
      answered = true;
      quarn_loop_quit();
    });
    quarn_loop_timer_add(
        kShort,
        [](void *data) -> unsigned char {
          ++*static_cast<int *>(data);
          return 0;
        },
        &fired);
  });
  struct Watched {
    int *fired;
    GMainLoop *mark;
  } watched{&fired, mark.get()};
  // quit by nothing but the timer's having run
  g_timeout_add(
      1,
      [](gpointer data) -> gboolean {
        const auto *both = static_cast<Watched *>(data);
        if (*both->fired == 0) return G_SOURCE_CONTINUE;
        g_main_loop_quit(both->mark);
        return G_SOURCE_REMOVE;
      },
      &watched);
  run();
  EXPECT_EQ(fired, 1);
  EXPECT_TRUE(answered);
}

TEST_F(Loop, EachRequestIsAnsweredWhenItsOwnEventComes) {
  constexpr std::size_t kRequests = 5;
  std::vector<std::size_t> order;
  std::vector<GMainLoopPtr> marks;
  for (std::size_t i = 0; i < kRequests; ++i) marks.emplace_back(new_wait_loop());
  const auto wait_for = [&](std::size_t i) {
    wait_on_fiber_for(marks[i].get(), [&order, i] {
      order.push_back(i);
      if (order.size() == kRequests) quarn_loop_quit();
    });
  };
  on_main_loop([&] {
    for (std::size_t i = 0; i < kRequests; ++i) wait_for(i);
  });
  const std::vector<std::size_t> events{2, 0, 4, 1, 3};
  std::size_t next = 0;
  Step event = [&] {
    g_main_loop_quit(marks[events[next]].get());
    if (++next < kRequests) on_main_loop(event, 1);
  };
  on_main_loop(event, 1);
  run();
  EXPECT_EQ(order, events);
}

TEST_F(Loop, WhatIsQuitTogetherGoesOnInTheOrderOfItsWaiting) {
  std::vector<int> order;
  const GMainLoopPtr first(new_wait_loop());
  const GMainLoopPtr second(new_wait_loop());
  on_main_loop([&] {
    wait_on_fiber_for(first.get(), [&] { order.push_back(1); });
    wait_on_fiber_for(second.get(), [&] {
      order.push_back(2);
      quarn_loop_quit();
    });
    g_main_loop_quit(second.get());
    g_main_loop_quit(first.get());
  });
  run();
  EXPECT_EQ(order, (std::vector<int>{1, 2}));
}

TEST_F(Loop, AnEventThatComesBeforeTheWaitIsNotLost) {
  std::vector<std::string> over;
  on_main_loop([&] {
    const GMainLoopPtr mark(new_wait_loop());
    g_main_loop_quit(mark.get());
    run_nested_loop(mark.get());
    over.emplace_back("own stack");
    run_on_fiber([&] {
      run_nested_loop(mark.get());
      over.emplace_back("fiber");
    });
    quarn_loop_quit();
  });
  run();
  EXPECT_EQ(over, (std::vector<std::string>{"own stack", "fiber"}));
}

TEST_F(Loop, AnotherThreadEndsAWaitWheneverItQuits) {
  constexpr int kRounds = 300;
  int over = 0;
  Step round = [&] {
    run_on_fiber([&] {
      const GMainLoopPtr mark(new_wait_loop());
      std::thread other([&] { g_main_loop_quit(mark.get()); });
      run_nested_loop(mark.get());
      other.join();
      if (++over == kRounds) {
        quarn_loop_quit();
      } else {
        on_main_loop(round);
      }
    });
  };
  on_main_loop(round);
  run();
  EXPECT_EQ(over, kRounds);
}

TEST_F(Loop, AWithdrawnRequestWaitsNoLongerAndNeverAgain) {
  const GMainLoopPtr mark(new_wait_loop());
  const GMainLoopPtr other(new_wait_loop());
  std::uint64_t number = 0;
  int over = 0;
  bool other_over = false;
  on_main_loop([&] {
    wait_on_fiber_for(other.get(), [&] { other_over = true; });
    run_on_fiber([&] {
      number = fiber_id(current_fiber());
      EXPECT_FALSE(waits_are_ended());
      run_nested_loop(mark.get());
      EXPECT_TRUE(waits_are_ended());
      EXPECT_NE(g_main_loop_is_running(mark.get()), FALSE) << "it was not answered";
      ++over;
      run_nested_loop(mark.get());
      ++over;
      quarn_loop_quit();
    });
    EXPECT_EQ(over, 0);
    EXPECT_TRUE(withdraw_waits(number));
    EXPECT_FALSE(withdraw_waits(number)) << "once";
  });
  run();
  EXPECT_EQ(over, 2);
  EXPECT_FALSE(other_over);
  EXPECT_FALSE(waits_are_ended());
  g_main_loop_quit(other.get());
  ASSERT_TRUE(run_until([&] { return other_over; }));
}

TEST_F(Loop, WhatIsAnsweredAlreadyIsNotWithdrawn) {
  const GMainLoopPtr mark(new_wait_loop());
  std::uint64_t number = 0;
  bool over = false;
  on_main_loop([&] {
    run_on_fiber([&] {
      number = fiber_id(current_fiber());
      run_nested_loop(mark.get());
      EXPECT_FALSE(waits_are_ended());
      over = true;
      quarn_loop_quit();
    });
    g_main_loop_quit(mark.get());
    EXPECT_FALSE(withdraw_waits(number));
    EXPECT_FALSE(withdraw_waits(0));
  });
  run();
  EXPECT_TRUE(over);
  EXPECT_FALSE(withdraw_waits(number)) << "long gone";
}

TEST_F(Loop, FiveHundredWaitingRequestsTakeLittleMemory) {
  constexpr std::size_t kRequests = 512;
  const std::size_t before = resident_bytes();
  const GMainLoopPtr mark(new_wait_loop());
  std::size_t over = 0;
  on_main_loop([&] {
    for (std::size_t i = 0; i < kRequests; ++i) {
      run_on_fiber([&] {
        use_stack(kBytesBefore);  // what went before the wait is given back
        run_nested_loop(mark.get());
        ++over;
      });
    }
    EXPECT_LT(resident_bytes() - before, kRequests * kBytesOfWaiting);
    g_main_loop_quit(mark.get());
    on_main_loop([] { quarn_loop_quit(); }, 1);
  });
  run();
  EXPECT_EQ(over, kRequests);
}

struct CountingSource {
  GSource source;
  int prepared;
};

gboolean count_prepare(GSource *source, gint *timeout) {
  ++reinterpret_cast<CountingSource *>(source)->prepared;
  *timeout = -1;
  return FALSE;
}

gboolean never_ready(GSource *) { return FALSE; }
gboolean never_dispatched(GSource *, GSourceFunc, gpointer) { return G_SOURCE_CONTINUE; }

TEST_F(Loop, DoesNotWakeWhileIdle) {
  static GSourceFuncs functions{count_prepare, never_ready, never_dispatched,
                                nullptr,       nullptr,     nullptr};
  GSource *source = g_source_new(&functions, sizeof(CountingSource));
  auto *counting = reinterpret_cast<CountingSource *>(source);
  counting->prepared = 0;
  g_source_attach(source, nullptr);
  int fired = 0;
  quarn_loop_timer_add(0.3, quit_loop, &fired);
  run();
  EXPECT_EQ(fired, 1);
  EXPECT_GE(counting->prepared, 1);
  EXPECT_LE(counting->prepared, 10);
  g_source_destroy(source);
  g_source_unref(source);
}

TEST_F(Loop, ShutdownInsideTheLoopWaitsForItsEnd) {
  bool alive_after_request = false;
  on_main_loop([&] {
    quarn_loop_shutdown();
    alive_after_request = g_main_context_is_owner(nullptr) != FALSE;
    quarn_loop_quit();
  });
  const guint deadline = g_timeout_add_seconds(kDeadlineSeconds, too_late, nullptr);
  quarn_loop_begin();
  EXPECT_TRUE(alive_after_request);
  EXPECT_FALSE(g_main_context_is_owner(nullptr));
  g_source_remove(deadline);
}

TEST_F(Loop, InitTwiceIsShutDownOnce) {
  quarn_loop_init();
  quarn_loop_shutdown();
  EXPECT_FALSE(g_main_context_is_owner(nullptr));
}

TEST(LoopShutdown, IsHarmlessWhenNothingWasInitialised) {
  quarn_loop_shutdown();
  EXPECT_FALSE(g_main_context_is_owner(nullptr));
}

TEST(LoopInit, PrintsNothing) {
  ::testing::internal::CaptureStderr();
  quarn_loop_init();
  quarn_loop_shutdown();
  EXPECT_EQ(::testing::internal::GetCapturedStderr(), "");
}

/* ---- nested loops at the end of the process ---- */

void end_nested_loops() {
  quarn_loop_init();
  const GMainLoopPtr outer(new_wait_loop());
  const GMainLoopPtr inner(new_wait_loop());
  on_main_loop([&] {
    on_main_loop([&] {
      on_main_loop([] { quit_nested_loops(); });
      run_nested_loop(inner.get());
      std::fputs("inner ", stderr);
    });
    run_nested_loop(outer.get());
    std::fputs("outer ", stderr);
    run_nested_loop(outer.get());
    std::fputs("refused", stderr);
    quarn_loop_quit();
  });
  quarn_loop_begin();
  quarn_loop_shutdown();
  std::_Exit(3);
}

void end_waiting_fibers() {
  quarn_loop_init();
  const GMainLoopPtr mark(new_wait_loop());
  on_main_loop([&] {
    for (const char *name : {"first ", "second "}) {
      run_on_fiber([&mark, name] {
        run_nested_loop(mark.get());
        std::fputs(name, stderr);
        run_nested_loop(mark.get());
        std::fputs("refused ", stderr);
      });
    }
    quit_nested_loops();
    std::fputs("nobody waits", stderr);
    quarn_loop_quit();
  });
  quarn_loop_begin();
  quarn_loop_shutdown();
  std::_Exit(3);
}

TEST(QuitNestedLoopsDeathTest, EndsTheLongestWaitFirstAndReturnsWhenNobodyWaits) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(end_waiting_fibers(), ::testing::ExitedWithCode(3),
              "first refused second refused nobody waits");
}

TEST(QuitNestedLoopsDeathTest, EndsTheInnermostFirstAndRefusesFurtherOnes) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(end_nested_loops(), ::testing::ExitedWithCode(3), "inner outer refused");
}

/* ---- signals; each in a process of its own ---- */

int take_signal(int signo) {
  std::fprintf(stderr, "signal %d;", signo);
  return 0;
}

void begin_end() { std::fputs("begin;", stderr); }
void last() { std::fputs("last;", stderr); }

bool watch_signals(void (*end)(int), int grace_ms, int (*take)(int) = take_signal) {
  return quarn_loop_watch_signals({take, begin_end, end, last, grace_ms});
}

void end_of(int signo) {
  std::fprintf(stderr, "end %d on %s;", signo,
               g_main_context_is_owner(nullptr) != FALSE ? "main" : "another thread");
  quarn_loop_quit();
}

void end_never(int) { std::fputs("ended", stderr); }

void run_until_signal(int signo) {
  quarn_loop_init();
  if (!watch_signals(end_of, kDeadlineSeconds * 1000)) std::_Exit(1);
  std::signal(signo, quarn_loop_wake_from_signal);
  on_main_loop([signo] { raise(signo); });
  quarn_loop_begin();
  quarn_loop_shutdown();
  std::_Exit(4);
}

void end_with_nested_loops(int) {
  quit_nested_loops();
  quarn_loop_quit();
}

void signal_inside_a_nested_loop() {
  quarn_loop_init();
  if (!watch_signals(end_with_nested_loops, kDeadlineSeconds * 1000)) {
    std::_Exit(1);
  }
  std::signal(SIGTERM, quarn_loop_wake_from_signal);
  const GMainLoopPtr nested(new_wait_loop());
  on_main_loop([&] {
    on_main_loop([] { raise(SIGTERM); });
    run_nested_loop(nested.get());
    std::fputs("unwound", stderr);
  });
  quarn_loop_begin();
  quarn_loop_shutdown();
  std::_Exit(4);
}

void block_under_signal() {
  quarn_loop_init();
  if (!watch_signals(end_never, 100)) std::_Exit(1);
  std::signal(SIGTERM, quarn_loop_wake_from_signal);
  raise(SIGTERM);
  while (true) pause();
}

class SignalDeathTest : public ::testing::TestWithParam<int> {
 protected:
  void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_P(SignalDeathTest, IsLoggedAndEndsOnTheMainThread) {
  const int signo = GetParam();
  const std::string number = std::to_string(signo);
  EXPECT_EXIT(run_until_signal(signo), ::testing::ExitedWithCode(4),
              "signal " + number + ";begin;end " + number + " on main;");
}

INSTANTIATE_TEST_SUITE_P(All, SignalDeathTest, ::testing::Values(SIGINT, SIGHUP, SIGTERM, SIGQUIT));

TEST(NestedLoopDeathTest, IsLeftUnderASignal) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(signal_inside_a_nested_loop(), ::testing::ExitedWithCode(4),
              "signal 15;begin;unwound");
}

TEST(BlockedMainThreadDeathTest, EndsWithStatusZeroAfterTheGracePeriod) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(block_under_signal(), ::testing::ExitedWithCode(0), "signal 15;begin;last;$");
}

int ignore_usr1(int signo) {
  std::fprintf(stderr, "signal %d;", signo);
  if (signo == SIGUSR1) on_main_loop([] { raise(SIGTERM); });
  return signo == SIGUSR1 ? -1 : 0;
}

int put_off_term(int signo) {
  std::fprintf(stderr, "signal %d;", signo);
  return signo == SIGTERM ? 50 : 0;
}

int put_off_term_for_long(int signo) {
  std::fprintf(stderr, "signal %d;", signo);
  if (signo == SIGTERM) on_main_loop([] { raise(SIGINT); });
  return signo == SIGTERM ? kDeadlineSeconds * 1000 : 0;
}

void run_until_end_by(int signo, int (*take)(int)) {
  quarn_loop_init();
  if (!watch_signals(end_of, kDeadlineSeconds * 1000, take)) std::_Exit(1);
  for (const int watched : {SIGINT, SIGTERM, SIGUSR1}) {
    std::signal(watched, quarn_loop_wake_from_signal);
  }
  on_main_loop([signo] { raise(signo); });
  quarn_loop_begin();
  quarn_loop_shutdown();
  std::_Exit(4);
}

TEST(SignalThatIsNoEndDeathTest, IsTakenAndTheNextOneEndsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(run_until_end_by(SIGUSR1, ignore_usr1), ::testing::ExitedWithCode(4),
              "signal 10;signal 15;begin;end 15 on main;");
}

TEST(SignalThatIsPutOffDeathTest, EndsTheProcessWhenItsTimeIsOver) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(run_until_end_by(SIGTERM, put_off_term), ::testing::ExitedWithCode(4),
              "signal 15;begin;end 15 on main;");
}

TEST(SignalThatIsPutOffDeathTest, IsOvertakenByAnother) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(run_until_end_by(SIGTERM, put_off_term_for_long), ::testing::ExitedWithCode(4),
              "signal 15;signal 2;begin;end 2 on main;");
}

void exhaust_descriptors_and_watch() {
  const rlimit none{0, 0};
  setrlimit(RLIMIT_NOFILE, &none);
  const bool watched = watch_signals(end_of, 1);
  quarn_loop_wake_from_signal(SIGTERM);
  std::_Exit(watched ? 1 : 5);
}

TEST(WatchSignalsDeathTest, IsRefusedWithoutDescriptors) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(exhaust_descriptors_and_watch(), ::testing::ExitedWithCode(5), "");
}

}  // namespace
