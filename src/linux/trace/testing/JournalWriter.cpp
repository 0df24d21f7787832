#include "linux/trace/testing/JournalWriter.h"

#include <lz4.h>
#include <lzma.h>
#include <zstd.h>

#include <algorithm>
#include <cstring>

#include "linux/trace/JournalFormat.h"

namespace tessel::testing {

using namespace journal_format;

namespace {

std::string compressXz(const std::string& text) {
  std::string out(lzma_stream_buffer_bound(text.size()), '\0');
  size_t size = 0;
  lzma_easy_buffer_encode(0, LZMA_CHECK_NONE, nullptr,
                          reinterpret_cast<const uint8_t*>(text.data()), text.size(),
                          reinterpret_cast<uint8_t*>(out.data()), &size, out.size());
  out.resize(size);
  return out;
}

std::string compressLz4(const std::string& text) {
  std::string out(8 + static_cast<size_t>(LZ4_compressBound(static_cast<int>(text.size()))), '\0');
  const uint64_t size = text.size();
  std::memcpy(out.data(), &size, sizeof size);
  const int length = LZ4_compress_default(
      text.data(), out.data() + 8, static_cast<int>(text.size()), static_cast<int>(out.size() - 8));
  out.resize(8 + static_cast<size_t>(length));
  return out;
}

std::string compressZstd(const std::string& text) {
  std::string out(ZSTD_compressBound(text.size()), '\0');
  out.resize(ZSTD_compress(out.data(), out.size(), text.data(), text.size(), 3));
  return out;
}

uint64_t hashOf(const std::string& text) {
  uint64_t hash = 14695981039346656037u;
  for (const char c : text) hash = (hash ^ static_cast<uint8_t>(c)) * 1099511628211u;
  return hash;
}

}  // namespace

JournalWriter::JournalWriter(JournalLayout layout) : layout_(layout) {
  file_.assign(layout_.headerSize, '\0');
  file_.replace(0, 8, kSignature, 8);
  uint32_t flags = layout_.compact ? uint32_t{kCompact} : 0;
  if (layout_.compression == kXz) flags |= kCompressedXz;
  if (layout_.compression == kLz4) flags |= kCompressedLz4;
  if (layout_.compression == kZstd) flags |= kCompressedZstd;
  put<uint32_t>(kIncompatibleFlagsAt, flags);
  put<uint32_t>(8, layout_.sealEvery != 0 ? 1 : 0);
  put<uint8_t>(kStateAt, layout_.state);
  for (size_t at : {size_t{24}, size_t{40}, size_t{56}, kSequenceIdAt})
    std::copy(layout_.sequenceId.begin(), layout_.sequenceId.end(),
              file_.begin() + static_cast<ptrdiff_t>(at));
  put<uint64_t>(kHeaderSizeAt, layout_.headerSize);
  // Both hash tables are there, and empty: what reads in order does not look at them.
  for (const auto& [type, at] : {std::pair(kDataHashTable, 104), std::pair(kFieldHashTable, 120)}) {
    const uint64_t table = beginObject(type, 0, kObjectHeaderSize + 16 * 8);
    put<uint64_t>(static_cast<uint64_t>(at), table + kObjectHeaderSize);
    put<uint64_t>(static_cast<uint64_t>(at) + 8, 16 * 8);
  }
}

template <typename T>
void JournalWriter::put(uint64_t at, T value) {
  std::memcpy(file_.data() + at, &value, sizeof value);
}

void JournalWriter::putOffset(uint64_t at, uint64_t offset) {
  if (layout_.compact) {
    put<uint32_t>(at, static_cast<uint32_t>(offset));
  } else {
    put<uint64_t>(at, offset);
  }
}

uint64_t JournalWriter::beginObject(uint8_t type, uint8_t flags, uint64_t size) {
  const uint64_t offset = file_.size();
  file_.resize(alignUp(offset + size));
  put<uint8_t>(offset, type);
  put<uint8_t>(offset + 1, flags);
  put<uint64_t>(offset + kObjectSizeAt, size);
  put<uint64_t>(kTailObjectAt, offset);
  put<uint64_t>(144, ++objects_);
  put<uint64_t>(kArenaSizeAt, file_.size() - layout_.headerSize);
  return offset;
}

uint64_t JournalWriter::dataFor(const std::string& field) {
  const auto known = data_.find(field);
  if (known != data_.end()) {
    put<uint64_t>(known->second + kDataEntryCountAt,
                  load<uint64_t>(reinterpret_cast<const uint8_t*>(file_.data()) + known->second +
                                 kDataEntryCountAt) +
                      1);
    return known->second;
  }
  const bool compressed = layout_.compression != 0 && field.size() >= layout_.compressFrom;
  const std::string payload = !compressed                   ? field
                              : layout_.compression == kXz  ? compressXz(field)
                              : layout_.compression == kLz4 ? compressLz4(field)
                                                            : compressZstd(field);
  const uint64_t before = layout_.compact ? kCompactDataHeaderSize : kDataHeaderSize;
  const uint64_t offset =
      beginObject(kData, compressed ? layout_.compression : uint8_t{0}, before + payload.size());
  put<uint64_t>(offset + 16, hashOf(field));
  put<uint64_t>(offset + kDataEntryCountAt, 1);
  file_.replace(offset + before, payload.size(), payload);
  data_.emplace(field, offset);
  return offset;
}

void JournalWriter::add(EntryHeader header, const std::vector<std::string>& fields) {
  std::vector<uint64_t> items;
  uint64_t hash = 0;
  for (const std::string& field : fields) {
    items.push_back(dataFor(field));
    hash ^= hashOf(field);
  }
  std::sort(items.begin(), items.end());
  sequence_ = header.sequenceNumber != 0 ? header.sequenceNumber : sequence_ + 1;
  const size_t itemSize = layout_.compact ? kCompactEntryItemSize : kEntryItemSize;
  const uint64_t offset = beginObject(kEntry, 0, kEntryItemsAt + items.size() * itemSize);
  put<uint64_t>(offset + kEntrySequenceAt, sequence_);
  put<uint64_t>(offset + kEntryRealtimeAt, header.realtime);
  put<uint64_t>(offset + kEntryMonotonicAt, header.monotonic);
  std::copy(header.bootId.begin(), header.bootId.end(),
            file_.begin() + static_cast<ptrdiff_t>(offset + kEntryBootAt));
  put<uint64_t>(offset + kEntryHashAt, hash);
  for (size_t i = 0; i < items.size(); ++i) {
    putOffset(offset + kEntryItemsAt + i * itemSize, items[i]);
    // A data object names the first entry that refers to it.
    uint64_t first = 0;
    std::memcpy(&first, file_.data() + items[i] + 40, sizeof first);
    if (first == 0) put<uint64_t>(items[i] + 40, offset);
  }
  link(offset);
  if (entries_.size() == 1) {
    put<uint64_t>(168, sequence_);
    put<uint64_t>(kHeadRealtimeAt, header.realtime);
  }
  put<uint64_t>(160, sequence_);
  put<uint64_t>(kTailRealtimeAt, header.realtime);
  put<uint64_t>(200, header.monotonic);
  std::copy(header.bootId.begin(), header.bootId.end(), file_.begin() + 56);
  if (layout_.sealEvery != 0 && entries_.size() % layout_.sealEvery == 0)
    beginObject(kTag, 0, kTagSize);
}

// Lists an entry in the chain of arrays, each twice as long as the one before.
void JournalWriter::link(uint64_t entry) {
  if (arrayUsed_ == arrayCapacity_) {
    arrayCapacity_ = arrayCapacity_ == 0 ? 4 : arrayCapacity_ * 2;
    arrayUsed_ = 0;
    const uint64_t array =
        beginObject(kEntryArray, 0, kArrayItemsAt + arrayCapacity_ * offsetSize());
    put<uint64_t>(arrays_.empty() ? kEntryArrayAt : arrays_.back() + kArrayNextAt, array);
    arrays_.push_back(array);
  }
  putOffset(arrays_.back() + kArrayItemsAt + arrayUsed_++ * offsetSize(), entry);
  entries_.push_back(entry);
  put<uint64_t>(kEntryCountAt, entries_.size());
}

void JournalWriter::addSome(size_t count, uint64_t firstSequence) {
  for (size_t i = 0; i < count; ++i) {
    const uint64_t number = firstSequence + i;
    EntryHeader header;
    header.sequenceNumber = number;
    header.bootId = {1};
    header.monotonic = number * 1'000'000;
    header.realtime = 1'795'300'000'000'000 + number * 1'000'000;
    add(header, {"MESSAGE=message " + std::to_string(number) + std::string(number % 100, 'x'),
                 "_PID=" + std::to_string(number % 5), "PRIORITY=6", "_COMM=clock"});
  }
}

std::string JournalWriter::bytes() const { return file_; }

}  // namespace tessel::testing
