// What it costs a program to record: tessel_event against sd_journal_send with the same eight
// fields, both to the journal daemon that listens on the machine, and tessel_event switched off.
//
// Bursts of the two alternate, each short enough for the daemon's queue and followed by a pause in
// which it catches up. So neither waits for the daemon, both deliver everything, and both meet the
// same daemon. The figures are medians over the bursts: the processor time of the thread that
// records, and the wall time of the calls. tests/with-journald runs it beside a daemon of its own:
//
//   tests/with-journald build/release/bin/trace_bench
//
// Ends with 1 where something was lost, or where a bar is missed: half of sd_journal_send's
// processor time per event, 2 ns switched off. Wall time has no bar: it depends on how the system
// lets the daemon and the program take turns.

#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>
#include <time.h>

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
constexpr double kBarRatio = 0.5;
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
  double processor = 0;  // nanoseconds per event
  double wall = 0;       // nanoseconds per event
  int lost = 0;
};

double processorNanoseconds() {
  timespec now{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) * 1e9 + static_cast<double>(now.tv_nsec);
}

template <class Record>
Burst runBurst(int count, Record record) {
  Burst burst;
  const auto start = Clock::now();
  const double before = processorNanoseconds();
  for (int i = 0; i < count; ++i) burst.lost += record() != 0;
  burst.processor = (processorNanoseconds() - before) / count;
  const std::chrono::duration<double, std::nano> time = Clock::now() - start;
  burst.wall = time.count() / count;
  return burst;
}

class Series {
 public:
  void add(const Burst& burst) {
    bursts_.push_back(burst);
    lost_ += burst.lost;
  }
  double median(double Burst::*figure) {
    const auto less = [figure](const Burst& a, const Burst& b) { return a.*figure < b.*figure; };
    std::sort(bursts_.begin(), bursts_.end(), less);
    return bursts_[bursts_.size() / 2].*figure;
  }
  int lost() const { return lost_; }

 private:
  std::vector<Burst> bursts_;
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
  return series.median(&Burst::wall);
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
  const double ratio = ours.median(&Burst::processor) / library.median(&Burst::processor);
  const auto print = [](const char* name, Series& series) {
    std::printf("%-16s %6.0f ns of processor time, %6.0f ns per event, %d lost\n", name,
                series.median(&Burst::processor), series.median(&Burst::wall), series.lost());
  };
  print("tessel_event", ours);
  print("sd_journal_send", library);
  std::printf("ratio            %6.3f of the processor time (bar %.1f), %.3f of the wall time\n",
              ratio, kBarRatio, ours.median(&Burst::wall) / library.median(&Burst::wall));
  std::printf("switched off     %6.2f ns per event (bar %.0f)\n", off, kBarOffNanoseconds);
  const bool good =
      ours.lost() + library.lost() == 0 && ratio <= kBarRatio && off < kBarOffNanoseconds;
  return good ? 0 : 1;
}
