// Reading a store as a run does, once or again and again.
//
// Following reads the store anew every quarter of a second from shortly before its last entry, and
// passes on what it has not passed on before. A watch on the files would not spare that: it says
// that a file changed, not which entries are new, and an entry of another file may be stamped
// earlier than the last one we saw. The price is to read the last seconds of the store in each
// look.

#include "tesselctl/reading/DryRun.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <thread>
#include <unordered_map>
#include <utility>

#include "linux/SystemFacts.h"
#include "os/Files.h"

namespace tessel::ctl {

namespace {

// "Within a second" is what we promise for --follow.
constexpr std::chrono::milliseconds kLookInterval{250};
// Microseconds. The daemon stamps an entry before it writes it, and one file may be written later
// than another. An entry stamped this long before the latest one may still be new.
constexpr uint64_t kOverlap = 5'000'000;
// The listener is told every 4,096 entries: it looks at the clock, which would slow each entry
// down.
constexpr uint64_t kProgressMask = 0xfff;

// Passes on the entries of another stream and tells a listener how far it is.
class WatchedStream final : public EntryStream {
 public:
  WatchedStream(EntryStream& source, TimeRange range, const DryRun::Progress& progress)
      : source_(source), range_(range), progress_(progress) {}

  bool next() override {
    if (!source_.next()) return false;
    if (entries_ == 0) oldest_ = std::clamp(source_.header().realtime, range_.start, range_.end);
    if ((++entries_ & kProgressMask) == 0 && progress_) progress_(part(), entries_);
    return true;
  }
  const EntryHeader& header() const override { return source_.header(); }
  std::span<const FieldToken> tokens() override { return source_.tokens(); }

 private:
  double part() const {
    const uint64_t at = std::clamp(source_.header().realtime, oldest_, range_.end);
    return oldest_ == range_.end
               ? 1
               : static_cast<double>(at - oldest_) / static_cast<double>(range_.end - oldest_);
  }

  EntryStream& source_;
  const TimeRange range_;
  const DryRun::Progress& progress_;
  uint64_t entries_ = 0;
  uint64_t oldest_ = 0;
};

// Knows which entries were passed on in an earlier look. Export files may hold several entries with
// the same header, so we count them: the third one of a kind is new after a look that saw two.
class NewEntries {
 public:
  // The time from which the next look must read.
  uint64_t start() const { return start_; }
  explicit NewEntries(uint64_t start) : start_(start), latest_(start) {}

  void beginLook() { inThisLook_.clear(); }
  bool isNew(const EntryHeader& header) {
    const uint64_t identity = identityOf(header);
    latest_ = std::max(latest_, header.realtime);
    const uint32_t number = ++inThisLook_[identity].number;
    inThisLook_[identity].realtime = header.realtime;
    const auto known = passedOn_.find(identity);
    return known == passedOn_.end() || number > known->second.number;
  }
  // An entry with a time in the future must not move the window there: entries of today would then
  // count as old. So the window never passes `now`.
  void endLook(uint64_t now) {
    for (const auto& [identity, seen] : inThisLook_) {
      Seen& known = passedOn_[identity];
      known.number = std::max(known.number, seen.number);
      known.realtime = seen.realtime;
    }
    const uint64_t reached = std::min(latest_, now);
    start_ = std::max(start_, reached - std::min(reached, kOverlap));
    std::erase_if(passedOn_, [this](const auto& seen) { return seen.second.realtime < start_; });
  }

 private:
  struct Seen {
    uint32_t number = 0;
    uint64_t realtime = 0;
  };
  // Entries are told apart by 64 bits of their header, so that a busy store needs little memory. If
  // two collide, the later one is not shown.
  static uint64_t identityOf(const EntryHeader& header) {
    const uint64_t parts[] = {header.sequenceNumber, header.monotonic, header.realtime,
                              header.contentHash};
    std::string bytes(reinterpret_cast<const char*>(parts), sizeof parts);
    bytes.append(reinterpret_cast<const char*>(header.bootId.data()), header.bootId.size());
    bytes.append(reinterpret_cast<const char*>(header.sequenceId.data()), header.sequenceId.size());
    return hashText(bytes);
  }

  uint64_t start_;
  uint64_t latest_;
  std::unordered_map<uint64_t, Seen> passedOn_;
  std::unordered_map<uint64_t, Seen> inThisLook_;
};

class NewEntryStream final : public EntryStream {
 public:
  NewEntryStream(EntryStream& source, NewEntries& news) : source_(source), news_(news) {}

  bool next() override {
    while (source_.next()) {
      if (news_.isNew(source_.header())) return true;
    }
    return false;
  }
  const EntryHeader& header() const override { return source_.header(); }
  std::span<const FieldToken> tokens() override { return source_.tokens(); }

 private:
  EntryStream& source_;
  NewEntries& news_;
};

uint64_t microsecondsSince1970(Date date) {
  return static_cast<uint64_t>(std::max<Date::rep>(0, date.time_since_epoch().count()));
}

}  // namespace

DryRun::DryRun(std::optional<std::string> store, Visitor visitor)
    : store_(std::move(store)), visitor_(std::move(visitor)) {
  const auto visit = [this](const std::shared_ptr<const TesselObject>& object) {
    refused_ = refused_ || !visitor_(*object, extractor_.currentEntry());
    return !refused_;
  };
  extractor_.setIntervalCompletionProcessingBlock(visit);
  extractor_.setAnimationIntervalCompletionProcessingBlock(visit);
  extractor_.setEmitEventProcessingBlock(visit);
  extractor_.setBuildAnimationCompositeIntervalTimelines(false);
}

// The stream closes its descriptor at the end, so it gets one of its own.
std::variant<std::unique_ptr<JournalStore>, PlatformError> DryRun::openStore(TimeRange range) {
  if (store_ != kStandardInput)
    return JournalStore::open(store_, range, extractor_.tokenizer(), extractor_.stopFlag());
  UniqueFd input(::fcntl(STDIN_FILENO, F_DUPFD_CLOEXEC, 0));
  if (!input.valid())
    return PlatformError{codeOf(errno), std::string(kStandardInputName) + ": " + errorWords(errno)};
  return JournalStore::ofExport(std::move(input), std::string(kStandardInputName), range,
                                extractor_.tokenizer(), extractor_.stopFlag());
}

std::optional<PlatformError> DryRun::readOnce(TimeRange range,
                                              const std::function<void(EntryStream&)>& process) {
  auto opened = openStore(range);
  if (auto* error = std::get_if<PlatformError>(&opened)) return std::move(*error);
  JournalStore& store = *std::get<std::unique_ptr<JournalStore>>(opened);
  process(store.entries());
  storeReport_ = store.report();
  return {};
}

std::optional<PlatformError> DryRun::read(const Period& period, const Progress& progress) {
  const TimeRange range{microsecondsSince1970(period.start), microsecondsSince1970(period.end)};
  extractor_.startLossesAt(range.start);
  return readOnce(range, [&](EntryStream& entries) {
    WatchedStream watched(entries, range, progress);
    extractor_.processEntries(watched);
  });
}

// A journal may come later, or be back in a moment where its files rotate: nothing is there, or a
// file was made and has no header yet. A file that the user names and that is no journal stays
// none.
bool DryRun::mayStillCome(const PlatformError& error) const {
  if (error.code == ErrorCode::notFound) return true;
  std::error_code ignored;
  return error.code == ErrorCode::notAStore &&
         (!store_ || std::filesystem::is_directory(*store_, ignored));
}

std::optional<PlatformError> DryRun::follow(
    Date start, const std::function<void()>& afterEachLook,
    const std::function<void(const std::string& reason)>& onWait) {
  bool waiting = false;
  SystemClock clock;
  NewEntries news(microsecondsSince1970(start));
  while (!refused_) {
    news.beginLook();
    auto error = readOnce({news.start(), UINT64_MAX}, [&](EntryStream& entries) {
      NewEntryStream fresh(entries, news);
      extractor_.processEntries(fresh);
    });
    if (error && !mayStillCome(*error)) return error;
    if (error && !std::exchange(waiting, true)) onWait(error->words);
    // Only a look that succeeded moves the window. Entries of a failed one would be lost.
    if (!error) {
      waiting = false;
      news.endLook(microsecondsSince1970(clock.now()));
    }
    afterEachLook();
    std::this_thread::sleep_for(kLookInterval);
  }
  return {};
}

}  // namespace tessel::ctl
