// compare_readers [--ours|--stop-after MILLISECONDS] PATH
//
// PATH is a directory or a journal file. Four readers read it: ours, libsystemd, `journalctl -o
// export`, and ours when only entries with a TESSEL_ field are wanted. The entries are compared one
// by one.
//
// Prints the figures of our reader, then a line for each file with a problem, then a line for each
// reader that differs from ours. The exit status is 1 if one differs. --ours reads with our reader
// alone, and with the PATH "machine" the journal of this machine. --stop-after stops the reading
// after that time and prints how long the stop took.

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <iostream>
#include <optional>
#include <set>
#include <string_view>
#include <thread>

#include "journal/EntryStream.h"
#include "journal/JournalStore.h"
#include "journal/testing/JournalOracle.h"

namespace {

using namespace tessel;
using testing::PlainEntry;
using Clock = std::chrono::steady_clock;

void printReport(const StoreReport& report) {
  for (const FileReport& file : report.files) {
    if (file.skipped) std::cout << "skipped " << file.path << ": " << *file.skipped << "\n";
    for (const Loss& problem : file.problems.all())
      std::cout << "problem " << file.path << ": " << problem.words << " x" << problem.count
                << "\n";
  }
}

// Reads a stream to its end and touches each field.
std::vector<PlainEntry> readHeaders(EntryStream& stream) {
  std::vector<PlainEntry> entries;
  while (stream.next()) entries.push_back({stream.entry().header, {}});
  return entries;
}

// How many entries were delivered more than once.
size_t repeated(const std::vector<PlainEntry>& entries) {
  std::set<std::string> seen;
  for (const PlainEntry& entry : entries) seen.insert(cursorOf(entry.header));
  return entries.size() - seen.size();
}

bool same(std::string_view name, const std::vector<PlainEntry>& ours,
          const std::vector<PlainEntry>& theirs) {
  // libsystemd does not tell sequence and hash.
  const auto equal = [](const PlainEntry& a, const PlainEntry& b) {
    return a == b && (b.header.sequenceNumber == 0 || cursorOf(a.header) == cursorOf(b.header));
  };
  const auto [mine, other] =
      std::mismatch(ours.begin(), ours.end(), theirs.begin(), theirs.end(), equal);
  if (mine == ours.end() && other == theirs.end()) return true;
  std::cout << name << " sees " << theirs.size() << " entries, other ones from number "
            << mine - ours.begin() << " on; ours:";
  if (mine != ours.end()) std::cout << *mine;
  std::cout << "\nthe other:";
  if (other != theirs.end()) std::cout << *other;
  std::cout << "\n";
  return false;
}

// Reads only entries with a TESSEL_ field. The reader may then deliver the others empty. We count
// those in `spared` and fill them in from the full reading, so that all compare.
std::vector<PlainEntry> readMarked(const std::string& path, const std::vector<PlainEntry>& all,
                                   size_t& spared) {
  testing::RecordingTokenizer tokenizer({"TESSEL_"});
  const StopFlag stop{false};
  auto opened = JournalStore::open(path, {}, tokenizer, stop);
  std::vector<PlainEntry> led = testing::readAll(std::get<0>(opened)->entries(), tokenizer);
  for (size_t i = 0; i < std::min(led.size(), all.size()); ++i) {
    const auto isMark = [](const std::string& field) { return field.starts_with("TESSEL_"); };
    if (!led[i].fields.empty() || std::ranges::any_of(all[i].fields, isMark)) continue;
    led[i].fields = all[i].fields;
    ++spared;
  }
  return led;
}

int compare(const std::string& path, bool withOthers) {
  testing::RecordingTokenizer tokenizer;
  const StopFlag stop{false};
  const auto place = path == "machine" ? std::nullopt : std::optional(path);
  auto opened = JournalStore::open(place, {}, tokenizer, stop);
  if (const auto* error = std::get_if<PlatformError>(&opened)) {
    std::cout << error->words << "\n";
    return 2;
  }
  JournalStore& store = *std::get<0>(opened);
  const std::vector<PlainEntry> ours =
      withOthers ? testing::readAll(store.entries(), tokenizer) : readHeaders(store.entries());
  const StoreReport report = store.report();
  size_t spared = 0;
  const auto marked = withOthers ? readMarked(path, ours, spared) : ours;
  std::cout << "entries " << ours.size() << " repeated " << repeated(ours) << " duplicates "
            << report.reading.duplicateEntries << " files " << report.files.size() << " spared "
            << spared << "\n";
  printReport(report);
  if (!withOthers) return 0;
  std::vector<std::string> files;
  for (const FileReport& file : report.files) files.push_back(file.path);
  const bool libsystemd = same("libsystemd", ours, testing::readWithLibsystemd(files));
  const bool journalctl = same("journalctl", ours, testing::readWithJournalctl(path));
  return same("the reader of marked entries", ours, marked) && libsystemd && journalctl ? 0 : 1;
}

int stopMeanwhile(const std::string& path, std::chrono::milliseconds after) {
  testing::RecordingTokenizer tokenizer;
  StopFlag stop{false};
  Clock::time_point stopped{};
  std::thread stopper([&] {
    std::this_thread::sleep_for(after);
    stopped = Clock::now();
    stop = true;
  });
  size_t entries = 0;
  {
    auto opened = JournalStore::open(path, {}, tokenizer, stop);
    if (auto* store = std::get_if<0>(&opened))
      for (; (*store)->entries().next(); ++entries) (*store)->entries().entry();
  }
  const auto ended = Clock::now();
  stopper.join();
  const std::chrono::duration<double, std::milli> latency = ended - stopped;
  std::cout << "entries " << entries << " latency " << latency.count() << " ms\n";
  return 0;
}

}  // namespace

int main(int count, char** words) {
  const std::string_view mode = count > 2 ? words[1] : "";
  if (count == 4 && mode == "--stop-after")
    return stopMeanwhile(words[3], std::chrono::milliseconds(std::atoi(words[2])));
  return count < 2 ? 2 : compare(words[count - 1], mode != "--ours");
}
