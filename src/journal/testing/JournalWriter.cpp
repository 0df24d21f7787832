#include "journal/testing/JournalWriter.h"

#include <lz4.h>
#include <lzma.h>
#include <zstd.h>

#include <algorithm>
#include <cstring>
#include <span>

#include "journal/JournalFormat.h"
#include "journal/JournalHash.h"

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

// Readers other than ours follow these; ours does not.
constexpr size_t kArenaSizeAt = 96;
constexpr size_t kDataTableAt = 104;
constexpr size_t kFieldTableAt = 120;
constexpr size_t kFieldCountAt = 216;
constexpr size_t kTailArrayAt = 256;  // and four bytes behind it, how many entries it has
constexpr size_t kTailEntryAt = 264;
constexpr size_t kDataFirstEntryAt = 40;
constexpr size_t kDataEntryArrayAt = 48;
constexpr uint64_t kBuckets = 8;

std::span<const uint8_t> bytesOf(const std::string& text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

}  // namespace

JournalWriter::JournalWriter(JournalLayout layout) : layout_(layout) {
  file_.assign(layout_.headerSize, '\0');
  file_.replace(0, 8, kSignature, 8);
  uint32_t flags = (layout_.compact ? kCompact : 0u) | (layout_.keyed ? kKeyedHash : 0u);
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
  // The tables are there, and empty: nobody looks at them.
  for (const auto& [type, at] :
       {std::pair(kDataHashTable, kDataTableAt), std::pair(kFieldHashTable, kFieldTableAt)}) {
    const uint64_t table = beginObject(type, 0, kObjectHeaderSize + kBuckets * 16);
    put<uint64_t>(at, table + kObjectHeaderSize);
    put<uint64_t>(at + 8, kBuckets * 16);
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
  put<uint64_t>(data.offset + kDataHashAt, layout_.keyed
                                               ? sipHash24(bytesOf(field), layout_.sequenceId)
                                               : lookup3(bytesOf(field)));
  file_.replace(data.offset + before, payload.size(), payload);
  const std::string name = field.substr(0, field.find('='));
  if (fields_.insert(name).second) {
    const uint64_t object = beginObject(kField, 0, kFieldHeaderSize + name.size());
    file_.replace(object + kFieldHeaderSize, name.size(), name);
    if (layout_.headerSize > kFieldCountAt) put<uint64_t>(kFieldCountAt, fields_.size());
  }
  return data;
}

void JournalWriter::add(EntryHeader header, const std::vector<std::string>& fields) {
  std::vector<Data*> items;
  uint64_t hash = 0;
  for (const std::string& field : fields) {
    items.push_back(&dataFor(field));
    hash ^= lookup3(bytesOf(field));
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
  if (layout_.headerSize > kTailArrayAt) {
    put<uint32_t>(kTailArrayAt, static_cast<uint32_t>(all_.arrays.back()));
    put<uint32_t>(kTailArrayAt + 4, static_cast<uint32_t>(all_.used));
  }
  if (layout_.headerSize > kTailEntryAt) put<uint64_t>(kTailEntryAt, offset);
  put<uint64_t>(kEntryCountAt, entries_.size());
  for (Data* item : items) link(*item, offset);
  if (entries_.size() == 1) {
    put<uint64_t>(168, sequence_);
    put<uint64_t>(kHeadRealtimeAt, header.realtime);
  }
  put<uint64_t>(160, sequence_);
  put<uint64_t>(kTailRealtimeAt, header.realtime);
  put<uint64_t>(kTailMonotonicAt, header.monotonic);
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
