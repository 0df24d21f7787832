// JournalFile: one journal file, its header and its objects, nothing of it believed unchecked.
//
// Every offset, size and type is held against the bounds of the real file and against what the
// format allows before it is used. What fails is told as "not there"; the caller decides what that
// costs.
//
// Threads: one at a time.

#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <variant>

#include "journal/EntryStream.h"
#include "journal/FileWindows.h"
#include "journal/JournalFormat.h"
#include "platform/Error.h"

namespace tessel {

// What the reader uses of a file's header, as it stood when it was read.
struct JournalHeader {
  uint32_t incompatibleFlags = 0;
  uint8_t state = 0;
  Id128 sequenceId{};
  uint64_t headerSize = 0;  // where the objects begin
  uint64_t objectsEnd = 0;  // where they end, at most the size of the file
  uint64_t entryCount = 0;  // entries linked, by the header's word, at most what the file can hold
  uint64_t entryArray = 0;  // offset of the first entry array; 0: none
  uint64_t lastObject = 0;  // offset of the last object that counts; UINT64_MAX: all that are there
  uint64_t headRealtime = 0;  // of the first and last entry written; 0: unknown
  uint64_t tailRealtime = 0;
  uint64_t fieldTable = 0;      // offset of the buckets of the hash table of fields; 0: unknown
  uint64_t fieldTableSize = 0;  // bytes
  uint64_t fieldCount = 0;      // of distinct names

  bool compact() const { return (incompatibleFlags & journal_format::kCompact) != 0; }
  uint32_t unknownFlags() const {
    return incompatibleFlags & ~journal_format::kKnownIncompatibleFlags;
  }
  bool beingWritten() const { return state == journal_format::kOnline; }
};

// Parses the beginning of a file of `fileSize` bytes; the reason where it is no journal.
std::variant<JournalHeader, std::string> parseJournalHeader(std::span<const uint8_t> bytes,
                                                            uint64_t fileSize);

struct JournalBeginning {
  JournalHeader header;
  uint64_t fileSize = 0;  // bytes
};

// Reads the header of the file of `fd`. The error is notAStore if the file is no journal.
std::variant<JournalBeginning, PlatformError> readJournalHeader(int fd);

struct ObjectHeader {
  uint8_t type = 0;
  uint8_t flags = 0;
  uint64_t size = 0;  // without the padding to the next object
};

struct DataObject {
  uint8_t compression = 0;  // of journal_format::DataFlag
  uint64_t entryCount = 0;  // entries that refer to it, by its own word
  uint64_t payloadOffset = 0;
  uint64_t payloadSize = 0;       // in the file, at least 1
  std::span<const uint8_t> head;  // beginning of the payload; in the window or in scratch
};

class JournalFile {
 public:
  // Entries with more fields than this are read in part; the journal daemon takes 1,024.
  static constexpr size_t kMaxItems = 2048;

  JournalFile(UniqueFd fd, uint64_t size, const JournalHeader& header, WindowBudget& budget);

  const JournalHeader& header() const { return header_; }
  WindowedFile& file() { return file_; }

  // Where objects end now: less than the header says once the file was found cut short.
  uint64_t objectsEnd() const { return std::min(header_.objectsEnd, file_.size()); }
  // Whether an object of `least` bytes may begin at `offset`.
  bool mayHoldObject(uint64_t offset, uint64_t least) const {
    return journal_format::aligned(offset) && offset >= header_.headerSize &&
           offset < objectsEnd() && least <= objectsEnd() - offset;
  }
  // The header of the object at the beginning of `bytes`, where it is one that the format allows
  // and that ends within `room` bytes. REQUIRES: bytes.size() >= kObjectHeaderSize.
  std::optional<ObjectHeader> objectHeader(std::span<const uint8_t> bytes, uint64_t room) const;

  // Fills `entry`, but for its sequence, which is the file's, from the entry object at `offset`,
  // read by way of the window, which keeps what lies behind `from` in view. Answers the size of the
  // object in bytes; 0 where there is none.
  uint64_t readEntry(uint64_t offset, uint64_t from, EntryHeader& entry);
  // Number of data objects that an entry of `size` bytes refers to.
  size_t itemCount(uint64_t size) const {
    return static_cast<size_t>((size - journal_format::kEntryItemsAt) >> itemShift_);
  }
  size_t itemSize() const { return size_t{1} << itemShift_; }
  // Bytes of a data object before its payload.
  size_t dataHeaderSize() const { return dataHeaderSize_; }
  // Bytes of a data object that are read at most, payload included.
  static constexpr size_t kMaxDataRead = journal_format::kCompactDataHeaderSize + kMaxFieldHead;

  // Fills `data` from the data object at `offset`, with up to kMaxFieldHead bytes of its payload;
  // false where there is none. The window stays; what it does not hold is read into `scratch`.
  bool readData(uint64_t offset, std::span<uint8_t, kMaxDataRead> scratch, DataObject& data);

 private:
  const JournalHeader header_;
  WindowedFile file_;
  const int itemShift_;  // the size of an item is a power of two; division is slow
  const size_t dataHeaderSize_;
};

}  // namespace tessel
