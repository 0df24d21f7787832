// When a run is due, and what the scheduler delivers.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <stdexcept>
#include <thread>

#include "linux/Scheduler.h"
#include "os/testing/TemporaryDirectory.h"
#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

using testing::TemporaryDirectory;

using std::chrono::hours;
using std::chrono::nanoseconds;
using std::chrono::seconds;
using ::testing::ElementsAre;
using testing::FakeClock;
using testing::FakeServiceStatus;

const Date kNoon{seconds{1'795'000'000}};

TEST(WaitForRunTest, NoWaitExceedsTheInterval) {
  const struct {
    const char* what;
    std::optional<Date> lastRun;
    nanoseconds waited;
    nanoseconds expected;
  } kCases[] = {
      {"never run", {}, seconds{0}, seconds{0}},
      {"just run", kNoon, seconds{0}, hours{24}},
      {"half way", kNoon - hours{12}, seconds{0}, hours{12}},
      {"a microsecond early", kNoon - hours{24} + std::chrono::microseconds{1}, seconds{0},
       std::chrono::microseconds{1}},
      {"due", kNoon - hours{24}, seconds{0}, seconds{0}},
      {"a record of nonsense", Date{std::chrono::microseconds::max()}, seconds{0}, hours{24}},
      {"long due", Date{}, seconds{0}, seconds{0}},
      {"clock set back before the wait", kNoon + hours{24 * 365}, seconds{0}, hours{24}},
      {"clock set back, some waited", kNoon + hours{24 * 365}, hours{20}, hours{4}},
      {"clock set back, all waited", kNoon + hours{24 * 365}, hours{25}, seconds{0}},
      {"clock set back a little during the wait", kNoon - hours{1}, hours{22}, hours{2}},
  };
  for (const auto& [what, lastRun, waited, expected] : kCases) {
    EXPECT_EQ(waitForRun(lastRun, kNoon, hours{24}, waited), expected) << what;
  }
}

class StateDirectoryTest : public ::testing::Test {
 protected:
  static StateDirectory opened(const std::string& path) {
    auto result = StateDirectory::open(path);
    if (const auto* error = std::get_if<PlatformError>(&result))
      throw std::runtime_error(error->words);
    return std::get<StateDirectory>(result);
  }

  TemporaryDirectory temporary_;
  StateDirectory state_ = opened(temporary_.path("deep/state"));
};

TEST_F(StateDirectoryTest, IsMadeForOwnerAndGroup) {
  struct stat facts {};
  ASSERT_EQ(::stat(state_.path().c_str(), &facts), 0);
  EXPECT_EQ(facts.st_mode & 07777 & ~0750u, 0u);
  ASSERT_EQ(::stat(opened(temporary_.path("slashed//")).path().c_str(), &facts), 0);
  EXPECT_EQ(facts.st_mode & 07777 & ~0750u, 0u);
  state_.recordRun(kNoon);
  EXPECT_EQ(opened(state_.path() + "/").lastRun(), kNoon);
}

TEST_F(StateDirectoryTest, AnUnusableOneHasItsReason) {
  const auto errorOf = [](const std::string& path) {
    const auto result = StateDirectory::open(path);
    const auto* error = std::get_if<PlatformError>(&result);
    return error ? error->words : "opened";
  };
  const std::string file = temporary_.write("file", "");
  EXPECT_EQ(errorOf(file), "state directory " + file + ": Not a directory");
  EXPECT_EQ(errorOf(file + "/state"), "state directory " + file + "/state: Not a directory");
  EXPECT_EQ(errorOf("/proc/tessel"), "state directory /proc/tessel: No such file or directory");
}

TEST_F(StateDirectoryTest, OnlyFilesOfItsOwnerAreBelieved) {
  const std::string record = temporary_.path("deep/state/scheduler-last-run");
  const auto isRefusedWith = [&](const std::string& words) {
    const auto refused = state_.refusedFiles();
    EXPECT_EQ(state_.lastRun(), std::nullopt);
    EXPECT_FALSE(state_.recordRun(kNoon)) << "the next write heals it";
    const bool healed = state_.lastRun() == kNoon && state_.refusedFiles().empty();
    std::filesystem::remove(record);
    return healed && refused.size() == 1 && refused[0].words.starts_with(record + ": " + words);
  };
  temporary_.write("forged", "1795000000000000\n");
  std::filesystem::create_symlink(temporary_.path("forged"), record);
  EXPECT_TRUE(isRefusedWith("it is no regular file"));
  for (const char* name : {"", ".new"}) ASSERT_EQ(::mkfifo((record + name).c_str(), 0666), 0);
  EXPECT_TRUE(isRefusedWith("it is no regular file"));
  ASSERT_EQ(::mknod(record.c_str(), S_IFSOCK | 0666, 0), 0);
  EXPECT_TRUE(isRefusedWith("it is no regular file"));
  temporary_.write("deep/state/scheduler-last-run", std::string(65, '1'));
  EXPECT_TRUE(isRefusedWith("File too large"));
  std::filesystem::create_directories(record + ".new/full");
  EXPECT_TRUE(state_.recordRun(kNoon));
}

TEST_F(StateDirectoryTest, OneHolderOfTheLockAtATime) {
  std::optional<RunLock> first = state_.tryLock();
  ASSERT_TRUE(first);
  EXPECT_FALSE(opened(state_.path()).tryLock());
  first.reset();
  EXPECT_TRUE(opened(state_.path()).waitForLock());
}

TEST_F(StateDirectoryTest, TheRecordIsReplacedAsAWhole) {
  EXPECT_EQ(state_.lastRun(), std::nullopt);
  EXPECT_FALSE(state_.recordRun(kNoon - hours{24}));
  EXPECT_FALSE(state_.recordRun(kNoon));
  EXPECT_EQ(temporary_.read("deep/state/scheduler-last-run"), "1795000000000000\n");
  EXPECT_EQ(state_.lastRun(), kNoon);
  for (const char* record : {"", "\n", "17", "soon\n", "-5\n", "17 \n", "99999999999999999999\n"}) {
    temporary_.write("deep/state/scheduler-last-run", record);
    EXPECT_EQ(state_.lastRun(), std::nullopt) << record;
  }
  std::filesystem::create_directory(state_.path() + "/scheduler-last-run.new");
  EXPECT_EQ(state_.recordRun(kNoon)->words,
            state_.path() + "/scheduler-last-run.new: Is a directory");
}

// A scheduler's deliveries on the test's own thread, with a clock that jumps over every wait.
class ActivityDeliveriesTest : public StateDirectoryTest {
 protected:
  ActivityDeliveries deliveries(ScheduleCriteria criteria) {
    return {criteria,
            state_,
            conditions_,
            status_,
            clock_,
            clock_,
            [this](const std::shared_ptr<Activity>& activity) {
              begins_.push_back(clock_.now());
              states_.push_back(activity->state());
              latest_ = activity;
              if (handle_) handle_(*activity);
            }};
  }
  void wantDeferral() { temporary_.write("deep/state/defer", ""); }
  void wantNoDeferral() { std::filesystem::remove(temporary_.path("deep/state/defer")); }

  FakeClock clock_;
  FakeServiceStatus status_;
  void setPressure(const char* percent) {
    temporary_.write("cpu", std::string("some avg10=") + percent + " avg60=0\n");
  }
  // As the service does: asks once, and then either defers or is in its run.
  void deferOrRun(const std::function<void(Activity&)>& run) {
    handle_ = [run](Activity& activity) {
      const bool deferred = activity.shouldDefer() && activity.setState(kActivityStateDefer);
      if (!deferred) run(activity);
    };
  }

  DeferralConditions conditions_{
      {true, false, true}, state_.deferFile(), temporary_.path("power"), temporary_.path("cpu")};
  std::function<void(Activity&)> handle_;
  std::vector<Date> begins_;
  std::vector<int64_t> states_;
  std::shared_ptr<Activity> latest_;
};

TEST_F(ActivityDeliveriesTest, OneRunFollowsTheCheckIn) {
  state_.recordRun(clock_.now());
  ActivityDeliveries once = deliveries({});
  once.deliverCheckIn();
  EXPECT_FALSE(once.deliverRun());
  EXPECT_THAT(states_, ElementsAre(0, 2));
  EXPECT_TRUE(clock_.sleeps.empty());
}

TEST_F(ActivityDeliveriesTest, RunsAreAnIntervalApart) {
  state_.recordRun(clock_.now() - hours{23});
  const Date start = clock_.now();
  handle_ = [&](Activity&) { clock_.advance(std::chrono::minutes{10}); };
  ActivityDeliveries daily = deliveries({hours{24}, seconds{900}});
  EXPECT_TRUE(daily.deliverRun());
  EXPECT_TRUE(daily.deliverRun());
  EXPECT_THAT(begins_, ElementsAre(start + hours{1}, start + hours{25}));
  EXPECT_EQ(state_.lastRun(), start + hours{25});
}

TEST_F(ActivityDeliveriesTest, AnothersRunRestartsTheWait) {
  state_.recordRun(clock_.now());
  const Date otherRun = clock_.now() + hours{20};
  clock_.whileWaiting = [&] {
    if (clock_.now() == otherRun) state_.recordRun(otherRun);
  };
  ActivityDeliveries daily = deliveries({hours{24}, seconds{900}});
  daily.deliverRun();
  EXPECT_THAT(begins_, ElementsAre(otherRun + hours{24}));
}

TEST_F(ActivityDeliveriesTest, AnUnrecordedRunIsNotRedone) {
  const testing::RecordingLog log;
  std::filesystem::create_directory(state_.path() + "/scheduler-last-run.new");
  ActivityDeliveries hourly = deliveries({hours{1}, seconds{900}});
  hourly.deliverRun();
  hourly.deliverRun();
  EXPECT_EQ(begins_[1] - begins_[0], hours{1});
  EXPECT_THAT(log.lines(), ::testing::Each(::testing::StartsWith("Could not record the run: ")));
  EXPECT_EQ(log.lines().size(), 2u);
}

TEST_F(ActivityDeliveriesTest, ADeferredRunIsOfferedAgain) {
  wantDeferral();
  handle_ = [](Activity& activity) {
    if (!activity.shouldDefer()) return;
    EXPECT_TRUE(activity.setState(kActivityStateDefer));
  };
  clock_.whileWaiting = [&] { EXPECT_TRUE(state_.tryLock()) << "a deferred run holds up nobody"; };
  const Date start = clock_.now();
  ActivityDeliveries once = deliveries({{}, seconds{900}});
  EXPECT_TRUE(once.deliverRun());
  EXPECT_EQ(state_.lastRun(), std::nullopt);
  wantNoDeferral();
  EXPECT_FALSE(once.deliverRun());
  EXPECT_THAT(begins_, ElementsAre(start, start + seconds{900}));
  EXPECT_EQ(state_.lastRun(), start + seconds{900});
}

// Two hours in all, however often the machine is switched off meanwhile.
TEST_F(ActivityDeliveriesTest, TheMachinePutsARunOffForALimitedTime) {
  const testing::RecordingLog log;
  setPressure("99.00");
  const Date start = clock_.now();
  deferOrRun([&](Activity& activity) {
    EXPECT_EQ(clock_.now() - start, hours{2});
    EXPECT_FALSE(activity.shouldDefer()) << "the machine stops no run";
  });
  const ScheduleCriteria criteria{{}, seconds{4000}, hours{6}, hours{2}};
  {
    ActivityDeliveries first = deliveries(criteria);
    EXPECT_TRUE(first.deliverRun());
    EXPECT_EQ(log.lines(),
              std::vector<std::string>{"The run is put off: the CPU is under pressure"});
    EXPECT_THAT(status_.said, ElementsAre("run deferred: the CPU is under pressure"));
    EXPECT_TRUE(first.deliverRun());
    EXPECT_EQ(log.lines().size(), 1u) << "one line per run and reason";
  }
  EXPECT_EQ(state_.putOff(), hours{2}) << "a wait counts even if the process ends in it";
  ActivityDeliveries second = deliveries(criteria);
  EXPECT_FALSE(second.deliverRun());
  EXPECT_EQ(state_.putOff(), seconds{0}) << "the next run has its own two hours";
  EXPECT_TRUE(second.deliverRun());
  temporary_.write("deep/state/scheduler-put-off", "7200\nnonsense");
  EXPECT_EQ(state_.putOff(), seconds{0});
}

TEST_F(ActivityDeliveriesTest, TheDeferFileCountsForAsLongAsItStands) {
  const testing::RecordingLog log;
  wantDeferral();
  deferOrRun([](Activity& activity) { EXPECT_TRUE(activity.shouldDefer()) << "under way"; });
  ActivityDeliveries once = deliveries({});
  for (int day = 0; day < 3 * 96; ++day) EXPECT_TRUE(once.deliverRun());
  EXPECT_EQ(log.lines(),
            std::vector<std::string>{"The run is put off: " + state_.deferFile() + " exists"});
  wantNoDeferral();
  handle_ = [&](Activity& activity) {
    EXPECT_FALSE(activity.shouldDefer());
    wantDeferral();
    EXPECT_TRUE(activity.shouldDefer());
    EXPECT_TRUE(activity.shouldDefer());
  };
  EXPECT_FALSE(once.deliverRun());
  EXPECT_EQ(log.lines().back(), "The run is stopped early: " + state_.deferFile() + " exists");
  EXPECT_EQ(log.lines().size(), 2u);
}

TEST_F(ActivityDeliveriesTest, ARunHasAnEnd) {
  const testing::RecordingLog log;
  deferOrRun([&](Activity& activity) {
    clock_.advance(hours{6});
    EXPECT_FALSE(activity.shouldDefer());
    clock_.advance(seconds{1});
    EXPECT_TRUE(activity.shouldDefer());
    EXPECT_TRUE(activity.shouldDefer());
  });
  EXPECT_FALSE(deliveries({}).deliverRun()) << "it is not offered again";
  EXPECT_THAT(log.lines(), ElementsAre("The run is stopped early: it has taken as long as "
                                       "TESSEL_RUN_LIMIT allows"));
  EXPECT_FALSE(latest_->shouldDefer()) << "the poll of a past run stops nothing";
  deferOrRun([&](Activity& activity) {
    clock_.advance(hours{24 * 365});
    EXPECT_FALSE(activity.shouldDefer());
  });
  EXPECT_FALSE(deliveries({{}, seconds{900}, seconds{0}, hours{2}}).deliverRun());
}

TEST_F(ActivityDeliveriesTest, DeferIsTakenOnceDuringARun) {
  handle_ = [](Activity& activity) {
    for (const int64_t state : {0, 1, 2, 4, 5, -1}) EXPECT_FALSE(activity.setState(state)) << state;
    const bool isRun = activity.state() == kActivityStateRun;
    EXPECT_EQ(activity.setState(3), isRun);
    EXPECT_FALSE(activity.setState(3));
  };
  ActivityDeliveries once = deliveries({});
  once.deliverCheckIn();
  EXPECT_EQ(latest_->state(), 0);
  EXPECT_TRUE(once.deliverRun());
  EXPECT_EQ(latest_->state(), 3);
  handle_ = nullptr;
  EXPECT_FALSE(once.deliverRun());
  EXPECT_FALSE(latest_->setState(3)) << "the run is over";
  EXPECT_EQ(latest_->state(), 2);
}

TEST_F(ActivityDeliveriesTest, TheHandlerRunsUnderTheLock) {
  handle_ = [&](Activity& activity) {
    EXPECT_EQ(state_.tryLock().has_value(), activity.state() == 0);
  };
  ActivityDeliveries once = deliveries({});
  once.deliverCheckIn();
  once.deliverRun();
  EXPECT_TRUE(state_.tryLock());
}

// Tells a test, which waits on it, when the scheduler waits for somebody else's run.
struct SignallingStatus final : ServiceStatus {
  void say(std::string_view words) override {
    if (words == "waiting for the run of another process") waitsForOther.signal();
  }
  void progress() override {}
  Semaphore waitsForOther{0};
};

TEST_F(ActivityDeliveriesTest, TwoProcessesRunOnce) {
  SignallingStatus status;
  std::optional<RunLock> first = state_.tryLock();
  const Date start = clock_.now();
  ActivityDeliveries second(
      {hours{24}, seconds{900}}, state_, conditions_, status, clock_, clock_,
      [&](const std::shared_ptr<Activity>&) { begins_.push_back(clock_.now()); });
  std::thread thread([&] { second.deliverRun(); });
  EXPECT_TRUE(status.waitsForOther.waitFor(seconds{30}));
  state_.recordRun(start);
  first.reset();
  thread.join();
  EXPECT_THAT(begins_, ElementsAre(start + hours{24}));
}

TEST_F(ActivityDeliveriesTest, ADeliveryHoldsTheProcess) {
  ServiceManager manager(clock_, [](const std::string&) {}, {});
  ServiceRuntime runtime(manager, clock_);
  BackgroundScheduler scheduler({}, state_, conditions_, runtime, manager, clock_, clock_);
  Semaphore mayRun(0);
  Semaphore ran(0);
  runtime.requestCleanExit();
  scheduler.registerActivity("test", [&](const std::shared_ptr<Activity>& activity) {
    if (activity->state() != kActivityStateRun) return;
    EXPECT_TRUE(mayRun.waitFor(seconds{30}));
    ran.signal();
  });
  EXPECT_FALSE(runtime.mayExit());
  mayRun.signal();
  EXPECT_TRUE(ran.waitFor(seconds{30}));
  while (!runtime.mayExit()) std::this_thread::yield();
}

}  // namespace
}  // namespace tessel
