// A point that the journal does not take is waited for within bounds, and else counted; the count
// is told on later points and at the end of the program. Mistakes are told with TESSEL_TRACE=check.

#include <dlfcn.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <iterator>
#include <string>
#include <thread>
#include <vector>

#include "TraceTest.h"

namespace {

using ::testing::AllOf;
using ::testing::Ge;
using ::testing::Le;

using TraceLosses = TraceTest;
using Clock = std::chrono::steady_clock;

uint64_t microsecondsSince1970() {
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  return static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::microseconds>(now).count());
}

int64_t milliseconds(Clock::duration duration) {
  return std::chrono::duration_cast<std::chrono::milliseconds>(duration).count();
}

// Takes entries from a journal on a thread of its own, from the start on, until it is asked to
// stop.
class Taking {
 public:
  explicit Taking(FakeJournal& journal)
      : thread_([this, &journal] {
          while (!stop_) append(journal.take());
          append(journal.take());
        }) {}
  std::vector<JournalEntry> stop() {
    stop_ = true;
    thread_.join();
    return std::move(entries_);
  }
  // The longest time, in milliseconds, in which nothing was taken; after stop().
  int64_t longestPause() const { return longestPause_; }

 private:
  void append(std::vector<JournalEntry> entries) {
    longestPause_ = std::max(longestPause_, milliseconds(Clock::now() - last_));
    last_ = Clock::now();
    for (JournalEntry& entry : entries) entries_.push_back(std::move(entry));
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  Clock::time_point last_ = Clock::now();
  int64_t longestPause_ = 0;
  std::vector<JournalEntry> entries_;
  std::atomic<bool> stop_ = false;
  std::thread thread_;
};

TEST_F(TraceLosses, EachLaterPointTellsTheTotal) {
  const tessel_point point = somePoint();
  const uint64_t before = microsecondsSince1970();
  const size_t taken = fill(3);
  const uint64_t after = microsecondsSince1970();
  const std::vector<JournalEntry> first = journal.take();
  ASSERT_EQ(first.size(), taken);
  EXPECT_EQ(first.back()["TESSEL_LOST"], JournalEntry::kNone);
  for (int i = 0; i < 2; ++i) {
    ASSERT_EQ(tessel_event(&point), 0);
    const JournalEntry entry = only();
    EXPECT_EQ(entry["TESSEL_LOST"], "3");
    EXPECT_THAT(std::stoull(entry["TESSEL_LOST_SINCE"]), AllOf(Ge(before), Le(after)));
  }
  // What the caller did wrong is no loss; what the system lacks is one.
  tessel_point wrong = point;
  wrong.category = nullptr;
  EXPECT_EQ(tessel_event(&wrong), EINVAL);
  journal.stop();
  EXPECT_NE(tessel_event(&point), 0);
  journal.start();
  EXPECT_EQ(tessel_event(&point), 0);
  EXPECT_EQ(only()["TESSEL_LOST"], "4");
}

TEST_F(TraceLosses, TheEndOfALostBeginIsLostOnce) {
  const tessel_point point = somePoint();
  journal.stop();
  tessel_interval token;
  EXPECT_EQ(tessel_interval_begin(&point, &token), ENOENT);
  {
    const tessel::trace::Interval lost(tessel::trace::Point("com.vantor.Calendar", "View", "Load"));
  }
  journal.start();
  EXPECT_EQ(tessel_interval_end(&token, &point), ENOENT);
  EXPECT_EQ(tessel_interval_end(&token, &point), ENOENT);
  EXPECT_EQ(tessel_event(&point), 0);
  EXPECT_EQ(only()["TESSEL_LOST"], "4");
}

TEST_F(TraceLosses, AForkedChildCountsForItself) {
  fill(2);
  const size_t inherited = journal.take().size();
  EXPECT_GT(inherited, 0u);
  const pid_t child = fork();
  if (child == 0) {
    const tessel_point point = somePoint();
    int failed = tessel_event(&point);  // tells nothing of the parent's
    fill(5);
    _exit(failed);
  }
  int status = -1;
  waitpid(child, &status, 0);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(journal.take().front()["TESSEL_LOST"], JournalEntry::kNone);
  const tessel_point point = somePoint();
  EXPECT_EQ(tessel_event(&point), 0);
  EXPECT_EQ(only()["TESSEL_LOST"], "2");
}

TEST_F(TraceLosses, ThreadsCountEachLossOnce) {
  constexpr int kThreads = 8;
  constexpr int kEach = 500;
  std::atomic<uint64_t> lost = 0;
  std::vector<std::thread> threads;
  threads.reserve(kThreads);
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([&lost] {
      tessel_point point = somePoint();
      point.no_wait = true;
      for (int n = 0; n < kEach; ++n) lost += tessel_event(&point) != 0;
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(journal.take().size() + lost, size_t{kThreads} * kEach);
  ASSERT_GT(lost, 0u);
  const tessel_point point = somePoint();
  EXPECT_EQ(tessel_event(&point), 0);
  EXPECT_EQ(only()["TESSEL_LOST"], std::to_string(lost));
}

TEST_F(TraceLosses, TheTotalStopsAtTheGreatestNumber) {
  const uint64_t most = (uint64_t{1} << TESSEL_COUNT_BITS_) - 1;
  fill(1);
  tessel_state_v2_.lost += most - 2;
  for (int i = 0; i < 3; ++i) tessel_count_lost_();
  journal.take();
  const tessel_point point = somePoint();
  EXPECT_EQ(tessel_event(&point), 0);
  EXPECT_EQ(only()["TESSEL_LOST"], std::to_string(most));
}

// A call waits 20 ms. On a busy machine the journal may pause longer; then another burst shows the
// rule.
TEST_F(TraceLosses, ABurstWaitsForAJournalThatTakesPoints) {
  const tessel_point point = somePoint();
  for (int64_t pause = 20, bursts = 0; pause >= 10; ++bursts) {
    ASSERT_LT(bursts, 200);
    Taking taking(journal);
    size_t failed = 0;
    for (int i = 0; i < 3000; ++i) failed += tessel_event(&point) != 0;
    EXPECT_EQ(taking.stop().size() + failed, 3000u);
    pause = taking.longestPause();
    EXPECT_TRUE(failed == 0 || pause >= 10) << failed;
  }
}

size_t openDescriptors() {
  const std::filesystem::directory_iterator all("/proc/self/fd");
  return static_cast<size_t>(std::distance(begin(all), end(all)));
}

// Each of these travels in a memory file, which must be closed whatever becomes of the point.
TEST_F(TraceLosses, LargePointsLeaveNoDescriptor) {
  const std::string text(4000, 'x');
  const std::string tooLong(TESSEL_VALUE_MAX + 1, 'x');
  std::vector<tessel_attribute> attributes(8, {"Filler", text.c_str()});
  tessel_point point = somePoint();
  point.attributes = attributes.data();
  point.attribute_count = attributes.size();
  point.no_wait = true;
  ASSERT_EQ(tessel_event(&point), 0);
  EXPECT_TRUE(only().wasFile);
  const size_t before = openDescriptors();
  for (int i = 0; i < 1000; ++i) tessel_event(&point);  // more than the socket takes
  EXPECT_EQ(tessel_event(&point), EAGAIN);
  attributes.back().value = tooLong.c_str();
  EXPECT_EQ(tessel_event(&point), EMSGSIZE);
  journal.stop();
  attributes.back().value = text.c_str();
  EXPECT_EQ(tessel_event(&point), ENOENT);
  EXPECT_LE(openDescriptors(), before);
  journal.start();
}

// The times are bounds of the rule with room for a busy machine: 20 ms once, and then a thousandth.
TEST_F(TraceLosses, AJournalThatTakesNothingStopsNobody) {
  tessel_point point = somePoint();
  fill();
  auto start = Clock::now();
  EXPECT_EQ(tessel_event(&point), EAGAIN);
  EXPECT_THAT(milliseconds(Clock::now() - start), AllOf(Ge(19), Le(500)));
  start = Clock::now();
  for (int i = 0; i < 1000; ++i) EXPECT_EQ(tessel_event(&point), EAGAIN);
  EXPECT_LT(milliseconds(Clock::now() - start), 500) << "a wait for each would take 20 s";
  tessel_state_v2_.stuck -= 5'000'000'000;  // five seconds later
  start = Clock::now();
  EXPECT_EQ(tessel_event(&point), EAGAIN);
  EXPECT_GE(milliseconds(Clock::now() - start), 4);
  journal.take();
  EXPECT_EQ(tessel_event(&point), 0);
  fill();
  start = Clock::now();
  EXPECT_EQ(tessel_event(&point), EAGAIN);
  EXPECT_GE(milliseconds(Clock::now() - start), 19) << "it took points again";
}

// A library counts for itself, tells it when it is unloaded, and leaves no descriptor behind.
TEST_F(TraceLosses, AnUnloadedLibraryTellsItsLosses) {
  fill();
  for (int round = 0; round < 2; ++round) {
    void* const library = dlopen(TRACE_PLUGIN, RTLD_NOW | RTLD_LOCAL);
    ASSERT_NE(library, nullptr) << dlerror();
    auto* const record = reinterpret_cast<int (*)()>(dlsym(library, "record_from_second_unit"));
    ASSERT_NE(record, nullptr);
    EXPECT_EQ(record(), EAGAIN);
    EXPECT_EQ(traceSockets().size(), 2u);
    journal.take();
    EXPECT_EQ(dlclose(library), 0);
    const JournalEntry last = only();
    EXPECT_EQ(last["TESSEL_LOST"], "1");
    EXPECT_EQ(last["TESSEL_KIND"], JournalEntry::kNone);
    EXPECT_EQ(last.fields.size(), 3u);
    EXPECT_EQ(traceSockets().size(), 1u);
    fill();
  }
}

// Runs `command` while the journal takes points, after a while in which it takes none.
std::vector<JournalEntry> entriesOf(FakeJournal& journal, const std::string& command) {
  std::thread program([&command] { EXPECT_EQ(std::system(command.c_str()), 0); });
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  Taking taking(journal);
  program.join();
  return taking.stop();
}

TEST_F(TraceLosses, AProgramTellsAtItsEndWhatItLost) {
  const std::string burst = std::string(TRACE_BURST) + " 5000";
  for (const std::string& command :
       {"TESSEL_TRACE_WAIT=0 " + burst + " > /dev/null", burst + " no_wait > /dev/null"}) {
    std::vector<JournalEntry> entries = entriesOf(journal, command);
    ASSERT_FALSE(entries.empty());
    const JournalEntry last = entries.back();
    EXPECT_EQ(last["TESSEL_KIND"], JournalEntry::kNone) << "5,000 do not fit, nor do the last two";
    EXPECT_EQ(entries.size() - 1 + std::stoul(last["TESSEL_LOST"]), 5002u);
  }
  // No losses, no entry; and nothing is told of what was off.
  EXPECT_EQ(entriesOf(journal, std::string(TRACE_BURST) + " 10 > /dev/null").size(), 12u);
  journal.stop();
  ASSERT_EQ(std::system(("TESSEL_TRACE=0 " + burst + " > /dev/null").c_str()), 0);
  journal.start();
  EXPECT_TRUE(journal.take().empty());
}

class TraceCheck : public TraceTest {
 protected:
  void SetUp() override {
    TraceTest::SetUp();
    setenv("TESSEL_TRACE", "check", 1);
    tessel_enable(true);
  }
  void TearDown() override {
    unsetenv("TESSEL_TRACE");
    tessel_enable(true);
  }
};

TEST_F(TraceCheck, EachPlaceTellsItsMistakeOnce) {
  const std::string tooLong(TESSEL_VALUE_MAX + 1, 'x');
  const tessel_attribute twice[] = {{"View", "month"}, {"View", "week"}};
  tessel_point point = somePoint();
  point.string1.label = "period";
  tessel_interval token;
  ::testing::internal::CaptureStderr();
  constexpr int kLine = __LINE__;
  for (int i = 0; i < 3; ++i) tessel_event(&point);
  tessel_event(&point);
  point.string1 = {"period", tooLong.c_str()};
  tessel_event(&point);
  point.string1 = {"period", "\xc3"};
  point.attributes = twice;
  point.attribute_count = 2;
  point.interval_id = "1";
  tessel_event(&point);
  tessel_interval_begin(&point, &token);
  tessel_interval_end(&token, &point);
  tessel_interval_end(&token, &point);
  tessel::trace::event(tessel::trace::Point("", "View", "Open"));
  const size_t recorded = journal.take().size();
  journal.stop();
  tessel_event(&point);
  journal.start();
  const std::string told = ::testing::internal::GetCapturedStderr();
  const auto at = [](int further, const std::string& what) {
    return "tessel: trace_losses_test.cpp:" + std::to_string(kLine + further) + ": " + what + "\n";
  };
  EXPECT_EQ(told, at(1, "refused: string1 has a label and no value") +
                      at(2, "refused: string1 has a label and no value") +
                      at(4, "refused: TESSEL_STRING1_VALUE has 4097 bytes, the limit is 4096") +
                      at(9, "dropped: an event has no interval_id") +
                      at(9, "changed: TESSEL_STRING1_VALUE is not UTF-8") +
                      at(9, "dropped: two attributes have one key") +
                      at(10, "changed: TESSEL_STRING1_VALUE is not UTF-8") +
                      at(10, "dropped: two attributes have one key") +
                      at(11, "changed: TESSEL_STRING1_VALUE is not UTF-8") +
                      at(11, "dropped: two attributes have one key") +
                      at(12, "refused: the interval is not open") +
                      at(13, "refused: the subsystem is missing") +
                      at(16, "lost: no journal is running") +
                      at(16, "dropped: an event has no interval_id") +
                      at(16, "changed: TESSEL_STRING1_VALUE is not UTF-8") +
                      at(16, "dropped: two attributes have one key"));
  EXPECT_EQ(recorded, 3u) << "what is not refused is recorded all the same";
}

}  // namespace
