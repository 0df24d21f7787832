// When the spool flushes, seen by the calls of the C library.

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <chrono>

#include "os/testing/TemporaryDirectory.h"
#include "platform/testing/Fakes.h"
#include "statora/Spool.h"

namespace {
std::atomic<int> flushes = 0;
}

// Takes the place of the C library's function for SQLite, too.
extern "C" int fdatasync(int file) {
  ++flushes;
  return ::fsync(file);
}

namespace tessel {
namespace {

// A clock on which each look takes so long that three make a second.
struct SlowClock final : Clock {
  explicit SlowClock(testing::FakeClock& fake) : clock(fake) {}
  uint64_t continuousTicks() override {
    clock.advance(std::chrono::milliseconds{400});
    return clock.continuousTicks();
  }
  Timebase timebase() override { return clock.timebase(); }
  Date now() override { return clock.now(); }
  testing::FakeClock& clock;
};

TEST(SpoolFlushTest, ABacklogIsFlushedWhileItIsInserted) {
  const testing::TemporaryDirectory directory;
  testing::FakeClock fake;
  testing::FakeServiceStatus status;
  SlowClock slow(fake);
  const auto queue = std::make_shared<testing::ManualQueue>("writer");
  testing::ManualQueueFactory timers;
  Spool spool(directory.path(), {}, slow, status, queue, timers);
  spool.sendEvent("a", Payload{}, EventRank::object);
  queue->runAll();
  const int before = flushes;
  for (int i = 0; i < 64 * 30; ++i) spool.sendEvent("a", Payload{}, EventRank::object);
  queue->runAll();
  EXPECT_GE(flushes - before, 8) << "thirty transactions take 12 s, and no tick came";
  spool.endRun();
}

}  // namespace
}  // namespace tessel
