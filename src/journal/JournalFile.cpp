// The checks of headers, entries and data objects.

#include "journal/JournalFile.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "journal/JournalHash.h"
#include "os/Files.h"

namespace tessel {

using namespace journal_format;

std::variant<JournalHeader, std::string> parseJournalHeader(std::span<const uint8_t> bytes,
                                                            uint64_t fileSize) {
  if (bytes.empty()) return "it is empty";
  if (bytes.size() < kMinHeaderSize) return "too short for a journal";
  const uint8_t* at = bytes.data();
  if (std::memcmp(at, kSignature, 8) != 0) return "not a journal file";
  JournalHeader header;
  header.incompatibleFlags = load<uint32_t>(at + kIncompatibleFlagsAt);
  header.state = at[kStateAt];
  header.fileId = load<Id128>(at + kFileIdAt);
  header.sequenceId = load<Id128>(at + kSequenceIdAt);
  header.headerSize = load<uint64_t>(at + kHeaderSizeAt);
  // With the shortest header, the reader finds the first object by itself.
  if (!aligned(header.headerSize) || header.headerSize < kMinHeaderSize ||
      header.headerSize > std::min(fileSize, kMaxHeaderSize))
    header.headerSize = kMinHeaderSize;
  // A damaged offset must not hide the objects behind it.
  header.lastObject = load<uint64_t>(at + kTailObjectAt);
  if (!aligned(header.lastObject) || header.lastObject < header.headerSize ||
      header.lastObject >= fileSize)
    header.lastObject = UINT64_MAX;
  // We report as missing the entries that are counted but not found. So a damaged count must not be
  // greater than the file's room for entries.
  header.entryCount = std::min(load<uint64_t>(at + kEntryCountAt), fileSize / kEntryItemsAt);
  header.entryArray = load<uint64_t>(at + kEntryArrayAt);
  header.headRealtime = load<uint64_t>(at + kHeadRealtimeAt);
  header.tailRealtime = load<uint64_t>(at + kTailRealtimeAt);
  header.tailMonotonic = load<uint64_t>(at + kTailMonotonicAt);
  return header;
}

// The daemon may append between the two calls. We ask for the size last, so that it covers
// everything that the header counts.
std::variant<JournalBeginning, PlatformError> readJournalHeader(int fd) {
  std::array<uint8_t, kMinHeaderSize> bytes;
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

std::optional<JournalHeader> JournalFile::headerNow() {
  std::array<uint8_t, kMinHeaderSize> bytes;
  if (file_.read(0, bytes) != bytes.size()) return std::nullopt;
  auto parsed = parseJournalHeader(bytes, file_.size());
  const auto* header = std::get_if<JournalHeader>(&parsed);
  return header != nullptr ? std::optional(*header) : std::nullopt;
}

bool JournalFile::beingWritten() {
  if (writtenSince_ || header_.wasBeingWritten()) return true;
  const auto now = headerNow();
  writtenSince_ = now && (now->wasBeingWritten() || now->tailRealtime != header_.tailRealtime);
  return writtenSince_;
}

bool JournalFile::readData(uint64_t offset, size_t most, std::span<uint8_t> scratch,
                           DataObject& data) {
  if (!mayHoldObject(offset, dataHeaderSize_ + 1)) return false;
  const uint64_t room = objectsEnd() - offset;
  const uint64_t wanted = std::min<uint64_t>(room, dataHeaderSize_ + most);
  std::span<const uint8_t> bytes = file_.restOfWindow(offset);
  // The window may end within the object. Its size is then unknown or too large for the window.
  if (bytes.size() < wanted && (bytes.size() < kObjectHeaderSize ||
                                bytes.size() < load<uint64_t>(bytes.data() + kObjectSizeAt))) {
    bytes = {scratch.data(), file_.read(offset, scratch.first(static_cast<size_t>(wanted)))};
  }
  if (bytes.size() <= dataHeaderSize_) return false;
  data.compression = bytes[1];
  if (bytes[0] != kData || (data.compression & ~kKnownDataFlags) != 0) return false;
  const auto size = load<uint64_t>(bytes.data() + kObjectSizeAt);
  const uint64_t shown = std::min(size, wanted);
  if (size <= dataHeaderSize_ || size > room || shown > bytes.size()) return false;
  data.hash = load<uint64_t>(bytes.data() + kDataHashAt);
  data.entryCount = load<uint64_t>(bytes.data() + kDataEntryCountAt);
  data.payloadOffset = offset + dataHeaderSize_;
  data.payloadSize = size - dataHeaderSize_;
  data.head = bytes.first(static_cast<size_t>(shown)).subspan(dataHeaderSize_);
  return true;
}

bool JournalFile::hashOfData(std::span<const uint8_t> text, uint64_t hash) const {
  return hash == (header_.keyedHash() ? sipHash24(text, header_.fileId) : lookup3(text));
}

}  // namespace tessel
