// Order and lifetime of work on queues with threads.

#include <gtest/gtest.h>

#include <algorithm>
#include <thread>
#include <vector>

#include "platform/Queues.h"

namespace tessel {
namespace {

TEST(WorkerQueueTest, RunsOneAtATimeInOrder) {
  constexpr size_t kThreads = 4;
  constexpr int kEach = 500;
  WorkerQueue queue("test");
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
    WorkerQueue queue("test");
    queue.async([done] { done->signal(); });
  }
  EXPECT_TRUE(done->waitFor(std::chrono::seconds(30)));
}

TEST(RepeatingTimerTest, FiresAtOnceAndOutlivesItsOwner) {
  WorkerQueueFactory factory;
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
