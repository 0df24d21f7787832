#include "journal/testing/JournalWriter.h"

#include <lz4.h>
#include <lzma.h>
#include <zstd.h>

#include <algorithm>
#include <cstring>

#include "journal/JournalFormat.h"

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

constexpr uint64_t kBuckets = 8;

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
  all_.firstAt = kEntryArrayAt;
  // The table of data is there, and empty: nobody looks at it.
  for (const auto& [type, at] : {std::pair(kDataHashTable, 104), std::pair(kFieldHashTable, 120)}) {
    const uint64_t table = beginObject(type, 0, kObjectHeaderSize + kBuckets * kBucketSize);
    put<uint64_t>(static_cast<uint64_t>(at), table + kObjectHeaderSize);
    put<uint64_t>(static_cast<uint64_t>(at) + 8, kBuckets * kBucketSize);
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

uint64_t JournalWriter::wordAt(uint64_t at) const {
  return load<uint64_t>(reinterpret_cast<const uint8_t*>(file_.data()) + at);
}

JournalWriter::Data& JournalWriter::dataFor(const std::string& field) {
  const auto [known, isNew] = data_.try_emplace(field);
  Data& data = known->second;
  if (!isNew) return data;
  const bool compressed = layout_.compression != 0 && field.size() >= layout_.compressFrom;
  const std::string payload = !compressed                   ? field
                              : layout_.compression == kXz  ? compressXz(field)
                              : layout_.compression == kLz4 ? compressLz4(field)
                                                            : compressZstd(field);
  const uint64_t before = layout_.compact ? kCompactDataHeaderSize : kDataHeaderSize;
  data.offset =
      beginObject(kData, compressed ? layout_.compression : uint8_t{0}, before + payload.size());
  data.list.firstAt = data.offset + kDataEntryArrayAt;
  put<uint64_t>(data.offset + 16, hashOf(field));
  file_.replace(data.offset + before, payload.size(), payload);
  const uint64_t owner = fieldFor(field.substr(0, field.find('=')));
  put<uint64_t>(data.offset + kNextValueAt, wordAt(owner + kFieldFirstValueAt));
  put<uint64_t>(owner + kFieldFirstValueAt, data.offset);
  return data;
}

uint64_t JournalWriter::fieldFor(const std::string& name) {
  const auto [known, isNew] = fields_.try_emplace(name);
  if (!isNew) return known->second;
  const uint64_t field = beginObject(kField, 0, kFieldHeaderSize + name.size());
  file_.replace(field + kFieldHeaderSize, name.size(), name);
  const uint64_t bucket = wordAt(kFieldTableAt) + hashOf(name) % kBuckets * kBucketSize;
  put<uint64_t>(field + kNextInBucketAt, wordAt(bucket));
  put<uint64_t>(bucket, field);
  if (layout_.headerSize >= kHeaderRead) put<uint64_t>(kFieldCountAt, fields_.size());
  return known->second = field;
}

void JournalWriter::add(EntryHeader header, const std::vector<std::string>& fields) {
  std::vector<Data*> items;
  uint64_t hash = 0;
  for (const std::string& field : fields) {
    items.push_back(&dataFor(field));
    hash ^= hashOf(field);
  }
  std::sort(items.begin(), items.end(),
            [](const Data* a, const Data* b) { return a->offset < b->offset; });
  sequence_ = header.sequenceNumber != 0 ? header.sequenceNumber : sequence_ + 1;
  const size_t itemSize = layout_.compact ? kCompactEntryItemSize : kEntryItemSize;
  const uint64_t offset = beginObject(kEntry, 0, kEntryItemsAt + items.size() * itemSize);
  put<uint64_t>(offset + kEntrySequenceAt, sequence_);
  put<uint64_t>(offset + kEntryRealtimeAt, header.realtime);
  put<uint64_t>(offset + kEntryMonotonicAt, header.monotonic);
  std::copy(header.bootId.begin(), header.bootId.end(),
            file_.begin() + static_cast<ptrdiff_t>(offset + kEntryBootAt));
  put<uint64_t>(offset + kEntryHashAt, hash);
  for (size_t i = 0; i < items.size(); ++i)
    putOffset(offset + kEntryItemsAt + i * itemSize, items[i]->offset);
  link(all_, offset);
  entries_.push_back(offset);
  put<uint64_t>(kEntryCountAt, entries_.size());
  for (Data* item : items) link(*item, offset);
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

void JournalWriter::link(List& list, uint64_t entry) {
  if (list.used == list.capacity) {
    list.capacity = list.capacity == 0 ? 4 : list.capacity * 2;
    list.used = 0;
    const uint64_t array =
        beginObject(kEntryArray, 0, kArrayItemsAt + list.capacity * offsetSize());
    put<uint64_t>(list.arrays.empty() ? list.firstAt : list.arrays.back() + kArrayNextAt, array);
    list.arrays.push_back(array);
  }
  putOffset(list.arrays.back() + kArrayItemsAt + list.used++ * offsetSize(), entry);
}

// The first entry that refers to a value stands in the value itself.
void JournalWriter::link(Data& data, uint64_t entry) {
  if (data.entries++ == 0) {
    put<uint64_t>(data.offset + kDataFirstEntryAt, entry);
  } else {
    link(data.list, entry);
  }
  put<uint64_t>(data.offset + kDataEntryCountAt, data.entries);
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
