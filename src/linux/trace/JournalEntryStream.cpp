#include "linux/trace/JournalEntryStream.h"

#include <algorithm>
#include <string_view>
#include <utility>

namespace tessel {

using namespace journal_format;

JournalEntryStream::JournalEntryStream(UniqueFd fd, uint64_t size, const JournalHeader& header,
                                       uint32_t number, const Context& context)
    : file_(std::move(fd), size, header, context.resources.windows),
      number_(number),
      context_(context),
      chain_(file_),
      searchedTo_(header.headerSize),
      firstFresh_(header.headerSize) {}

bool JournalEntryStream::next() {
  while (!context_.stop.load(std::memory_order_relaxed)) {
    const auto offset = nextOffset();
    if (!offset) {
      // An end that comes with the stop is none of the file's.
      if (!context_.stop.load(std::memory_order_relaxed)) finish();
      return false;
    }
    if (take(*offset)) return true;
  }
  return false;
}

// Where the next entry should be, by the search that is under way or else by the chain.
std::optional<uint64_t> JournalEntryStream::nextOffset() {
  for (;;) {
    if (search_) {
      if (const auto found = search_->next()) return found;
      endSearch();
      if (pending_) return std::exchange(pending_, std::nullopt);
    }
    if (finished_) return std::nullopt;
    const EntryChain::Step step = chain_.next();
    finished_ = !step.offset;
    if (!step.gapBefore) return step.offset;
    context_.report.addProblem("entry array damaged", chain_.problemAt());
    pending_ = step.offset;
    searchUntil(step.offset.value_or(file_.objectsEnd()));
  }
}

// Makes the entry at `offset` the current one; false where it is none, and then what lies around it
// is searched, up to the next that the chain lists.
bool JournalEntryStream::take(uint64_t offset) {
  uint64_t size = 0;
  const auto entry = file_.entryAt(offset, searchedTo_, size);
  if (!entry) {
    context_.report.addProblem("entry damaged", offset);
    const EntryChain::Step step = chain_.next();
    finished_ = !step.offset;
    if (step.gapBefore) context_.report.addProblem("entry array damaged", chain_.problemAt());
    pending_ = step.offset;
    searchUntil(step.offset.value_or(file_.objectsEnd()));
    return false;
  }
  entry_ = *entry;
  entryOffset_ = offset;
  entrySize_ = size;
  firstFresh_ = searchedTo_;
  searchedTo_ = alignUp(offset + size);
  ++delivered_;
  return true;
}

void JournalEntryStream::searchUntil(uint64_t end) {
  search_.emplace(file_, std::min(searchedTo_, end), end, context_.stop);
}

void JournalEntryStream::endSearch() {
  if (search_->damagedPlaces() != 0)
    context_.report.addProblem("objects damaged", search_->firstDamage(), search_->damagedPlaces());
  search_.reset();
  if (pending_) searchedTo_ = std::max(searchedTo_, *pending_);
}

void JournalEntryStream::finish() {
  if (std::exchange(reported_, true)) return;
  const uint64_t expected = file_.header().entryCount;
  // The daemon cuts off what it has not used of a file when it closes it; that costs nothing.
  if (file_.file().failed() && (expected > delivered_ || !context_.report.problems.empty()))
    context_.report.addProblem("cut short or not readable", file_.file().size());
  if (expected > delivered_)
    context_.report.addProblem("entries missing", file_.objectsEnd(), expected - delivered_);
}

Entry JournalEntryStream::entry() {
  context_.tokenizer.beginEntry();
  tokens_.clear();
  collectTokens();
  return {entry_, tokens_};
}

void JournalEntryStream::collectTokens() {
  const size_t all = file_.itemCount(entrySize_);
  const size_t count = std::min(all, JournalFile::kMaxItems);
  if (all > count) context_.report.addProblem("entry with too many fields", entryOffset_);
  const uint64_t offset = entryOffset_ + kEntryItemsAt;
  const uint8_t* items = file_.file().at(offset, count * file_.itemSize(), firstFresh_);
  if (items == nullptr) {
    context_.report.addProblem("entry damaged", entryOffset_);
    return;
  }
  tokens_.resize(count);
  size_t kept = 0;
  const uint32_t generation = context_.tokenizer.generation();
  for (size_t i = 0; i < count && !context_.stop.load(std::memory_order_relaxed); ++i) {
    const FieldToken token = tokenAt(file_.itemAt(items, i), generation);
    tokens_[kept] = token;
    kept += token != kNoToken;
  }
  tokens_.resize(kept);
}

// The token of the data object at `offset`.
FieldToken JournalEntryStream::tokenAt(uint64_t offset, uint32_t generation) {
  if (offset < firstFresh_) [[likely]] {
    const FieldToken known = context_.resources.tokens.find(number_, offset, generation);
    if (known != TokenCache::kUnknown) [[likely]]
      return known;
  }
  return newTokenAt(offset, generation);
}

// Looks at a data object. What only this entry refers to is not remembered, nor is what is none: it
// may lie across one that is.
FieldToken JournalEntryStream::newTokenAt(uint64_t offset, uint32_t generation) {
  const auto data = file_.dataAt(offset, context_.resources.data);
  const auto token = data ? readToken(*data) : std::nullopt;
  if (!token) context_.report.addProblem("data object damaged", offset);
  if (data && (offset < firstFresh_ || data->entryCount != 1))
    context_.resources.tokens.store(number_, offset, generation, token.value_or(kNoToken));
  return token.value_or(kNoToken);
}

std::optional<FieldToken> JournalEntryStream::readToken(const DataObject& data) {
  if (data.compression != 0) return decompressToken(data);
  return textToken(data.head, data.payloadSize);
}

std::optional<FieldToken> JournalEntryStream::textToken(std::span<const uint8_t> head,
                                                        uint64_t size) {
  const std::string_view text(reinterpret_cast<const char*>(head.data()), head.size());
  const size_t nameLength = text.substr(0, kMaxFieldNameLength + 1).find('=');
  if (nameLength == std::string_view::npos || nameLength == 0) return std::nullopt;
  if (!context_.tokenizer.wants(text.substr(0, nameLength))) return kNoToken;
  return context_.tokenizer.tokenFor(text, size);
}

// Decompresses the name first, and the value only where the name is wanted.
std::optional<FieldToken> JournalEntryStream::decompressToken(const DataObject& data) {
  const Decompressor::Source source = [&](uint64_t position, std::span<uint8_t> target) {
    const uint64_t left = data.payloadSize - std::min(position, data.payloadSize);
    const auto length = static_cast<size_t>(std::min<uint64_t>(left, target.size()));
    return file_.file().read(data.payloadOffset + position, target.first(length));
  };
  Decompressor& decompressor = context_.resources.decompressor;
  const std::span<uint8_t> text = context_.resources.text;
  const auto name =
      decompressor.decompress(data.compression, source, text.first(kMaxFieldNameLength + 1));
  if (!name) return std::nullopt;
  const std::string_view start(reinterpret_cast<const char*>(text.data()), name->produced);
  const size_t nameLength = start.find('=');
  if (nameLength == std::string_view::npos || nameLength == 0) return std::nullopt;
  if (!context_.tokenizer.wants(start.substr(0, nameLength))) return kNoToken;
  const auto whole = decompressor.decompress(data.compression, source, text);
  if (!whole) return std::nullopt;
  return textToken(text.first(whole->produced),
                   whole->complete ? whole->produced : text.size() + 1);
}

}  // namespace tessel
