// When the process may end, what the service manager hears, and interrupts.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <cstdlib>

#include "linux/ServiceRuntime.h"
#include "platform/Queues.h"
#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

using ::testing::ElementsAre;
using testing::FakeClock;

class ServiceManagerTest : public ::testing::Test {
 protected:
  ServiceManager::Notify remember() {
    return [this](const std::string& message) { messages_.push_back(message); };
  }

  FakeClock clock_;
  std::vector<std::string> messages_;
};

TEST_F(ServiceManagerTest, StatusIsOneLineAndNotRepeated) {
  ServiceManager manager(clock_, remember(), {});
  manager.ready();
  manager.say("reading");
  manager.say("reading");
  manager.progress();  // without a watchdog nobody is fed
  manager.say("two\nlines");
  manager.stopping();
  EXPECT_THAT(messages_,
              ElementsAre("READY=1", "STATUS=reading", "STATUS=two lines", "STOPPING=1"));
}

TEST_F(ServiceManagerTest, ProgressFeedsFourTimesAPeriod) {
  ServiceManager manager(clock_, remember(), std::chrono::seconds{8});
  for (int millisecond = 0; millisecond < 8000; ++millisecond) {
    manager.progress();
    clock_.advance(std::chrono::milliseconds{1});
  }
  EXPECT_EQ(messages_, std::vector<std::string>(4, "WATCHDOG=1"));
}

TEST_F(ServiceManagerTest, AWaitCountsAsProgressForAMinute) {
  ServiceManager manager(clock_, remember(), std::chrono::seconds{8});
  manager.progress();
  for (int second = 1; second <= 200; ++second) {
    clock_.advance(std::chrono::seconds{1});
    manager.standInForProgress();
  }
  EXPECT_EQ(messages_.size(), 1u + 60 / 2);
  manager.progress();
  EXPECT_EQ(messages_.size(), 2u + 60 / 2);
}

class ServiceRuntimeTest : public ::testing::Test {
 protected:
  FakeClock clock_;
  ServiceManager manager_{clock_, [](const std::string&) {}, {}};
  Threads& threads_ = testing::realThreads();
  ServiceRuntime runtime_{manager_, threads_};
};

TEST_F(ServiceRuntimeTest, ATransactionHoldsTheProcess) {
  runtime_.openTransaction("before").reset();
  EXPECT_FALSE(runtime_.mayExit()) << "nobody asked";
  auto outer = runtime_.openTransaction("outer");
  auto inner = runtime_.openTransaction("inner");
  auto delivery = runtime_.expectDelivery();
  inner.reset();
  runtime_.requestCleanExit();
  EXPECT_FALSE(runtime_.mayExit());
  outer.reset();
  EXPECT_FALSE(runtime_.mayExit()) << "a delivery is pending";
  delivery.reset();
  EXPECT_TRUE(runtime_.mayExit());
  outer = runtime_.openTransaction("again");
  EXPECT_FALSE(runtime_.mayExit());
  outer.reset();
  EXPECT_TRUE(runtime_.mayExit()) << "the request stays in force";
}

// The rest ends processes: each case runs in one of its own.
class ProcessEndTest : public ServiceRuntimeTest {
 protected:
  ProcessEndTest() { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(ProcessEndTest, TheLastTransactionEndsTheLoop) {
  EXPECT_EXIT(
      {
        WorkerQueue queue("test", threads_);
        auto transaction = std::make_shared<std::unique_ptr<KeepAliveTransaction>>(
            runtime_.openTransaction("work"));
        queue.async([this, transaction] {
          runtime_.requestCleanExit();
          transaction->reset();
        });
        runtime_.runMainLoop();
      },
      ::testing::ExitedWithCode(0), "");
}

TEST_F(ProcessEndTest, AnEarlyInterruptIsDelivered) {
  EXPECT_EXIT(
      {
        prepareProcess();
        ::kill(::getpid(), SIGINT);
        WorkerQueue working("other work", threads_);
        std::atomic<int> turns{0};
        working.async([&turns] {
          for (;;) ++turns;
        });
        const auto queue = std::make_shared<WorkerQueue>("interrupts", threads_);
        const auto source = runtime_.makeSignalSource(SIGINT, queue);
        source->setHandler([] { std::exit(0); });
        source->resume();
        runtime_.runMainLoop();
      },
      ::testing::ExitedWithCode(0), "");
}

TEST_F(ProcessEndTest, AnIgnoredInterruptStillEndsIt) {
  EXPECT_EXIT(
      {
        std::signal(SIGINT, SIG_IGN);
        prepareProcess();
        const auto source = runtime_.makeSignalSource(
            SIGINT, std::make_shared<WorkerQueue>("interrupts", threads_));
        source->setHandler([] { std::exit(0); });
        source->resume();
        ::kill(::getpid(), SIGINT);
        runtime_.runMainLoop();
      },
      ::testing::ExitedWithCode(0), "");
}

TEST_F(ProcessEndTest, ClosedDescriptorsAreFilled) {
  EXPECT_EXIT(
      {
        ::close(0);
        ::close(1);
        prepareProcess();
        const int next = ::dup(2);
        _exit(next > 2 ? 0 : 1);
      },
      ::testing::ExitedWithCode(0), "");
}

}  // namespace
}  // namespace tessel
