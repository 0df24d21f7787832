// What it costs a program to record: tessel_event against sd_journal_send with the same eight
// fields, both to the journal daemon that listens on the machine, and tessel_event switched off.
//
// Bursts of the two alternate, each short enough for the daemon's queue and followed by a pause in
// which it catches up: so neither waits for the daemon, and both meet the same one. The figures are
// medians over the bursts. tests/with-journald runs it beside a daemon of its own:
//
//   tests/with-journald build/release/bin/trace_bench
//
// Ends with 1 where the daemon lost something, or where a bar is missed: 0.8 of sd_journal_send's
// time per event, 2 ns switched off.

#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <functional>
#include <thread>
#include <vector>

#include "tessel/trace.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kRounds = 200;
constexpr int kBurst = 128;
constexpr auto kCatchUp = std::chrono::milliseconds(12);
constexpr double kBarRatio = 0.8;
constexpr double kBarOffNanoseconds = 2.0;

// The point is built for each event, as a caller does.
int recordWithTessel() {
  using tessel::trace::Point;
  return tessel::trace::event(
      Point("com.vantor.Calendar", "View", "Open").string1("period", "week").telemetry());
}

int recordWithLibrary() {
  return sd_journal_send("TESSEL_KIND=event", "PRIORITY=7", "TESSEL_SUBSYSTEM=com.vantor.Calendar",
                         "TESSEL_CATEGORY=View", "TESSEL_NAME=Open", "TESSEL_TELEMETRY=1",
                         "TESSEL_STRING1_NAME=period", "TESSEL_STRING1_VALUE=week", NULL);
}

struct Burst {
  double nanosecondsPerEvent = 0;
  int lost = 0;
};

template <class Record>
Burst runBurst(int count, Record record) {
  Burst burst;
  const auto start = Clock::now();
  for (int i = 0; i < count; ++i) burst.lost += record() != 0;
  const std::chrono::duration<double, std::nano> time = Clock::now() - start;
  burst.nanosecondsPerEvent = time.count() / count;
  return burst;
}

class Series {
 public:
  void add(const Burst& burst) {
    times_.push_back(burst.nanosecondsPerEvent);
    lost_ += burst.lost;
  }
  double median() {
    std::sort(times_.begin(), times_.end());
    return times_[times_.size() / 2];
  }
  int lost() const { return lost_; }

 private:
  std::vector<double> times_;
  int lost_ = 0;
};

// Switched off, with the point built in the loop and escaping from it.
double measureOff() {
  constexpr int kCount = 10'000'000;
  tessel_point point = tessel::trace::Point("com.vantor.Calendar", "View", "Open").telemetry();
  tessel_enable(false);
  Series series;
  for (int round = 0; round < 11; ++round) {
    series.add(runBurst(kCount, [&point] {
      asm volatile("" : "+m"(point));
      return tessel_event(&point);
    }));
  }
  tessel_enable(true);
  return series.median();
}

}  // namespace

int main() {
  Series ours;
  Series library;
  for (int round = 0; round < kRounds; ++round) {
    ours.add(runBurst(kBurst, recordWithTessel));
    std::this_thread::sleep_for(kCatchUp);
    library.add(runBurst(kBurst, recordWithLibrary));
    std::this_thread::sleep_for(kCatchUp);
  }
  const double off = measureOff();
  const double ratio = ours.median() / library.median();
  std::printf("tessel_event      %8.0f ns per event, %d lost\n", ours.median(), ours.lost());
  std::printf("sd_journal_send   %8.0f ns per event, %d lost\n", library.median(), library.lost());
  std::printf("ratio             %8.3f (bar %.1f)\n", ratio, kBarRatio);
  std::printf("switched off      %8.2f ns per event (bar %.0f)\n", off, kBarOffNanoseconds);
  const bool good =
      ours.lost() + library.lost() == 0 && ratio <= kBarRatio && off < kBarOffNanoseconds;
  return good ? 0 : 1;
}
