// The machine's clocks.

#include "linux/SystemClock.h"

#include <ctime>
#include <thread>

namespace tessel {

uint64_t SystemClock::continuousTicks() {
  timespec time{};
  clock_gettime(CLOCK_BOOTTIME, &time);
  return static_cast<uint64_t>(time.tv_sec) * 1'000'000'000 + static_cast<uint64_t>(time.tv_nsec);
}

Date SystemClock::now() {
  return std::chrono::floor<std::chrono::microseconds>(std::chrono::system_clock::now());
}

void SystemClock::sleepMicroseconds(uint32_t microseconds) {
  std::this_thread::sleep_for(std::chrono::microseconds{microseconds});
}

bool SystemClock::wait(Semaphore& semaphore, std::chrono::nanoseconds timeout) {
  return semaphore.waitFor(timeout);
}

}  // namespace tessel
