// JournalFormat: where the journal file format keeps what a reader needs.
//
// A file is a header and then the arena, a row of objects. Writers only append objects; they change
// old ones only to link new ones to them. Each object begins at a multiple of eight bytes with its
// type (one byte), its flags (one byte), six zero bytes and its size (eight bytes). All integers
// are little-endian; all links are offsets from the beginning of the file, and 0 means "none".
//
//   header --kEntryArrayAt--> entry array --kArrayNextAt--> entry array --> ... --> 0
//                               | | |        (each about twice as long as the one before)
//                               v v v
//                             entry: number, times, boot, and a list of data objects
//                                                     |
//                                                     v
//                             data: one FIELD=value, stored once, compressed or not
//
// A writer puts a data object before the first entry that has it. There are more links: hash tables
// of data and of fields, the values of a field, the entries that have a value. We follow none of
// them. They would lead to the entries that have a certain value without a look at the others. But
// each is one more way in which a wrong word can hide entries, and the look costs little.
//
// Files with the flag kCompact have 32-bit offsets in entries and entry arrays, and a longer data
// header.

#pragma once

#include <bit>
#include <cstdint>
#include <cstring>

namespace tessel::journal_format {

// Numbers are taken from a file as they lie there, and an offset is held as a size. Another machine
// would have to swap bytes in load(), and could not address a file of 4 GiB.
static_assert(std::endian::native == std::endian::little && sizeof(size_t) == sizeof(uint64_t),
              "the reader is for 64-bit machines of little-endian byte order");

inline constexpr char kSignature[9] = "LPKSHHRH";

// The shortest header that was ever written. It holds all that we use; newer writers append more.
inline constexpr uint64_t kMinHeaderSize = 208;
// Writers use less than 300 bytes. A header that claims more than a page is damaged.
inline constexpr uint64_t kMaxHeaderSize = 4096;

// If a file has a flag that we do not know, we cannot read it.
enum IncompatibleFlag : uint32_t {
  kCompressedXz = 1,
  kCompressedLz4 = 2,
  kKeyedHash = 4,  // of data objects: see JournalHash.h
  kCompressedZstd = 8,
  kCompact = 16,
};
inline constexpr uint32_t kKnownIncompatibleFlags =
    kCompressedXz | kCompressedLz4 | kKeyedHash | kCompressedZstd | kCompact;

// A writer sets kOnline when it opens a file. The file may then change while we read it.
enum FileState : uint8_t { kOffline = 0, kOnline = 1, kArchived = 2 };

// Offsets in the header.
inline constexpr size_t kIncompatibleFlagsAt = 12;
inline constexpr size_t kStateAt = 16;
inline constexpr size_t kFileIdAt = 24;
inline constexpr size_t kSequenceIdAt = 72;
inline constexpr size_t kHeaderSizeAt = 88;
inline constexpr size_t kTailObjectAt = 136;  // the object that was appended last
inline constexpr size_t kEntryCountAt = 152;
inline constexpr size_t kEntryArrayAt = 176;
inline constexpr size_t kHeadRealtimeAt = 184;  // of the first entry that was written
inline constexpr size_t kTailRealtimeAt = 192;  // of the last one
inline constexpr size_t kTailMonotonicAt = 200;

enum ObjectType : uint8_t {
  kUnused = 0,
  kData = 1,
  kField = 2,
  kEntry = 3,
  kDataHashTable = 4,
  kFieldHashTable = 5,
  kEntryArray = 6,
  kTag = 7,  // a seal of the objects before it; we do not check seals
};

// How a payload is compressed. A data object has at most one of these flags.
enum DataFlag : uint8_t { kXz = 1, kLz4 = 2, kZstd = 4 };
inline constexpr uint8_t kKnownDataFlags = kXz | kLz4 | kZstd;

// Offsets in objects, from the beginning of the object; and sizes in bytes.
inline constexpr size_t kObjectHeaderSize = 16;
inline constexpr size_t kObjectSizeAt = 8;

inline constexpr size_t kDataHashAt = 16;
inline constexpr size_t kDataEntryCountAt = 56;  // all entries, the first one included
inline constexpr size_t kDataHeaderSize = 64;
inline constexpr size_t kCompactDataHeaderSize = 72;

inline constexpr size_t kFieldHeaderSize = 40;
inline constexpr size_t kTagSize = 64;

inline constexpr size_t kEntrySequenceAt = 16;
inline constexpr size_t kEntryRealtimeAt = 24;
inline constexpr size_t kEntryMonotonicAt = 32;
inline constexpr size_t kEntryBootAt = 40;
inline constexpr size_t kEntryHashAt = 56;
inline constexpr size_t kEntryItemsAt = 64;
inline constexpr size_t kEntryItemSize = 16;  // an offset and the hash of the data
inline constexpr size_t kCompactEntryItemSize = 4;

inline constexpr size_t kArrayNextAt = 16;
inline constexpr size_t kArrayItemsAt = 24;

// 2^55 microseconds are some 1,100 years. A later time is damage.
inline constexpr uint64_t kMaxTime = uint64_t{1} << 55;
// A million entries a second reach 2^48 after nine years. A greater number is damage. We must not
// believe it: files are merged by number, so the rest of this file would come after all others.
inline constexpr uint64_t kMaxSequenceNumber = uint64_t{1} << 48;

template <typename T>
T load(const uint8_t* at) {
  T value;
  std::memcpy(&value, at, sizeof value);
  return value;
}

constexpr bool aligned(uint64_t offset) { return offset % 8 == 0; }
constexpr uint64_t alignUp(uint64_t offset) { return (offset + 7) & ~uint64_t{7}; }

}  // namespace tessel::journal_format
