// Whether an entry is wanted, the tokens of one that is, and what is wrong with the file.

#include "journal/JournalEntryStream.h"

#include <algorithm>
#include <utility>

#include "journal/JournalHash.h"

namespace tessel {

using namespace journal_format;

namespace {

// Returned instead of a token if a data object holds no FIELD=value. No token has this value.
constexpr FieldToken kDamaged = UINT32_MAX;

// Bytes. Most data objects are shorter than this. A value that is not in the window is read with
// two calls if it is longer, and otherwise the kernel copies less.
constexpr size_t kUsualText = 440;

// Nanoseconds that it takes to read a value and each byte of it.
constexpr uint64_t kValue = 500;
constexpr uint64_t kByte = 1;
// Nanoseconds that it takes to decompress a value, and for each byte of it before and after. XZ and
// ZSTD take a few bytes for the tables of a block, which take microseconds to build.
struct Decompression {
  uint64_t value;
  uint64_t byteBefore;
  uint64_t byteAfter;
};
constexpr Decompression costOf(uint8_t compression) {
  if (compression == kXz) return {10'000, 60, 20};
  return {1000, compression == kZstd ? uint64_t{60} : kByte, kByte};
}
// A file whose every value is compressed stays below 100 ns for each byte of the file.
constexpr uint64_t kAllowedPerByte = 200;

// Bytes from one item of an entry to the next.
template <typename Item>
constexpr size_t kStep = sizeof(Item) == sizeof(uint32_t) ? kCompactEntryItemSize : kEntryItemSize;

std::string_view textOf(std::span<const uint8_t> bytes) {
  return {reinterpret_cast<const char*>(bytes.data()), bytes.size()};
}

}  // namespace

JournalEntryStream::JournalEntryStream(std::unique_ptr<JournalFile> file, uint32_t number,
                                       const Context& context)
    : owned_(std::move(file)),
      file_(*owned_),
      number_(number),
      context_(context),
      generation_(context.tokenizer.generation()),
      allowed_(kAllowedPerByte * file_.file().size()),
      marks_(context.marks, context.resources.placesLeft),
      walk_(file_, marks_, context.report, context.stop) {}

bool JournalEntryStream::next() {
  if (walk_.next()) {
    checkTime();
    return true;
  }
  // After a stop the rest of the file is not missing, only unread.
  if (!stopped()) finish();
  return false;
}

// No hash covers the times and the boot of an entry, and a wrong time moves it out of the range. In
// one boot the difference of the two clocks changes only when the clock is set, and then all later
// entries have the new one. So an entry that differs from its neighbours is damaged, if these
// agree.
void JournalEntryStream::checkTime() {
  constexpr uint64_t kMinute = 60'000'000;  // the clock may drift, and is set in small steps often
  const EntryHeader& entry = walk_.header();
  const uint64_t first = file_.header().headRealtime;
  if (walk_.entriesFound() == 1 && first != 0 && first != entry.realtime)
    context_.report.addProblem("first entry with another time than the header", walk_.offset());
  const uint64_t difference = entry.realtime - entry.monotonic;
  const bool usual =
      difference - usualDifference_ + kMinute <= 2 * kMinute && sameId(entry.bootId, usualBoot_);
  if (usual && unusualEntry_ == 0) [[likely]]
    return;
  if (usual) context_.report.addProblem("entry with wrong times", unusualEntry_);
  if (!usual && (unusualEntry_ != 0 || walk_.entriesFound() == 1)) {
    usualBoot_ = entry.bootId;
    usualDifference_ = difference;
  } else if (!usual) {
    unusualEntry_ = walk_.offset();
    return;
  }
  unusualEntry_ = 0;
}

// Reports once what the file should have held. next() may be called again after the end.
void JournalEntryStream::finish() {
  if (std::exchange(finished_, true)) return;
  Losses& problems = context_.report.problems;
  const uint64_t counted = file_.header().entryCount;
  const uint64_t missing = counted - std::min(counted, walk_.entriesFound());
  // When the daemon removes a file it also frees its blocks, and those that we have not read are
  // zeros from then on. Whatever looks damaged then is not.
  if ((missing != 0 || !problems.empty()) && file_.file().removed()) {
    problems = {};
    problems.add(LossCode::entriesMissing, "the file was removed while it was read", {},
                 std::max<uint64_t>(missing, 1));
    return;
  }
  // When the daemon closes a file it cuts off the end that it has not used. Nothing is lost then,
  // so a failed read alone is no problem.
  if (file_.file().failed() && (missing != 0 || !problems.empty()))
    context_.report.addProblem(
        file_.file().wasCut() ? "cut short while it was read" : "not readable",
        file_.file().size());
  context_.report.addProblem("entries missing", file_.objectsEnd(), missing);
  if (walk_.entriesFound() != 0 && lastHasOtherTimes())
    context_.report.addProblem("last entry with other times than the header", walk_.offset());
}

// The last entry has no later neighbour. The header has its times instead. While a file is being
// written, another entry may come at any moment. So we look again before we tell.
bool JournalEntryStream::lastHasOtherTimes() {
  const auto differs = [&](const JournalHeader& header) {
    return walk_.header().realtime != header.tailRealtime ||
           walk_.header().monotonic != header.tailMonotonic;
  };
  if (!file_.beingWritten()) return differs(file_.header());
  for (int look = 0; look < 2; ++look) {
    const auto now = file_.headerNow();
    if (!now || now->entryCount != walk_.entriesFound() || !differs(*now)) return false;
  }
  return true;
}

std::span<const FieldToken> JournalEntryStream::tokens() {
  const size_t count =
      file_.header().compact() ? collectTokens<uint32_t>() : collectTokens<uint64_t>();
  return {context_.resources.tokens.data(), count};
}

// Returns how many tokens the entry has.
template <typename Item>
size_t JournalEntryStream::collectTokens() {
  const size_t all = file_.itemCount(walk_.size());
  const size_t count = std::min(all, JournalFile::kMaxItems);
  const uint64_t offset = walk_.offset() + kEntryItemsAt;
  // If the window moves, it begins at firstFresh(), so that it also holds the data objects that
  // were written for this entry.
  const uint8_t* items = file_.file().at(offset, count * file_.itemSize(), walk_.firstFresh());
  if (items == nullptr) {
    context_.report.addProblem("entry damaged", walk_.offset());
    return 0;
  }
  comparable_ = all == count;
  if (!comparable_) context_.report.addProblem("entry with too many fields", walk_.offset());
  if (marks_.any() && !hasMark<Item>(items, count)) return 0;
  return tokensOf<Item>(items, count);
}

// This and tokensOf() are the innermost loops of the service, with some 20 rounds for each entry.
// They are templates, so that they need not ask for the layout in each round.
template <typename Item>
bool JournalEntryStream::hasMark(const uint8_t* items, size_t count) {
  const auto at = [](const uint8_t* item, size_t ahead) -> uint64_t {
    return load<Item>(item + ahead * kStep<Item>);
  };
  // The marks of a program's entries often stand in the same place.
  if (markIndex_ < count && marks_.isMark(at(items, markIndex_))) return true;
  DataMarks::Plain plain(marks_);
  const uint8_t* item = items;
  const uint8_t* const end = items + count * kStep<Item>;
  for (const uint8_t* last = end - count % 4 * kStep<Item>; item != last; item += 4 * kStep<Item>)
    if (!plain.hasAll(at(item, 0), at(item, 1), at(item, 2), at(item, 3))) [[unlikely]]
      break;
  for (; item != end; item += kStep<Item>) {
    const uint64_t offset = at(item, 0);
    if (plain.has(offset)) [[likely]]
      continue;
    if (isMark(offset)) {
      markIndex_ = static_cast<size_t>(item - items) / kStep<Item>;
      return true;
    }
    plain = DataMarks::Plain(marks_);
  }
  return false;
}

// Looks at the data object if the walk did not show it to `marks_`. One that cannot be read counts
// as a mark: its entry is then read, and the damage told. So does one whose state cannot be
// remembered, because we would look at it again for each entry that has it. The tokens of these
// entries are in the cache, so to collect them costs less.
bool JournalEntryStream::isMark(uint64_t offset) {
  if (const auto known = marks_.at(offset); known != DataMarks::unknown)
    return known == DataMarks::mark;
  DataObject data;
  if (!file_.readData(offset, kMaxMark, context_.resources.data, data)) return true;
  if (data.compression == 0) return marks_.see(offset, textOf(data.head)) != DataMarks::plain;
  const std::span<uint8_t> text = std::span(context_.resources.text).first(kMaxMark);
  const auto result = decompress(data, text);
  return !result || result->produced == 0 ||
         marks_.see(offset, textOf(text.first(result->produced))) != DataMarks::plain;
}

// The loop writes each token and then moves on only if the token is wanted: that spares a branch
// which the processor cannot predict.
template <typename Item>
size_t JournalEntryStream::tokensOf(const uint8_t* items, size_t count) {
  context_.resources.tokenCache.useGeneration(generation_);
  const TokenCache::OfFile cache(context_.resources.tokenCache, number_);
  FieldToken* const tokens = context_.resources.tokens.data();
  size_t kept = 0;
  uint32_t hash = 0;
  fresh_ = walk_.firstFresh();
  for (const uint8_t *item = items, *end = items + count * kStep<Item>; item != end;
       item += kStep<Item>) {
    const auto offset = load<Item>(item);
    const TokenCache::Value* known = cache.findAtOnce(offset);
    const TokenCache::Value value = known != nullptr ? *known : missed(offset);
    tokens[kept] = value.token;
    kept += value.token != kNoToken;
    hash ^= value.hash;
  }
  // Half of the hash is enough: one damaged entry in four billion passes.
  if (hash != static_cast<uint32_t>(walk_.header().contentHash) && comparable_) [[unlikely]]
    return intactTokensOf<Item>(items, count);
  return kept;
}

// The token of a field that a single look does not find. We look at the stop flag here and not for
// each field: only a miss reads and decompresses, which can take long. After a stop the entry ends
// without its further tokens.
TokenCache::Value JournalEntryStream::missed(uint64_t offset) {
  if (stopped()) return {};
  if (offset < fresh_ || offset >= walk_.offset()) return rememberedOrNew(offset);
  fresh_ = offset + 1;
  return newTokenAt(offset);
}

TokenCache::Value JournalEntryStream::rememberedOrNew(uint64_t offset) {
  if (!TokenCache::takes(offset)) return newTokenAt(offset);
  const TokenCache::OfFile cache(context_.resources.tokenCache, number_);
  const TokenCache::Value* known = cache.find(offset);
  return known != nullptr ? *known : newTokenAt(offset);
}

// The tokens of an entry that does not match its hash, without those of damaged data objects.
template <typename Item>
size_t JournalEntryStream::intactTokensOf(const uint8_t* items, size_t count) {
  FieldToken* const tokens = context_.resources.tokens.data();
  size_t kept = 0;
  bool damaged = false;
  for (size_t i = 0; i < count && !stopped(); ++i) {
    const uint64_t offset = load<Item>(items + i * kStep<Item>);
    DataObject data;
    const auto text = textAt(offset, data);
    if (!text || !file_.hashOfData(text->head, data.hash)) {
      context_.report.addProblem("data object damaged", offset);
      damaged = true;
      continue;
    }
    const FieldToken token = tokenOf(*text);
    if (token != kNoToken && token != kDamaged) tokens[kept++] = token;
  }
  if (damaged || stopped()) return kept;
  context_.report.addProblem("entry damaged", walk_.offset());
  return 0;
}

// Reads a data object and shows it to the tokenizer.
TokenCache::Value JournalEntryStream::newTokenAt(uint64_t offset) {
  if (const auto known = longTexts_.find(offset); known != longTexts_.end()) {
    comparable_ = false;
    if (longTextsGeneration_ == generation_) return {known->second};
    longTexts_.clear();
  }
  DataObject data;
  const auto text = textAt(offset, data);
  const FieldToken token = text ? tokenOf(*text) : kDamaged;
  if (token == kDamaged) {
    context_.report.addProblem("data object damaged", offset);
    comparable_ = false;
    return {};
  }
  comparable_ = comparable_ && text->whole;
  const TokenCache::Value value{token, static_cast<uint32_t>(lookup3(text->head))};
  // The hash of a part is no hash, so the cache must not have it.
  if (text->whole && TokenCache::takes(offset)) remember(offset, data, value);
  if (!text->whole && longTexts_.size() < kMaxLongTexts) {
    longTexts_.emplace(offset, token);
    longTextsGeneration_ = generation_;
  }
  return value;
}

// A data object counts the entries that have it. If one was written for this entry and no other has
// it, nobody will ask for it again. But every compressed value is remembered: if its count is
// wrong, decompressing it again and again would be slow. A wrong count costs nothing else.
void JournalEntryStream::remember(uint64_t offset, const DataObject& data,
                                  TokenCache::Value value) {
  const TokenCache::OfFile cache(context_.resources.tokenCache, number_);
  const bool fresh = offset >= walk_.firstFresh();
  if (fresh && data.entryCount == 2)
    cache.storeAwaited(offset, value);
  else if (!fresh || data.entryCount != 1 || data.compression != 0)
    cache.storeRecurring(offset, value);
}

// The text of the data object at `offset`, whole if it is not too long to be hashed.
std::optional<JournalEntryStream::Text> JournalEntryStream::textAt(uint64_t offset,
                                                                   DataObject& data) {
  JournalReadResources& resources = context_.resources;
  if (!allows(kValue) || !file_.readData(offset, kUsualText, resources.data, data))
    return std::nullopt;
  if (data.compression != 0) {
    const auto result = decompress(data, resources.text);
    if (!result || result->produced == 0) return std::nullopt;
    const auto head = std::span<const uint8_t>(resources.text).first(result->produced);
    return Text{head, head.size() + !result->complete, result->complete};
  }
  const bool isLong = data.payloadSize > JournalReadResources::kLongestHashed;
  const size_t needed = isLong ? kMaxFieldHead : JournalReadResources::kLongestHashed;
  if (!data.isWhole() && !file_.readData(offset, needed, resources.data, data)) return std::nullopt;
  allows(data.head.size() * kByte);
  return Text{data.head, data.payloadSize, data.isWhole()};
}

FieldToken JournalEntryStream::tokenOf(const Text& text) {
  const std::string_view head = textOf(text.head).substr(0, kMaxFieldHead);
  const size_t nameLength = head.substr(0, kMaxFieldNameLength + 1).find('=');
  if (nameLength == std::string_view::npos || nameLength == 0) return kDamaged;
  return context_.tokenizer.tokenFor(head.substr(0, nameLength), head.substr(nameLength + 1),
                                     text.size - nameLength - 1);
}

// A file that was made to cost time can let thousands of data objects share the same bytes, each of
// which takes long to decompress, and can name one far value in every four bytes. So what the
// values cost is estimated. Beyond the allowance of the file all further ones count as damaged. The
// counts are equal on every machine, so the report is, too.
bool JournalEntryStream::allows(uint64_t nanoseconds) {
  work_ += nanoseconds;
  if (work_ <= allowed_) [[likely]]
    return true;
  uint64_t& spare = context_.resources.spareWork;
  const uint64_t over = std::min(nanoseconds, work_ - allowed_);
  const bool enough = over <= spare;
  spare -= std::min(over, spare);
  return enough;
}

std::optional<Decompressor::Result> JournalEntryStream::decompress(const DataObject& data,
                                                                   std::span<uint8_t> target) {
  const Decompression cost = costOf(data.compression);
  if (!allows(cost.value)) return std::nullopt;
  uint64_t bytes = 0;
  const Decompressor::Source source = [&](uint64_t position, std::span<uint8_t> input) {
    const uint64_t left = data.payloadSize - std::min(position, data.payloadSize);
    const auto length = static_cast<size_t>(std::min<uint64_t>(left, input.size()));
    const size_t got = file_.file().read(data.payloadOffset + position, input.first(length));
    bytes += got;
    return stopped() ? 0 : got;
  };
  const auto result = context_.resources.decompressor.decompress(data.compression, source, target);
  allows(bytes * cost.byteBefore + (result ? result->produced : target.size()) * cost.byteAfter);
  return result;
}

}  // namespace tessel
