// The journal file format as far as reading needs it: places of fields, object types, flags.
//
// A file is a header, then the arena: objects that are only ever appended, each aligned to eight
// bytes and led by its type and size. All integers are little-endian. A data object holds one
// FIELD=value, an entry object lists the data objects of one entry, and a chain of entry arrays,
// each about twice as long as the one before, lists the entries in order.
//
// The compact layout has 32-bit offsets in entries and entry arrays and a longer data header.

#pragma once

#include <bit>
#include <cstdint>
#include <cstring>

namespace tessel::journal_format {

inline constexpr char kSignature[9] = "LPKSHHRH";

// The shortest header that is understood; what newer writers append is optional.
inline constexpr uint64_t kMinHeaderSize = 208;
// What is read of a longer one.
inline constexpr uint64_t kHeaderRead = 224;
// A header that claims more than this is damaged.
inline constexpr uint64_t kMaxHeaderSize = 4096;

enum IncompatibleFlag : uint32_t {
  kCompressedXz = 1,
  kCompressedLz4 = 2,
  kKeyedHash = 4,
  kCompressedZstd = 8,
  kCompact = 16,
};
inline constexpr uint32_t kKnownIncompatibleFlags =
    kCompressedXz | kCompressedLz4 | kKeyedHash | kCompressedZstd | kCompact;

enum FileState : uint8_t { kOffline = 0, kOnline = 1, kArchived = 2 };

// Places in the header.
inline constexpr size_t kIncompatibleFlagsAt = 12;
inline constexpr size_t kStateAt = 16;
inline constexpr size_t kSequenceIdAt = 72;
inline constexpr size_t kHeaderSizeAt = 88;
inline constexpr size_t kArenaSizeAt = 96;
inline constexpr size_t kFieldTableAt = 120;
inline constexpr size_t kFieldTableSizeAt = 128;
inline constexpr size_t kTailObjectAt = 136;
inline constexpr size_t kEntryCountAt = 152;
inline constexpr size_t kEntryArrayAt = 176;
inline constexpr size_t kHeadRealtimeAt = 184;
inline constexpr size_t kTailRealtimeAt = 192;
inline constexpr size_t kFieldCountAt = 216;

enum ObjectType : uint8_t {
  kUnused = 0,
  kData = 1,
  kField = 2,
  kEntry = 3,
  kDataHashTable = 4,
  kFieldHashTable = 5,
  kEntryArray = 6,
  kTag = 7,
};

enum DataFlag : uint8_t { kXz = 1, kLz4 = 2, kZstd = 4 };
inline constexpr uint8_t kKnownDataFlags = kXz | kLz4 | kZstd;

inline constexpr size_t kObjectHeaderSize = 16;
inline constexpr size_t kObjectSizeAt = 8;

// A hash table is a row of buckets; objects in one bucket are linked.
inline constexpr size_t kBucketSize = 16;
inline constexpr size_t kNextInBucketAt = 24;

inline constexpr size_t kNextValueAt = 32;  // of the same field
inline constexpr size_t kDataFirstEntryAt = 40;
inline constexpr size_t kDataEntryArrayAt = 48;  // lists the entries but for the first
inline constexpr size_t kDataEntryCountAt = 56;
inline constexpr size_t kDataHeaderSize = 64;
inline constexpr size_t kCompactDataHeaderSize = 72;

inline constexpr size_t kFieldFirstValueAt = 32;  // the one that was added last
inline constexpr size_t kFieldHeaderSize = 40;
inline constexpr size_t kTagSize = 64;

inline constexpr size_t kEntrySequenceAt = 16;
inline constexpr size_t kEntryRealtimeAt = 24;
inline constexpr size_t kEntryMonotonicAt = 32;
inline constexpr size_t kEntryBootAt = 40;
inline constexpr size_t kEntryHashAt = 56;
inline constexpr size_t kEntryItemsAt = 64;
inline constexpr size_t kEntryItemSize = 16;
inline constexpr size_t kCompactEntryItemSize = 4;

inline constexpr size_t kArrayNextAt = 16;
inline constexpr size_t kArrayItemsAt = 24;

// Times beyond this many microseconds, some 1,100 years, are taken for damage.
inline constexpr uint64_t kMaxTime = uint64_t{1} << 55;
// So are sequence numbers beyond this one: the files that are merged with the one that holds such a
// number would all come before the rest of it.
inline constexpr uint64_t kMaxSequenceNumber = uint64_t{1} << 48;

template <typename T>
T load(const uint8_t* at) {
  static_assert(std::endian::native == std::endian::little, "journals are little-endian");
  T value;
  std::memcpy(&value, at, sizeof value);
  return value;
}

constexpr bool aligned(uint64_t offset) { return offset % 8 == 0; }
constexpr uint64_t alignUp(uint64_t offset) { return (offset + 7) & ~uint64_t{7}; }

}  // namespace tessel::journal_format
