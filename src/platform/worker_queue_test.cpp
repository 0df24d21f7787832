// Order and lifetime of work on queues with threads.

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "platform/Semaphore.h"
#include "platform/WorkerQueue.h"

namespace tessel {
namespace {

TEST(WorkerQueueTest, RunsOneAtATimeInOrderOfSubmission) {
  WorkerQueue queue("test");
  std::vector<int> order;  // written by the queue alone
  for (int i = 0; i < 1000; ++i) queue.async([&order, i] { order.push_back(i); });
  queue.sync([&order] { order.push_back(-1); });
  ASSERT_EQ(order.size(), 1001u);
  for (int i = 0; i < 1000; ++i) EXPECT_EQ(order[static_cast<size_t>(i)], i);
  EXPECT_EQ(order.back(), -1);
}

TEST(WorkerQueueTest, CountsEverySubmissionOfManyThreads) {
  WorkerQueue queue("test");
  int count = 0;  // written by the queue alone
  std::vector<std::thread> threads;
  threads.reserve(4);
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int j = 0; j < 500; ++j) queue.async([&count] { ++count; });
    });
  }
  for (std::thread& thread : threads) thread.join();
  queue.sync([] {});
  EXPECT_EQ(count, 2000);
}

TEST(WorkerQueueTest, RunsWhatItHoldsAfterItsLastReferenceWentAndAfterItsThreadLeft) {
  const auto done = std::make_shared<Semaphore>(0);
  {
    WorkerQueue queue("test");
    queue.async([done] { done->signal(); });
  }
  EXPECT_TRUE(done->waitFor(std::chrono::seconds(30)));
}

TEST(RepeatingTimerTest, FiresAtOnceAndGoesOnAfterItsOwnerLetGo) {
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
