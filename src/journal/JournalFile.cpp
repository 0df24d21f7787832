// The checks of headers, entries and data objects.

#include "journal/JournalFile.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "os/Files.h"

namespace tessel {

using namespace journal_format;

namespace {

// The smallest size of a valid object. A writer makes no object that holds nothing, so an empty one
// is damage.
uint64_t leastSize(uint8_t type, size_t dataHeaderSize) {
  switch (type) {
    case kData:
      return dataHeaderSize + 1;
    case kField:
      return kFieldHeaderSize + 1;
    case kEntry:
      return kEntryItemsAt + kCompactEntryItemSize;
    case kEntryArray:
      return kArrayItemsAt + kCompactEntryItemSize;
    case kTag:
      return kTagSize;
    default:
      return kObjectHeaderSize + 1;
  }
}

Id128 loadId(const uint8_t* at) {
  Id128 id;
  std::memcpy(id.data(), at, id.size());
  return id;
}

// Where the objects end. Usually that is the end of the arena; but if the arena still grows, or
// says that it is larger than the file, it is the end of the file. If the size of the header itself
// is damaged, we assume the shortest header, and the search finds the first object behind it.
uint64_t endOfObjects(JournalHeader& header, uint64_t arenaSize, uint64_t fileSize) {
  if (!aligned(header.headerSize) || header.headerSize < kMinHeaderSize ||
      header.headerSize > std::min(fileSize, kMaxHeaderSize)) {
    header.headerSize = kMinHeaderSize;
    return fileSize;
  }
  if (header.beingWritten() || arenaSize > fileSize - header.headerSize) return fileSize;
  return header.headerSize + arenaSize;
}

}  // namespace

std::variant<JournalHeader, std::string> parseJournalHeader(std::span<const uint8_t> bytes,
                                                            uint64_t fileSize) {
  if (bytes.empty()) return "it is empty";
  if (bytes.size() < kMinHeaderSize) return "too short for a journal";
  const uint8_t* at = bytes.data();
  if (std::memcmp(at, kSignature, 8) != 0) return "not a journal file";
  JournalHeader header;
  header.incompatibleFlags = load<uint32_t>(at + kIncompatibleFlagsAt);
  header.state = at[kStateAt];
  header.sequenceId = loadId(at + kSequenceIdAt);
  header.headerSize = load<uint64_t>(at + kHeaderSizeAt);
  header.objectsEnd = endOfObjects(header, load<uint64_t>(at + kArenaSizeAt), fileSize);
  // A closed file has no unfinished objects. If the offset is damaged, we do not use it: otherwise
  // it would hide intact objects.
  const auto lastObject = load<uint64_t>(at + kTailObjectAt);
  const bool growing = header.beingWritten() && aligned(lastObject) &&
                       lastObject >= header.headerSize && lastObject < header.objectsEnd;
  header.lastObject = growing ? lastObject : UINT64_MAX;
  // We report as missing the entries that are counted but not found. So a damaged count must not be
  // greater than the file's room for entries.
  header.entryCount = std::min(load<uint64_t>(at + kEntryCountAt), fileSize / kEntryItemsAt);
  header.entryArray = load<uint64_t>(at + kEntryArrayAt);
  header.headRealtime = load<uint64_t>(at + kHeadRealtimeAt);
  header.tailRealtime = load<uint64_t>(at + kTailRealtimeAt);
  // Old headers lack these values. They then stay 0, and the index is not used.
  if (bytes.size() >= kHeaderRead && header.headerSize >= kHeaderRead) {
    header.fieldTable = load<uint64_t>(at + kFieldTableAt);
    header.fieldTableSize = load<uint64_t>(at + kFieldTableSizeAt);
    header.fieldCount = load<uint64_t>(at + kFieldCountAt);
  }
  return header;
}

// The daemon may append between the two calls. We ask for the size last, so that it covers
// everything that the header counts.
std::variant<JournalBeginning, PlatformError> readJournalHeader(int fd) {
  std::array<uint8_t, kHeaderRead> bytes;
  const ssize_t got = ::pread(fd, bytes.data(), bytes.size(), 0);
  struct stat status {};
  if (got < 0 || ::fstat(fd, &status) != 0) return PlatformError{codeOf(errno), errorWords(errno)};
  const auto fileSize = static_cast<uint64_t>(status.st_size);
  auto parsed = parseJournalHeader(std::span(bytes).first(static_cast<size_t>(got)), fileSize);
  if (auto* reason = std::get_if<std::string>(&parsed))
    return PlatformError{ErrorCode::notAStore, std::move(*reason)};
  return JournalBeginning{std::get<JournalHeader>(parsed), fileSize};
}

// Both sizes are needed for every entry, so we compute them once.
JournalFile::JournalFile(UniqueFd fd, uint64_t size, const JournalHeader& header,
                         WindowBudget& budget)
    : header_(header),
      file_(std::move(fd), size, budget),
      itemShift_(std::countr_zero(header.compact() ? kCompactEntryItemSize : kEntryItemSize)),
      dataHeaderSize_(header.compact() ? kCompactDataHeaderSize : kDataHeaderSize) {}

std::optional<ObjectHeader> JournalFile::objectHeader(std::span<const uint8_t> bytes,
                                                      uint64_t room) const {
  const uint64_t first = load<uint64_t>(bytes.data());
  ObjectHeader object{static_cast<uint8_t>(first & 0xff), static_cast<uint8_t>(first >> 8 & 0xff),
                      load<uint64_t>(bytes.data() + kObjectSizeAt)};
  // The six bytes behind type and flags are zero, and only data objects have flags. These checks
  // keep most garbage from being taken for an object.
  if (first >> 16 != 0 || object.type == kUnused || object.type > kTag) return std::nullopt;
  if (object.flags != 0 && (object.type != kData || (object.flags & ~kKnownDataFlags) != 0))
    return std::nullopt;
  if (object.size < leastSize(object.type, dataHeaderSize_) || object.size > room)
    return std::nullopt;
  return object;
}

uint64_t JournalFile::readEntry(uint64_t offset, uint64_t from, EntryHeader& entry) {
  if (!mayHoldObject(offset, kEntryItemsAt)) return 0;
  // Computed first: at() may find the file cut before `offset`, and objectsEnd() then moves.
  const uint64_t room = objectsEnd() - offset;
  const uint8_t* at = file_.at(offset, kEntryItemsAt, from);
  // The first word is the type alone: an entry has no flags, and the reserved bytes are zero.
  if (at == nullptr || load<uint64_t>(at) != kEntry) return 0;
  const auto size = load<uint64_t>(at + kObjectSizeAt);
  if (size <= kEntryItemsAt || size > room || (size - kEntryItemsAt) % itemSize() != 0) return 0;
  entry.sequenceNumber = load<uint64_t>(at + kEntrySequenceAt);
  entry.realtime = load<uint64_t>(at + kEntryRealtimeAt);
  entry.monotonic = load<uint64_t>(at + kEntryMonotonicAt);
  entry.bootId = loadId(at + kEntryBootAt);
  entry.contentHash = load<uint64_t>(at + kEntryHashAt);
  // The merge and the range trust these numbers. So an entry is invalid if one of them is greater
  // than any that a daemon writes.
  if (entry.sequenceNumber == 0 || entry.sequenceNumber > kMaxSequenceNumber ||
      entry.realtime == 0 || entry.realtime >= kMaxTime || entry.monotonic >= kMaxTime)
    return 0;
  return size;
}

bool JournalFile::readData(uint64_t offset, std::span<uint8_t, kMaxDataRead> scratch,
                           DataObject& data) {
  if (!mayHoldObject(offset, dataHeaderSize_ + 1)) return false;
  const uint64_t room = objectsEnd() - offset;
  const uint64_t wanted = std::min(room, dataHeaderSize_ + kMaxFieldHead);
  std::span<const uint8_t> bytes = file_.restOfWindow(offset);
  // The window may end within the object. Its size is then unknown or too large for the window.
  if (bytes.size() < wanted && (bytes.size() < kObjectHeaderSize ||
                                bytes.size() < load<uint64_t>(bytes.data() + kObjectSizeAt))) {
    bytes = {scratch.data(), file_.read(offset, {scratch.data(), static_cast<size_t>(wanted)})};
  }
  if (bytes.size() <= dataHeaderSize_) return false;
  const auto first = load<uint64_t>(bytes.data());
  data.compression = static_cast<uint8_t>(first >> 8);
  // The first word: type, flags, and six bytes that are zero.
  if ((first & ~(uint64_t{kKnownDataFlags} << 8)) != kData) return false;
  const auto size = load<uint64_t>(bytes.data() + kObjectSizeAt);
  const uint64_t shown = std::min(size, wanted);
  if (size <= dataHeaderSize_ || size > room || shown > bytes.size()) return false;
  data.entryCount = load<uint64_t>(bytes.data() + kDataEntryCountAt);
  data.payloadOffset = offset + dataHeaderSize_;
  data.payloadSize = size - dataHeaderSize_;
  data.head = bytes.first(static_cast<size_t>(shown)).subspan(dataHeaderSize_);
  return true;
}

}  // namespace tessel
