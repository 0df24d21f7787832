// ladder: what it costs to read a day of journal, by several ways, on the same files in one run.
//
//   ladder [DIRECTORY [CASE...]]
//
// Makes its journals under DIRECTORY (default: ladder-journals), some 3.5 GB, and keeps them. Each
// rung runs in turn, five times, in a process of its own; printed are the medians of the processor
// time, which other work on the machine disturbs least, their ratios to `cat` of the same files and
// to the loop over all fields with libsystemd, the time by the clock, and the peak memory.

#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <map>
#include <string>
#include <vector>

#include "BenchJournals.h"
#include "Rungs.h"

namespace tessel::bench {
namespace {

constexpr int kRounds = 5;
constexpr const char* kReference = "libsystemd, all fields";

struct Measured {
  double seconds = 0;  // of the processor
  double elapsed = 0;  // by the clock
  long peakKilobytes = 0;
};

struct Case {
  JournalSpec spec;
  // journalctl -o json takes minutes on the large ones.
  bool slowRungs = true;
};

const std::vector<Case>& cases() {
  static const std::vector<Case> all = {
      {{"dense-1M-4files", 1'000'000, 4, 2}, true},
      {{"sparse-1M-4files", 1'000'000, 4, 20}, false},
      {{"dense-1M-200files", 1'000'000, 200, 2}, false},
      {{"sparse-1M-200files", 1'000'000, 200, 20}, false},
      {{"dense-5M-20files", 5'000'000, 20, 2}, false},
      {{"intervals-400k-9fields", 400'000, 1, 1, 25'000, true}, false},
      {{"intervals-400k-21fields", 400'000, 1, 1, 25'000, false}, false},
  };
  return all;
}

double secondsOf(const timeval& time) {
  return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) / 1e6;
}

Measured runOnce(const char* program, const std::string& rung, const std::string& directory) {
  const auto begin = std::chrono::steady_clock::now();
  const pid_t child = ::vfork();
  if (child == 0) {
    ::execl(program, program, "--rung", rung.c_str(), directory.c_str(), nullptr);
    ::_exit(127);
  }
  int status = 0;
  rusage usage{};
  if (child < 0 || ::wait4(child, &status, 0, &usage) != child || status != 0) {
    std::fprintf(stderr, "%s failed\n", rung.c_str());
    std::exit(1);
  }
  const std::chrono::duration<double> elapsed = std::chrono::steady_clock::now() - begin;
  return {secondsOf(usage.ru_utime) + secondsOf(usage.ru_stime), elapsed.count(), usage.ru_maxrss};
}

Measured median(std::vector<Measured> runs) {
  std::sort(runs.begin(), runs.end(),
            [](const Measured& a, const Measured& b) { return a.seconds < b.seconds; });
  Measured result = runs[runs.size() / 2];
  for (const Measured& run : runs)
    result.peakKilobytes = std::max(result.peakKilobytes, run.peakKilobytes);
  return result;
}

void runCase(const char* program, const std::string& directory, const Case& one) {
  const std::string place = makeJournals(directory, one.spec);
  std::map<std::string, std::vector<Measured>> results;
  for (int round = 0; round < kRounds; ++round) {
    for (const Rung& rung : rungs()) {
      if (rung.slow && (!one.slowRungs || round > 2)) continue;
      results[rung.name].push_back(runOnce(program, rung.name, place));
    }
  }
  const double cat = median(results["cat"]).seconds;
  const double reference = median(results[kReference]).seconds;
  std::printf("\n%s\n%-26s %9s %8s %8s %8s %8s %8s\n", one.spec.name.c_str(), "", "ns/entry",
              "of cat", "cpu s", "of loop", "clock s", "peak MB");
  for (const Rung& rung : rungs()) {
    if (results[rung.name].empty()) continue;
    const Measured result = median(results[rung.name]);
    std::printf("%-26s %9.0f %8.1f %8.3f %8.3f %8.3f %8.1f\n", rung.name.c_str(),
                result.seconds * 1e9 / static_cast<double>(one.spec.entries), result.seconds / cat,
                result.seconds, result.seconds / reference, result.elapsed,
                static_cast<double>(result.peakKilobytes) / 1024);
  }
  std::fflush(stdout);
}

// Runs one rung in this process.
int runRung(const std::string& name, const std::string& directory) {
  for (const Rung& rung : rungs()) {
    if (rung.name != name) continue;
    if (rung.run != nullptr) return rung.run(directory) > 0 ? 0 : 1;
    std::string files;
    for (const auto& entry : std::filesystem::directory_iterator(directory))
      if (entry.path().extension() == ".journal") files += " " + entry.path().string();
    ::setenv("FILES", files.c_str(), 1);
    ::setenv("DIRECTORY", directory.c_str(), 1);
    const auto here = std::filesystem::read_symlink("/proc/self/exe").parent_path();
    ::setenv("TESSELCTL", (here / "tesselctl").c_str(), 1);
    ::execl("/bin/sh", "sh", "-c", rung.command.c_str(), nullptr);
  }
  return 1;
}

int run(int argc, char** argv) {
  if (argc == 4 && std::string(argv[1]) == "--rung") return runRung(argv[2], argv[3]);
  const std::string directory = argc > 1 ? argv[1] : "ladder-journals";
  // Newer versions of libsystemd are faster, so the figures mean little without its version.
  if (std::system("journalctl --version | head -n 1") != 0) return 1;
  const std::vector<std::string> wanted(argv + std::min(argc, 2), argv + argc);
  for (const Case& one : cases())
    if (wanted.empty() || std::count(wanted.begin(), wanted.end(), one.spec.name) != 0)
      runCase("/proc/self/exe", directory, one);
  return 0;
}

}  // namespace
}  // namespace tessel::bench

int main(int argc, char** argv) { return tessel::bench::run(argc, argv); }
