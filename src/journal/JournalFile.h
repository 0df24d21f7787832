// JournalFile: one journal file with its header and its objects.
//
// We trust nothing in a file. Any user can write entries, disks fail, and a daemon that is killed
// leaves half an object. So we check each value before we use it: an offset against the file's real
// size and the alignment; a size against the bytes that are left; types, reserved bits, times and
// numbers against those that a writer can produce. An object that fails a check counts as absent,
// and the caller decides what follows.
//
// Hashes are checked by JournalEntryStream, and only for entries whose fields it reads: for the
// others we would have to read every payload whole.
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

// The values of a file's header that we use, as they were when we opened the file. If the file is
// being written, the header has changed since.
struct JournalHeader {
  uint32_t incompatibleFlags = 0;
  uint8_t state = 0;
  Id128 fileId{};
  Id128 sequenceId{};
  uint64_t headerSize = 0;  // bytes; the objects begin there
  // How many entries the header counts; at most as many as the file has room for.
  uint64_t entryCount = 0;
  uint64_t entryArray = 0;  // offset of the first entry array; 0: none
  // Offset of the object that was appended last. In a file that is being written, objects behind it
  // may be unfinished. UINT64_MAX: the header's offset is damaged.
  uint64_t lastObject = 0;
  uint64_t headRealtime = 0;  // of the first and last entry written; 0: unknown
  uint64_t tailRealtime = 0;
  uint64_t tailMonotonic = 0;

  bool compact() const { return (incompatibleFlags & journal_format::kCompact) != 0; }
  uint32_t unknownFlags() const {
    return incompatibleFlags & ~journal_format::kKnownIncompatibleFlags;
  }
  bool keyedHash() const { return (incompatibleFlags & journal_format::kKeyedHash) != 0; }
  bool wasBeingWritten() const { return state == journal_format::kOnline; }
};

// Parses the beginning of a file of `fileSize` bytes. If the file is no journal, returns the
// reason.
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
  uint64_t size = 0;  // without the padding to the next object; 0: there is no valid object
};

struct DataObject {
  uint8_t compression = 0;  // a journal_format::DataFlag; 0: none
  uint64_t hash = 0;        // of its text, as the file says
  uint64_t entryCount = 0;  // how many entries it says refer to it
  uint64_t payloadOffset = 0;
  uint64_t payloadSize = 0;       // in the file, at least 1
  std::span<const uint8_t> head;  // the beginning of the payload, in the window or in `scratch`

  bool isWhole() const { return head.size() == payloadSize; }
};

class JournalFile {
 public:
  // The journal daemon accepts 1,024 fields in an entry and adds some of its own, so twice as many
  // are enough. If an entry has more, the stream reads the first 2,048 and reports the entry.
  static constexpr size_t kMaxItems = 2048;

  JournalFile(UniqueFd fd, uint64_t size, const JournalHeader& header, WindowBudget& budget);

  const JournalHeader& header() const { return header_; }
  WindowedFile& file() { return file_; }
  // Whether somebody writes the file while we read it, or has written to it since it was opened.
  // The daemon closes a user's journal when it is quiet, and opens the same file again for the next
  // entry.
  bool beingWritten();
  // The header as it is now; nothing if it cannot be read.
  [[gnu::noinline]] std::optional<JournalHeader> headerNow();

  // The end of the objects: that of the file, because a wrong size in the header could hide some.
  // It becomes smaller if a read finds the file shorter.
  uint64_t objectsEnd() const { return file_.size(); }
  // Whether an object of `least` bytes may begin at `offset`.
  bool mayHoldObject(uint64_t offset, uint64_t least) const {
    return journal_format::aligned(offset) && offset >= header_.headerSize &&
           offset < objectsEnd() && least <= objectsEnd() - offset;
  }
  // The header of the object that begins with the kObjectHeaderSize bytes at `at`. It is not valid
  // if the format does not allow it or if the object is longer than `room` bytes.
  static ObjectHeader objectHeader(const uint8_t* at, uint64_t room) {
    using namespace journal_format;
    const uint8_t type = at[0];
    const uint8_t flags = at[1];
    const auto size = load<uint64_t>(at + kObjectSizeAt);
    // The six bytes behind type and flags are zero today. We ignore them: a later daemon may use
    // them, and a wrong one must not cost the object. Only data objects have flags.
    const bool valid = type <= kTag && size >= kLeastSizes[type] && size <= room &&
                       (flags & ~(type == kData ? kKnownDataFlags : 0)) == 0;
    return {type, valid ? size : 0};
  }

  // Fills `entry` from the entry object at `offset`, except for its sequence id, which is that of
  // the file. If the window moves, it begins at `from` if possible. Returns the size of the object
  // in bytes; 0 if there is no valid entry, and then `entry` may hold values of an invalid one.
  uint64_t readEntry(uint64_t offset, uint64_t from, EntryHeader& entry);
  // How many data objects an entry object of `size` bytes refers to.
  size_t itemCount(uint64_t size) const {
    return static_cast<size_t>((size - journal_format::kEntryItemsAt) >> itemShift_);
  }
  size_t itemSize() const { return size_t{1} << itemShift_; }
  // Bytes of a data object before its payload.
  static constexpr size_t kMaxDataHeader = journal_format::kCompactDataHeaderSize;

  // Fills `data` from the data object at `offset`, with the first `most` bytes of its payload;
  // false if there is no valid one. The window does not move: an old value far away must not push
  // out the entries that come next. What is not in the window is read into `scratch`, which has
  // room for `most` and kMaxDataHeader bytes.
  bool readData(uint64_t offset, size_t most, std::span<uint8_t> scratch, DataObject& data);
  // The size of the data object that begins at `at`, if it is valid and not compressed; otherwise,
  // or if it is longer than `room` bytes, 0.
  uint64_t plainDataSize(const uint8_t* at, uint64_t room) const {
    using namespace journal_format;
    const auto size = load<uint64_t>(at + kObjectSizeAt);
    return load<uint16_t>(at) == kData && size > dataHeaderSize_ && size <= room ? size : 0;
  }
  size_t dataHeaderSize() const { return dataHeaderSize_; }
  // Whether the hash of a data object with this text is `hash`.
  bool hashOfData(std::span<const uint8_t> text, uint64_t hash) const;

 private:
  // By type, the smallest size of a valid object. A writer makes no object that holds nothing, so
  // an empty one is damage.
  static constexpr uint64_t kLeastSizes[] = {UINT64_MAX,  // kUnused
                                             journal_format::kDataHeaderSize + 1,
                                             journal_format::kFieldHeaderSize + 1,
                                             journal_format::kEntryItemsAt + 4,
                                             journal_format::kObjectHeaderSize + 1,
                                             journal_format::kObjectHeaderSize + 1,
                                             journal_format::kArrayItemsAt + 4,
                                             journal_format::kTagSize};

  const JournalHeader header_;
  bool writtenSince_ = false;
  WindowedFile file_;
  const int itemShift_;  // the size of an item is a power of two; division is slow
  const size_t dataHeaderSize_;
};

// Read for every entry of a day. Inlined, it takes a sixth of the instructions off the walk.
[[gnu::always_inline]] inline uint64_t JournalFile::readEntry(uint64_t offset, uint64_t from,
                                                              EntryHeader& entry) {
  using namespace journal_format;
  if (!mayHoldObject(offset, kEntryItemsAt)) return 0;
  // Computed first: at() may find the file cut before `offset`, and objectsEnd() then moves.
  const uint64_t room = objectsEnd() - offset;
  const uint8_t* at = file_.at(offset, kEntryItemsAt, from);
  if (at == nullptr || load<uint16_t>(at) != kEntry) return 0;  // an entry has no flags
  const auto size = load<uint64_t>(at + kObjectSizeAt);
  if (size <= kEntryItemsAt || size > room || ((size - kEntryItemsAt) & (itemSize() - 1)) != 0)
    return 0;
  entry.sequenceNumber = load<uint64_t>(at + kEntrySequenceAt);
  entry.realtime = load<uint64_t>(at + kEntryRealtimeAt);
  entry.monotonic = load<uint64_t>(at + kEntryMonotonicAt);
  entry.bootId = load<Id128>(at + kEntryBootAt);
  entry.contentHash = load<uint64_t>(at + kEntryHashAt);
  // The merge and the range trust these numbers. So an entry is invalid if one of them is greater
  // than any that a daemon writes.
  if (entry.sequenceNumber == 0 || entry.sequenceNumber > kMaxSequenceNumber ||
      entry.realtime == 0 || entry.realtime >= kMaxTime || entry.monotonic >= kMaxTime)
    return 0;
  return size;
}

}  // namespace tessel
