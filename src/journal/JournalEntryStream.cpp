// Three parts: where the next entry is, what is wrong with the file, and the tokens of an entry.

#include "journal/JournalEntryStream.h"

#include <algorithm>
#include <string_view>
#include <utility>

#include "platform/Invariant.h"

namespace tessel {

using namespace journal_format;

namespace {
// Returned instead of a token if a data object holds no FIELD=value. No token has this value.
constexpr FieldToken kDamaged = UINT32_MAX;
}  // namespace

JournalEntryStream::JournalEntryStream(UniqueFd fd, uint64_t size, const JournalHeader& header,
                                       uint32_t number, const Context& context)
    : file_(std::move(fd), size, header, context.resources.windows),
      number_(number),
      context_(context),
      chain_(file_, header.entryArray, header.entryCount),
      marked_(
          MarkedEntries::of(file_, context.marks, context.resources.entryListsLeft, context.stop)),
      searchedTo_(header.headerSize),
      firstFresh_(header.headerSize) {
  entry_.sequenceId = header.sequenceId;
}

bool JournalEntryStream::next() {
  while (!context_.stop.load(std::memory_order_relaxed)) {
    const uint64_t offset = search_ || pending_ != 0 ? nextFound() : nextListed();
    if (offset == 0) {
      // After a stop the rest of the file is not missing, only unread.
      if (!context_.stop.load(std::memory_order_relaxed)) finish();
      return false;
    }
    if (take(offset)) return true;
  }
  return false;
}

// The offset of the next entry that the chain lists. If the chain has a gap before that entry, the
// stream searches the gap first.
uint64_t JournalEntryStream::nextListed() {
  if (finished_) return 0;
  const uint64_t offset = chain_.next();
  finished_ = offset == 0;
  if (!chain_.gapBefore()) [[likely]]
    return offset;
  searchUpTo(offset);
  return nextFound();
}

// The offset of the next entry while the stream searches a gap. First come the entries that the
// search finds, then the listed entry behind the gap, then the further entries of the chain.
uint64_t JournalEntryStream::nextFound() {
  if (search_) {
    if (const auto found = search_->next()) return *found;
    endSearch();
  }
  if (pending_ != 0) return std::exchange(pending_, 0);
  return nextListed();
}

// Makes the entry at `offset` the current one; false if no valid entry is there. Then its offset or
// its size may be wrong, and other entries may stand in its place. So the stream searches up to the
// next listed entry.
bool JournalEntryStream::take(uint64_t offset) {
  const uint64_t size = file_.readEntry(offset, searchedTo_, entry_);
  if (size == 0) {
    context_.report.addProblem("entry damaged", offset);
    const uint64_t next = chain_.next();
    finished_ = next == 0;
    searchUpTo(next);
    return false;
  }
  TESSEL_INVARIANT(offset > entryOffset_);  // so no entry is delivered twice
  entryOffset_ = offset;
  entrySize_ = size;
  firstFresh_ = searchedTo_;
  searchedTo_ = alignUp(offset + size);
  ++delivered_;
  // We read the lists when we opened the file. An entry beyond the count was added later, so it may
  // have a mark and still be in no list.
  entryMarked_ = marked_ == nullptr || delivered_ > file_.header().entryCount || isMarked(offset);
  return true;
}

bool JournalEntryStream::isMarked(uint64_t offset) {
  if (!marked_->has(offset)) [[likely]]
    return false;
  // Without the lists we look into every further entry, so damage costs time, not entries.
  if (marked_->missed()) context_.report.addProblem("list of entries damaged", offset);
  if (!marked_->usable()) marked_.reset();
  return true;
}

// Starts to search the part before `listed`, the next entry of the chain; 0: up to the end.
void JournalEntryStream::searchUpTo(uint64_t listed) {
  if (chain_.gapBefore()) context_.report.addProblem("entry array damaged", chain_.problemAt());
  // The search may find entries that are in no list, and may pass over listed ones, which would
  // look as if the lists were wrong. So we look into every entry from here on.
  marked_.reset();
  pending_ = listed;
  const uint64_t end = listed == 0 ? file_.objectsEnd() : listed;
  search_.emplace(file_, std::min(searchedTo_, end), end, context_.stop);
}

void JournalEntryStream::endSearch() {
  if (search_->damagedPlaces() != 0)
    context_.report.addProblem("objects damaged", search_->firstDamage(), search_->damagedPlaces());
  search_.reset();
  searchedTo_ = std::max(searchedTo_, pending_);
}

// Reports once what the file should have held. next() may be called again after the end.
void JournalEntryStream::finish() {
  if (std::exchange(reported_, true)) return;
  const uint64_t expected = file_.header().entryCount;
  // We asked about no entry beyond the count, so then a list may rightly wait for one.
  if (marked_ && marked_->awaitsMore() && delivered_ <= expected)
    context_.report.addProblem("list of entries damaged", file_.objectsEnd());
  // When the daemon closes a file it cuts off the end that it has not used. Nothing is lost then,
  // so a failed read alone is no problem.
  if (file_.file().failed() && (expected > delivered_ || !context_.report.problems.empty()))
    context_.report.addProblem("cut short or not readable", file_.file().size());
  if (expected > delivered_)
    context_.report.addProblem("entries missing", file_.objectsEnd(), expected - delivered_);
}

Entry JournalEntryStream::entry() {
  if (!entryMarked_) return {entry_, {}};
  const size_t count = collectTokens();
  return {entry_, std::span(context_.resources.tokens).first(count)};
}

// Returns how many tokens the entry has.
size_t JournalEntryStream::collectTokens() {
  const size_t all = file_.itemCount(entrySize_);
  const size_t count = std::min(all, JournalFile::kMaxItems);
  if (all > count) context_.report.addProblem("entry with too many fields", entryOffset_);
  const uint64_t offset = entryOffset_ + kEntryItemsAt;
  // If the window moves, it begins at firstFresh_, so that it also holds the data objects that were
  // written for this entry.
  const uint8_t* items = file_.file().at(offset, count * file_.itemSize(), firstFresh_);
  if (items == nullptr) {
    context_.report.addProblem("entry damaged", entryOffset_);
    return 0;
  }
  return file_.header().compact() ? tokensOf<uint32_t>(items, count)
                                  : tokensOf<uint64_t>(items, count);
}

// This is the innermost loop of the service, with some 20 rounds for each entry. It is a template,
// so that it need not ask for the layout in each round. It writes each token and then moves on only
// if the token is wanted: that spares a branch which the processor cannot predict.
template <typename Item>
size_t JournalEntryStream::tokensOf(const uint8_t* items, size_t count) {
  context_.resources.tokenCache.useGeneration(context_.tokenizer.generation());
  const TokenCache::OfFile cache(context_.resources.tokenCache, number_);
  const size_t step = file_.itemSize();
  FieldToken* const tokens = context_.resources.tokens.data();
  FieldToken* kept = tokens;
  for (size_t i = 0; i < count; ++i) {
    const uint64_t offset = load<Item>(items + i * step);
    FieldToken token = offset <= TokenCache::kMaxOffset ? cache.find(offset) : TokenCache::kUnknown;
    if (token == TokenCache::kUnknown) [[unlikely]] {
      // We look at the flag here and not for each field: only a miss reads and decompresses, which
      // can take long.
      if (context_.stop.load(std::memory_order_relaxed)) break;
      token = newTokenAt(offset);
    }
    *kept = token;
    kept += token != kNoToken;
  }
  return static_cast<size_t>(kept - tokens);
}

// Reads a data object and shows it to the tokenizer. The cache does not remember every token. It
// must not remember an invalid object, because that may overlap a valid one and have the same key.
// It need not remember a value that was written for this entry and says that no other has it:
// nobody will ask for it again, and it would push out a value that recurs. It does remember every
// compressed value: if the value's claim is wrong, decompressing it again and again would be slow.
FieldToken JournalEntryStream::newTokenAt(uint64_t offset) {
  DataObject data;
  if (!file_.readData(offset, context_.resources.data, data)) {
    context_.report.addProblem("data object damaged", offset);
    return kNoToken;
  }
  FieldToken token =
      data.compression == 0 ? textToken(data.head, data.payloadSize) : decompressToken(data);
  if (token == kDamaged) {
    context_.report.addProblem("data object damaged", offset);
    token = kNoToken;
  }
  if (offset < firstFresh_ || data.entryCount != 1 || data.compression != 0)
    TokenCache::OfFile(context_.resources.tokenCache, number_).store(offset, token);
  return token;
}

FieldToken JournalEntryStream::textToken(std::span<const uint8_t> head, uint64_t size) {
  const std::string_view text(reinterpret_cast<const char*>(head.data()), head.size());
  const size_t nameLength = text.substr(0, kMaxFieldNameLength + 1).find('=');
  if (nameLength == std::string_view::npos || nameLength == 0) return kDamaged;
  return context_.tokenizer.tokenFor(text.substr(0, nameLength), text.substr(nameLength + 1),
                                     size - nameLength - 1);
}

// Decompresses the name first, and the value only if the name is wanted. Most compressed values are
// long messages, which no tokenizer of the service wants.
FieldToken JournalEntryStream::decompressToken(const DataObject& data) {
  const Decompressor::Source source = [&](uint64_t position, std::span<uint8_t> target) {
    const uint64_t left = data.payloadSize - std::min(position, data.payloadSize);
    const auto length = static_cast<size_t>(std::min<uint64_t>(left, target.size()));
    return file_.file().read(data.payloadOffset + position, target.first(length));
  };
  Decompressor& decompressor = context_.resources.decompressor;
  const std::span<uint8_t> text = context_.resources.text;
  const auto name =
      decompressor.decompress(data.compression, source, text.first(kMaxFieldNameLength + 1));
  if (!name) return kDamaged;
  const std::string_view start(reinterpret_cast<const char*>(text.data()), name->produced);
  const size_t nameLength = start.find('=');
  if (nameLength == std::string_view::npos || nameLength == 0) return kDamaged;
  if (!context_.tokenizer.wants(start.substr(0, nameLength))) return kNoToken;
  const auto whole = decompressor.decompress(data.compression, source, text);
  if (!whole) return kDamaged;
  return textToken(text.first(whole->produced),
                   whole->complete ? whole->produced : text.size() + 1);
}

}  // namespace tessel
