// Order and lifetime of work on queues with threads.

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <thread>
#include <utility>
#include <vector>

#include "platform/Queues.h"
#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

using testing::realThreads;

TEST(WorkerQueueTest, RunsOneAtATimeInOrder) {
  constexpr size_t kThreads = 4;
  constexpr int kEach = 500;
  ThreadPool pool(realThreads());
  WorkerQueue queue("test", pool);
  std::vector<std::vector<int>> orders(kThreads);  // written by the queue alone
  int count = 0;
  std::vector<std::thread> threads;
  threads.reserve(kThreads);
  for (auto& order : orders) {
    threads.emplace_back([&queue, &order, &count] {
      for (int i = 0; i < kEach; ++i)
        queue.async([&order, &count, i] {
          std::this_thread::yield();  // gives a second thread of the queue its chance
          order.push_back(i), ++count;
        });
    });
  }
  for (std::thread& thread : threads) thread.join();
  int countInSync = 0;
  queue.sync([&] { countInSync = count; });
  EXPECT_EQ(countInSync, kThreads * kEach);
  for (const auto& order : orders) EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST(WorkerQueueTest, ADroppedQueueRunsWhatItHolds) {
  const auto done = std::make_shared<Semaphore>(0);
  {
    ThreadPool pool(realThreads());
    WorkerQueue queue("test", pool);
    queue.async([done] { done->signal(); });
  }
  EXPECT_TRUE(done->waitFor(std::chrono::seconds(30)));
}

// A closure that waits until the test opens the gate.
struct Gate {
  void pass() {
    const int now = ++inside;
    int most = mostInside;
    while (most < now && !mostInside.compare_exchange_weak(most, now)) {
    }
    entered.signal();
    EXPECT_TRUE(open.waitFor(std::chrono::seconds(30)));
    --inside;
    left.signal();
  }

  Semaphore entered{0};
  Semaphore open{0};
  Semaphore left{0};
  std::atomic<int> inside{0};
  std::atomic<int> mostInside{0};
};

TEST(WorkerQueueTest, QueuesShareEightThreadsAndOwnOnesDoNotWait) {
  constexpr int kQueues = 30;
  constexpr int kThreads = 8;
  const auto gate = std::make_shared<Gate>();
  ThreadPool pool(realThreads());
  for (int i = 0; i < kQueues; ++i) WorkerQueue("shared", pool).async([gate] { gate->pass(); });
  for (int i = 0; i < kThreads; ++i) ASSERT_TRUE(gate->entered.waitFor(std::chrono::seconds(30)));
  EXPECT_FALSE(gate->entered.waitFor(std::chrono::milliseconds(50))) << "a ninth thread";
  bool ran = false;
  WorkerQueue("own", realThreads()).sync([&ran] { ran = true; });
  EXPECT_TRUE(ran);
  for (int i = 0; i < kQueues; ++i) gate->open.signal();
  for (int i = 0; i < kQueues; ++i) EXPECT_TRUE(gate->left.waitFor(std::chrono::seconds(30)));
  EXPECT_EQ(gate->mostInside, kThreads);
}

TEST(WorkerQueueDeathTest, ASharedThreadMayNotWaitForAnotherQueue) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        ThreadPool pool(realThreads());
        WorkerQueue other("other", pool);
        Semaphore never(0);
        WorkerQueue("shared", pool).async([&other] { other.sync([] {}); });
        never.waitFor(std::chrono::seconds(30));
      },
      "broken invariant at Queues.cpp");
}

// A queue that keeps what it is given until the test runs it.
struct StuckQueue final : SerialQueue {
  const std::string& label() const override { return name; }
  void async(Closure work) override {
    held = std::move(work);
    submitted.signal();
  }
  void sync(const Closure&) override {}

  const std::string name = "stuck";
  Closure held;
  Semaphore submitted{0};
};

TEST(RepeatingTimerTest, AFiringThatStillWaitsIsNotRepeated) {
  WorkerQueueFactory factory(realThreads());
  const auto queue = std::make_shared<StuckQueue>();
  const std::chrono::milliseconds often(1);
  factory.makeRepeatingTimer(queue, often, often, [] {})->resume();
  EXPECT_TRUE(queue->submitted.waitFor(std::chrono::seconds(30)));
  EXPECT_FALSE(queue->submitted.waitFor(50 * often));
  std::exchange(queue->held, nullptr)();
  EXPECT_TRUE(queue->submitted.waitFor(std::chrono::seconds(30)));
}

TEST(RepeatingTimerTest, FiresAtOnceAndOutlivesItsOwner) {
  WorkerQueueFactory factory(realThreads());
  const auto fired = std::make_shared<Semaphore>(0);
  {
    const auto timer =
        factory.makeRepeatingTimer(factory.makeSerialQueue("test"), std::chrono::milliseconds(1),
                                   std::chrono::milliseconds(1), [fired] { fired->signal(); });
    EXPECT_FALSE(fired->waitFor(std::chrono::milliseconds(0)));
    timer->resume();
  }
  for (int i = 0; i < 5; ++i) EXPECT_TRUE(fired->waitFor(std::chrono::seconds(30)));
}

}  // namespace
}  // namespace tessel
