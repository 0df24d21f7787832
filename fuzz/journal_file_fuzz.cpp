// Any bytes as a journal file. The reader must come to an end, deliver no more entries than the
// file has room for, and cut values at their limit.
//
// A real journal file has a hash table of megabytes, mostly zeros, that the reader never looks at.
// Inputs of that size would slow the fuzzer down. So an input begins with the place and the length
// of that table, 32 bits each, and the file is made with a hole there.

#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <span>
#include <utility>
#include <vector>

#include "journal/JournalEntryStream.h"
#include "journal/JournalStore.h"
#include "trace/TracePointTable.h"

namespace {

using namespace tessel;

constexpr uint64_t kLongestHole = uint64_t{16} << 20;

void writeAt(int file, std::span<const uint8_t> bytes, uint64_t offset) {
  if (::pwrite(file, bytes.data(), bytes.size(), static_cast<off_t>(offset)) !=
      static_cast<ssize_t>(bytes.size()))
    std::abort();
}

bool makeFile(int file, std::span<const uint8_t> input) {
  uint32_t hole[2];
  if (input.size() < sizeof hole) return false;
  std::memcpy(hole, input.data(), sizeof hole);
  const auto bytes = input.subspan(sizeof hole);
  const size_t before = std::min<size_t>(hole[0], bytes.size());
  if (::ftruncate(file, 0) != 0) std::abort();
  writeAt(file, bytes.first(before), 0);
  writeAt(file, bytes.subspan(before), before + hole[1] % kLongestHole);
  return true;
}

void readAll(JournalEntryStream& stream, TracePointTable& table, size_t most) {
  size_t entries = 0;
  while (stream.next()) {
    if (++entries > most) std::abort();
    for (const FieldToken token : stream.entry().tokens) {
      if (table.kind(token) == FieldKind::name && table.text(token).text().size() > 4096)
        std::abort();
    }
    if (table.full()) table.startGeneration();
  }
}

// The files of a store share megabytes of memory. Each input is read as one more file of the same
// store, so that this memory is made once for many inputs.
uint32_t nextNumber() {
  static uint32_t runs = 0;
  return runs++ % JournalStore::kMaxFiles;
}

JournalReadResources& resources(uint32_t number) {
  static auto& kept = *new std::unique_ptr<JournalReadResources>;
  if (number == 0) kept = std::make_unique<JournalReadResources>();
  return *kept;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const int file = ::memfd_create("journal", 0);
  if (!makeFile(file, {data, size})) return 0;
  const auto opened = readJournalHeader(file);
  const auto* beginning = std::get_if<JournalBeginning>(&opened);
  if (beginning == nullptr) return 0;
  TracePointTable table({.fields = 64, .textBytes = size_t{64} << 10});
  const std::vector<std::string_view> marks = table.marks();
  StopFlag stop = false;
  FileReport report;
  const uint32_t number = nextNumber();
  JournalReadResources& shared = resources(number);
  JournalEntryStream stream(
      std::make_unique<JournalFile>(UniqueFd(::dup(file)), beginning->fileSize, beginning->header,
                                    shared.windows),
      number, {shared, table, marks, stop, report});
  readAll(stream, table, size / 8);
  if (report.problems.all().size() > Losses::kMaxOfACode + 1) std::abort();
  return 0;
}
