// How long an extraction that is told to stop goes on: build/release/bin/stop_bench STORE
// [STOPS]. STORE is a directory with journal or export files of the last 24 hours. It is read once
// as a whole, and then STOPS times (default: a hundred) with a stop at a random moment.

#include <pthread.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <future>
#include <optional>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "trace/JournalExtractor.h"

namespace {

using Clock = std::chrono::steady_clock;
using Milliseconds = std::chrono::duration<double, std::milli>;

void readStore(tessel::JournalExtractor& extractor) {
  const auto now = std::chrono::floor<std::chrono::microseconds>(std::chrono::system_clock::now());
  const auto goOn = [](const auto&) { return true; };
  extractor.setIntervalCompletionProcessingBlock(goOn);
  extractor.setAnimationIntervalCompletionProcessingBlock(goOn);
  extractor.setEmitEventProcessingBlock(goOn);
  std::optional<tessel::PlatformError> error;
  extractor.processLogArchiveWithPath(std::nullopt, now - std::chrono::hours{24}, now, error);
}

Milliseconds timeOfAll(const std::string& store) {
  tessel::JournalExtractor extractor(store);
  const auto began = Clock::now();
  readStore(extractor);
  const Milliseconds whole = Clock::now() - began;
  std::printf("%llu entries in %.1f ms\n",
              static_cast<unsigned long long>(extractor.processedEventCount()), whole.count());
  return whole;
}

Milliseconds processorTime(clockid_t clock) {
  timespec time{};
  clock_gettime(clock, &time);
  return std::chrono::seconds{time.tv_sec} + std::chrono::nanoseconds{time.tv_nsec};
}

// What passed between a stop and the end of the reading. On a busy machine the reader waits for its
// turn as well, so its processor time stands beside.
struct Lateness {
  Milliseconds time;
  Milliseconds processor;
};

// Nothing where the reading had ended before the stop.
std::optional<Lateness> stopAfter(const std::string& store, Milliseconds moment) {
  tessel::JournalExtractor extractor(store);
  Clock::time_point ended;
  Milliseconds used{};
  std::promise<void> measured;
  std::thread reader([&] {
    readStore(extractor);
    ended = Clock::now();
    used = processorTime(CLOCK_THREAD_CPUTIME_ID);
    measured.get_future().wait();  // the clock is there while its thread is
  });
  clockid_t clock{};
  pthread_getcpuclockid(reader.native_handle(), &clock);
  std::this_thread::sleep_for(moment);
  const Milliseconds usedBefore = processorTime(clock);
  const auto stopped = Clock::now();
  extractor.stopProcessing();
  measured.set_value();
  reader.join();
  if (ended < stopped) return {};
  return Lateness{ended - stopped, used - usedBefore};
}

void print(const char* what, std::vector<Milliseconds> times) {
  std::sort(times.begin(), times.end());
  std::printf("%s: median %.3f ms, worst %.3f ms\n", what, times[times.size() / 2].count(),
              times.back().count());
}

}  // namespace

int main(int count, char** arguments) {
  const size_t stops = count == 3 ? std::strtoul(arguments[2], nullptr, 10) : 100;
  if (count < 2 || count > 3 || stops == 0) {
    std::fputs("usage: stop_bench STORE [STOPS]\n", stderr);
    return 64;
  }
  const std::string store = arguments[1];
  std::mt19937 random(7);
  std::uniform_real_distribution<> moments(0, timeOfAll(store).count());
  std::vector<Milliseconds> times;
  std::vector<Milliseconds> processor;
  for (int tries = 0; times.size() < stops && tries < 1000; ++tries) {
    const auto late = stopAfter(store, Milliseconds(moments(random)));
    if (!late) continue;
    times.push_back(late->time);
    processor.push_back(late->processor);
  }
  if (times.empty()) return 1;
  print("time from stop to end", times);
  print("processor time of the reader in it", processor);
}
