// Opens each file with the reader for its kind, and filters and counts what the merge delivers.

#include "journal/JournalStore.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <utility>
#include <vector>

#include "journal/EntryMerger.h"
#include "journal/ExportEntryStream.h"
#include "journal/JournalEntryStream.h"
#include "journal/LossTokenizer.h"
#include "journal/NumberWatch.h"
#include "journal/StoreFiles.h"
#include "platform/Invariant.h"

namespace tessel {

namespace {

// Two files with equal keys would return each other's tokens.
static_assert(JournalStore::kMaxFiles <= TokenCache::kMaxFiles);

// One call in 64 entries does not show in the time of a run. The watchdog waits minutes, so entries
// may take a second each, as from a disk that fails.
constexpr uint64_t kEntriesPerStep = 64;

// For a stream whose entries may belong to any sequence.
constexpr Id128 kNoSequence{};

// The daemon makes a journal before it writes the header, so a new file may be empty and has lost
// nothing. One that was cut to nothing has. Its time of change tells it from a file that nobody
// ever wrote to. Where the file system keeps no time of birth, we tell both.
bool neverWritten(const struct statx& file) {
  return file.stx_size == 0 && (file.stx_mask & STATX_BTIME) != 0 &&
         file.stx_mtime.tv_sec == file.stx_btime.tv_sec &&
         file.stx_mtime.tv_nsec == file.stx_btime.tv_nsec;
}

// Adds the result of reading one file to that of the store.
void addFile(const FileReport& file, StoreReading& reading) {
  if (!file.skipped) {
    ++reading.filesRead;
  } else if (file.notThere) {
    return;  // as if the store had been opened a moment later, or a moment earlier
  } else if (file.outsideRange) {
    ++reading.filesOutsideRange;
    if (reading.outsideRange.size() < StoreReading::kMaxNamed)
      reading.outsideRange.push_back(file.path);
  } else {
    reading.losses.add(LossCode::fileSkipped, *file.skipped, {file.path, {}});
  }
  for (Loss problem : file.problems.all()) {
    problem.place.name = file.path;
    reading.losses.add(std::move(problem));
  }
}

}  // namespace

struct JournalStore::State final : EntryStream {
  State(TimeRange timeRange, FieldTokenizer& user, const StopFlag& stopFlag,
        ServiceStatus* serviceStatus)
      : range(timeRange), stop(stopFlag), status(serviceStatus), tokenizer(user), merger(stopFlag) {
    facts.reading.rangeStart = range.start;
    facts.reading.rangeEnd = range.end;
  }

  bool next() override;
  const EntryHeader& header() const override { return merger.header(); }
  std::span<const FieldToken> tokens() override { return {firstToken, tokenCount}; }

  void openFiles(StoreFiles found);
  void openFile(StoreFile& file, uint32_t number);
  void openJournal(StoreFile& file, uint32_t number);
  void openForeign(StoreFile& file, uint64_t entryCount, uint32_t number);
  bool outsideRange(const JournalHeader& header) const;
  std::optional<PlatformError> failure(const std::string& place) const;
  void makeProgress() const {
    if (status != nullptr) status->progress();
  }
  void seeTime(uint64_t realtime) {
    auto& oldest = facts.reading.oldestEntry;
    if (!oldest || realtime < *oldest) oldest = realtime;
  }

  const TimeRange range;
  // The tokens of the current entry, and far from here their number. If both stood together, the
  // compiler would load them with one instruction, which waits for the two that stored them: four
  // nanoseconds an entry.
  const FieldToken* firstToken = nullptr;
  const StopFlag& stop;
  ServiceStatus* const status;
  uint64_t entriesMerged = 0;
  JournalReadResources resources;
  ExportReadResources exports{resources.windows};
  LossTokenizer tokenizer;
  const std::vector<std::string_view> marks = tokenizer.marks();
  StoreReport facts;  // streams keep references to its files: see openFiles()
  size_t usableFiles = 0;
  ErrorCode firstFailure = ErrorCode::notAStore;  // why the first file is not usable
  size_t foreignFiles = 0;                        // that journalctl reads for us
  std::vector<uint32_t> counters;                 // by file: the same for files of one daemon
  NumberWatch numbers;
  StoreMerger merger;
  size_t tokenCount = 0;
};

bool JournalStore::State::next() {
  while (merger.next()) {
    const EntryHeader& entry = merger.header();
    if (++entriesMerged % kEntriesPerStep == 0) makeProgress();
    // Entries outside the range show how far back the store reaches. Further ones of them may stand
    // in files that are not read, so gaps among them mean nothing.
    seeTime(entry.realtime);
    const bool inRange = entry.realtime >= range.start && entry.realtime < range.end;
    const uint32_t file = merger.streamNumber();
    numbers.see(counters[file], entry, inRange);
    if (!inRange) continue;
    ++facts.reading.entriesRead;
    ++facts.files[file].entriesRead;
    // The daemon's loss messages end here, so that the user sees only tokens of its own, and so
    // that they are counted even if the user does not look at the entry.
    const std::span<const FieldToken> theirs = tokenizer.takeOwn(merger.tokens());
    firstToken = theirs.data();
    tokenCount = theirs.size();
    return true;
  }
  return false;
}

// Streams keep references to elements of facts.files, so it gets its final length before the first
// stream.
void JournalStore::State::openFiles(StoreFiles found) {
  facts.reading.losses.add(LossCode::filesNotLookedAt, "too many files to look at", {},
                           found.leftOut);
  facts.files.resize(found.files.size());
  // A daemon keeps its files in one directory, or in two of the same name: see StoreFiles.
  std::map<std::string, uint32_t> directories;
  uint32_t opened = 0;
  while (opened < found.files.size() && !stop.load(std::memory_order_relaxed)) {
    makeProgress();
    facts.files[opened].path = found.files[opened].path;
    const auto directory =
        std::filesystem::path(found.files[opened].path).parent_path().filename().string();
    counters.push_back(directories.try_emplace(directory, static_cast<uint32_t>(directories.size()))
                           .first->second);
    openFile(found.files[opened], opened);
    ++opened;
  }
  facts.files.resize(opened);  // after a stop: the others are neither read nor skipped
}

void JournalStore::State::openFile(StoreFile& file, uint32_t number) {
  FileReport& report = facts.files[number];
  if (!file.fd.valid()) {
    report.skipped = whyNotOpened(file.error);
    report.refused = codeOf(file.error) == ErrorCode::noAccess;
    if (number == 0) firstFailure = codeOf(file.error);
    return;
  }
  if (file.kind == StoreFileKind::exportStream) {
    ++usableFiles;
    merger.add(
        std::make_unique<ExportEntryStream>(file.fd.release(), exports, tokenizer, stop, report),
        number, kNoSequence);
  } else {
    openJournal(file, number);
  }
}

void JournalStore::State::openJournal(StoreFile& file, uint32_t number) {
  FileReport& report = facts.files[number];
  auto opened = readJournalHeader(file.fd.get());
  if (auto* error = std::get_if<PlatformError>(&opened)) {
    report.skipped = std::move(error->words);
    // The daemon removes an empty journal when it rotates, and frees its blocks.
    struct statx found {};
    if (::statx(file.fd.get(), "", AT_EMPTY_PATH, STATX_BASIC_STATS | STATX_BTIME, &found) == 0) {
      report.notThere = found.stx_nlink == 0 || neverWritten(found);
      if (found.stx_nlink == 0) report.skipped = "removed before it was read";
    }
    if (number == 0) firstFailure = error->code;
    return;
  }
  const auto& [header, size] = std::get<JournalBeginning>(opened);
  // A flag that we do not know may change the layout of anything behind the header.
  if (header.unknownFlags() != 0) {
    openForeign(file, header.entryCount, number);
    return;
  }
  ++usableFiles;
  // The header tells the age of a file even if we need not read the file.
  if (header.headRealtime != 0) seeTime(header.headRealtime);
  auto journal = std::make_unique<JournalFile>(std::move(file.fd), size, header, resources.windows);
  if (outsideRange(header) && headerTellsTimes(*journal, stop)) {
    report.skipped = "outside the range";
    report.outsideRange = true;
    return;
  }
  // The token cache tells files apart by a number below kMaxFiles. The place in the report may be
  // larger, because files that could not be opened stand there as well.
  TESSEL_INVARIANT(usableFiles <= kMaxFiles);
  merger.add(std::make_unique<JournalEntryStream>(
                 std::move(journal), usableFiles - 1,
                 JournalEntryStream::Context{resources, tokenizer, marks, stop, report}),
             number, header.sequenceId);
}

// Only a newer reader understands such a file. The machine's own journalctl is likely to be new
// enough.
void JournalStore::State::openForeign(StoreFile& file, uint64_t entryCount, uint32_t number) {
  FileReport& report = facts.files[number];
  if (foreignFiles == kMaxForeignFiles) {
    report.skipped = "written with features that are not known, as are " +
                     std::to_string(kMaxForeignFiles) + " files before it";
    return;
  }
  auto stream =
      ForeignJournalStream::start(file.path, entryCount, exports, tokenizer, stop, report);
  if (!stream) {
    report.skipped = "written with features that are not known";
    return;
  }
  ++foreignFiles;
  ++usableFiles;
  merger.add(std::move(stream), number, kNoSequence);
}

// The header has the times of the first and last entry written. To skip a file by these two spares
// most of the work of a run over a long journal. A wrong word in the header must not hide a file,
// so the caller compares both with the entries themselves. The price: if the clock was set while
// the file was written, entries between may be earlier or later than both. If the last entry is
// earlier than the first, we see that the clock was set, and read the file. Otherwise such entries
// are lost; to find them we would have to look at every entry.
bool JournalStore::State::outsideRange(const JournalHeader& header) const {
  if (header.wasBeingWritten() || header.headRealtime == 0 ||
      header.tailRealtime < header.headRealtime || header.tailRealtime >= journal_format::kMaxTime)
    return false;
  return header.tailRealtime < range.start || header.headRealtime >= range.end;
}

// Why the store as a whole cannot be used; nothing if it can. One file that can be read is enough;
// the report tells what was wrong with the others.
std::optional<PlatformError> JournalStore::State::failure(const std::string& place) const {
  // After a stop the files were not all opened, and an empty store would be a wrong reason.
  if (usableFiles != 0 || stop.load(std::memory_order_relaxed)) return std::nullopt;
  if (facts.files.empty())
    return PlatformError{ErrorCode::notAStore,
                         place + ": holds no *.journal, *.journal~ or *.export file"};
  const FileReport& first = facts.files.front();
  return PlatformError{firstFailure, first.path + ": " + first.skipped.value_or("not readable")};
}

JournalStore::JournalStore(std::unique_ptr<State> state) : state_(std::move(state)) {}
JournalStore::~JournalStore() = default;

std::variant<std::unique_ptr<JournalStore>, PlatformError> JournalStore::open(
    const std::optional<std::string>& path, TimeRange range, FieldTokenizer& tokenizer,
    const StopFlag& stop, ServiceStatus* status) {
  auto found = openStoreFiles(path, kMaxFiles, stop, status);
  if (auto* error = std::get_if<PlatformError>(&found)) return std::move(*error);
  const std::string place = path.value_or("the machine's journal");
  auto state = std::make_unique<State>(range, tokenizer, stop, status);
  state->openFiles(std::get<StoreFiles>(std::move(found)));
  if (auto error = state->failure(place)) return std::move(*error);
  return std::unique_ptr<JournalStore>(new JournalStore(std::move(state)));
}

std::unique_ptr<JournalStore> JournalStore::ofExport(UniqueFd stream, std::string name,
                                                     TimeRange range, FieldTokenizer& tokenizer,
                                                     const StopFlag& stop) {
  StoreFiles files;
  files.files.push_back({std::move(name), StoreFileKind::exportStream, std::move(stream), 0});
  auto state = std::make_unique<State>(range, tokenizer, stop, nullptr);
  state->openFiles(std::move(files));
  return std::unique_ptr<JournalStore>(new JournalStore(std::move(state)));
}

// The state itself is the stream: it sees every entry that the merge delivers, in or out of range.
EntryStream& JournalStore::entries() { return *state_; }

StoreReport JournalStore::report() const {
  StoreReport report = state_->facts;
  StoreReading& reading = report.reading;
  uint64_t inFiles = 0;
  for (const FileReport& file : report.files) {
    inFiles += file.entriesRead;
    addFile(file, reading);
  }
  TESSEL_INVARIANT(inFiles == reading.entriesRead);  // each delivered entry counts for one file
  reading.duplicateEntries = state_->merger.duplicates();
  reading.sequenceGaps = state_->numbers.gaps();
  reading.missingNumbers = state_->numbers.missing();
  // The daemon removes old files, so missing numbers alone are no loss. Beside one they tell its
  // size.
  if (!reading.losses.empty())
    reading.losses.add(LossCode::entriesMissing,
                       "numbers that no file holds: vacuumed, not exported or lost, in " +
                           std::to_string(reading.sequenceGaps) +
                           (reading.sequenceGaps == 1 ? " gap" : " gaps"),
                       {}, reading.missingNumbers);
  state_->tokenizer.addDropped(reading.losses);
  return report;
}

}  // namespace tessel
