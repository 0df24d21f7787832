// Chains of entry arrays, and the walk from the table of fields to the lists of entries.

#include "journal/EntryIndex.h"

#include <algorithm>
#include <array>
#include <string_view>
#include <utility>

namespace tessel {

using namespace journal_format;

namespace {
// Bytes. If a store has thousands of files, their windows are small and so are the pieces of their
// chains. A piece of 32 entries still keeps system calls rare.
constexpr size_t kSmallestPiece = 256;
}  // namespace

EntryChain::EntryChain(JournalFile& file, uint64_t first, uint64_t count, size_t largestPiece)
    : file_(file),
      itemSize_(file.header().compact() ? 4 : 8),
      count_(count),
      pieceBytes_(std::clamp(file.file().share() / 32, kSmallestPiece, largestPiece)) {
  if (!enterArray(first) && count_ != 0) damagedAt(first);
}

// next() is called for every entry and must stay small enough to be inlined. So the rare part is
// here.
uint64_t EntryChain::firstOfNextPiece() {
  bool more = true;
  while (more && pieceNext_ == pieceSize_) more = loadPiece();
  gapBefore_ = std::exchange(gap_, false);
  return more ? last_ = itemAt(pieceNext_++) : 0;
}

// Begins to read the array at `offset`. The daemon only appends arrays, so in an intact file each
// link leads forward. We refuse a link that leads back, and so no circle of links can hold us.
bool EntryChain::enterArray(uint64_t offset) {
  const uint64_t previous = std::exchange(array_, 0);
  if (offset <= previous || !file_.mayHoldObject(offset, kArrayItemsAt)) return false;
  std::array<uint8_t, kArrayItemsAt> bytes;
  if (file_.file().read(offset, bytes) != bytes.size()) return false;
  const auto object = file_.objectHeader(bytes, file_.objectsEnd() - offset);
  if (!object || object->type != kEntryArray) return false;
  array_ = offset;
  nextArray_ = load<uint64_t>(bytes.data() + kArrayNextAt);
  arraySize_ = (object->size - kArrayItemsAt) / itemSize_;
  arrayIndex_ = 0;
  return true;
}

void EntryChain::finishArray() {
  const uint64_t next = nextArray_;
  const uint64_t last = array_;
  if (next == 0) {
    // The end of a chain and a link that was zeroed look alike. The count tells them apart.
    array_ = 0;
    if (listed_ < count_) damagedAt(last);
  } else if (!enterArray(next)) {
    damagedAt(last);
  }
}

// Reads the next piece, which may be empty; false if the chain has ended.
bool EntryChain::loadPiece() {
  if (array_ == 0) return false;
  const bool growing = file_.header().beingWritten();
  if (growing && listed_ >= count_) {
    array_ = 0;
    return false;
  }
  if (arrayIndex_ == arraySize_) {
    finishArray();
    return array_ != 0;
  }
  uint64_t count = std::min<uint64_t>(arraySize_ - arrayIndex_, pieceBytes_ / itemSize_);
  // The daemon links entries in order and counts them last. So items beyond the count were linked
  // after we read the header, and their entries may be unfinished.
  if (growing) count = std::min(count, count_ - listed_);
  if (!takePiece(static_cast<size_t>(count)))
    damagedAt(array_ + kArrayItemsAt + arrayIndex_ * itemSize_);
  arrayIndex_ += count;
  listed_ += count;
  return true;
}

// Reads `count` items as the next piece. If one of them is wrong, returns false and leaves the
// piece empty. One wrong offset is enough, because damage is rarely a single word, and the search
// finds all entries of the piece anyway.
bool EntryChain::takePiece(size_t count) {
  pieceSize_ = pieceNext_ = 0;
  const uint64_t from = array_ + kArrayItemsAt + arrayIndex_ * itemSize_;
  if (!piece_) piece_ = std::make_unique_for_overwrite<uint8_t[]>(pieceBytes_);
  if (file_.file().read(from, {piece_.get(), count * itemSize_}) != count * itemSize_) return false;
  uint64_t previous = last_;
  for (size_t i = 0; i < count; ++i) {
    const uint64_t offset = itemAt(i);
    if (offset <= previous || !file_.mayHoldObject(offset, kEntryItemsAt)) {
      // All entries that the header counts came before this item. An array is allocated longer than
      // it is filled, so zeros follow, or entries that were linked after we read the header.
      if (listed_ + i < count_) return false;
      pieceSize_ = i;
      array_ = 0;
      return true;
    }
    previous = offset;
  }
  pieceSize_ = count;
  return true;
}

namespace {

// Reading the index costs one read for each field and each value. A real file has some hundred
// fields, and its marked fields have a few values with one list each. A file that exceeds these
// bounds was made to cost time, so we read it without its index.
constexpr uint64_t kMaxFields = 4096;
constexpr uint64_t kMaxFieldTable = uint64_t{1} << 20;  // bytes; real tables have 5 KiB
constexpr size_t kMaxValues = 1024;
constexpr size_t kMaxLists = 16;
constexpr size_t kListPiece = 1024;  // bytes; a quarter of a chain's, because there are many lists

std::string_view textAt(const uint8_t* at, size_t size) {
  return {reinterpret_cast<const char*>(at), size};
}

}  // namespace

// Walks from the table of fields to the values of the marked fields, and from there to their lists.
// Every step returns false if it finds the index damaged or too large. No read uses the window: the
// objects lie far apart, and each would load a whole window.
class MarkedEntries::IndexReader {
 public:
  IndexReader(JournalFile& file, const StopFlag& stop) : file_(file), stop_(stop) {}

  bool read(std::span<const EntryMark> marks) {
    const JournalHeader& header = file_.header();
    if (marks.empty() || header.beingWritten() || header.fieldCount > kMaxFields) return false;
    for (const EntryMark& mark : marks) {
      fields_.push_back({mark.field});
      for (const std::string_view name : mark.companions) fields_.push_back({name});
    }
    return findFields() && std::all_of(marks.begin(), marks.end(),
                                       [this](const EntryMark& mark) { return take(mark); });
  }
  std::vector<List> lists() { return std::move(lists_); }

 private:
  struct Field {
    std::string_view name;
    uint64_t firstValue = 0;  // 0: the file has no such field
  };

  bool findFields();
  bool followBucket(uint64_t offset);
  bool take(const EntryMark& mark);
  bool takeValues(std::string_view name, std::string_view value, bool listed, uint64_t& entries);
  bool addList(const uint8_t* data, uint64_t entries);
  bool stopped() const { return stop_.load(std::memory_order_relaxed); }
  bool readObject(uint64_t offset, ObjectType type, size_t least, std::span<uint8_t> target);

  JournalFile& file_;
  const StopFlag& stop_;
  std::vector<Field> fields_;  // the fields of all marks and their companions
  uint64_t found_ = 0;         // how many fields the table led to, whatever their names
  std::vector<List> lists_;
};

// Reads the beginning of the object at `offset` into `target`. True if the object has the type
// `type` and at least `least` bytes were read.
bool MarkedEntries::IndexReader::readObject(uint64_t offset, ObjectType type, size_t least,
                                            std::span<uint8_t> target) {
  if (stopped() || !file_.mayHoldObject(offset, least)) return false;
  const uint64_t room = file_.objectsEnd() - offset;
  const size_t got = file_.file().read(
      offset, target.first(static_cast<size_t>(std::min<uint64_t>(room, target.size()))));
  if (got < least) return false;
  const auto object = file_.objectHeader(target.first(got), room);
  return object && object->type == type;
}

bool MarkedEntries::IndexReader::findFields() {
  const JournalHeader& header = file_.header();
  std::array<uint8_t, 4096> buckets;
  if (header.fieldTableSize > kMaxFieldTable || header.fieldTableSize % kBucketSize != 0 ||
      header.fieldTable < kObjectHeaderSize ||
      !readObject(header.fieldTable - kObjectHeaderSize, kFieldHashTable, kObjectHeaderSize,
                  std::span(buckets).first(kObjectHeaderSize)) ||
      load<uint64_t>(buckets.data() + kObjectSizeAt) != kObjectHeaderSize + header.fieldTableSize)
    return false;
  for (uint64_t at = 0; at < header.fieldTableSize; at += buckets.size()) {
    const size_t size =
        static_cast<size_t>(std::min<uint64_t>(buckets.size(), header.fieldTableSize - at));
    if (file_.file().read(header.fieldTable + at, std::span(buckets).first(size)) != size)
      return false;
    for (size_t i = 0; i < size; i += kBucketSize)
      if (!followBucket(load<uint64_t>(buckets.data() + i))) return false;
  }
  return found_ == header.fieldCount;
}

// Looks at the fields of one bucket. The first is at `offset`; 0: the bucket is empty. We count the
// fields of all buckets: the count ends a circle of links, and shows in the end whether we missed a
// field.
bool MarkedEntries::IndexReader::followBucket(uint64_t offset) {
  std::array<uint8_t, kFieldHeaderSize + kMaxFieldNameLength> bytes;
  while (offset != 0) {
    if (++found_ > file_.header().fieldCount ||
        !readObject(offset, kField, kFieldHeaderSize + 1, bytes))
      return false;
    const uint64_t length = load<uint64_t>(bytes.data() + kObjectSizeAt) - kFieldHeaderSize;
    const std::string_view name =
        textAt(bytes.data() + kFieldHeaderSize, std::min<uint64_t>(length, kMaxFieldNameLength));
    for (Field& field : fields_)
      if (length == name.size() && name == field.name)
        field.firstValue = load<uint64_t>(bytes.data() + kFieldFirstValueAt);
    offset = load<uint64_t>(bytes.data() + kNextInBucketAt);
  }
  return true;
}

// The field's lists would hide an entry that has a companion but not the field. If field and
// companion have different counts, there is such an entry or the reverse, and we do not use the
// index. Only the companions' lists could show that equal counts mean the same entries; reading
// them would cost what the index saves.
bool MarkedEntries::IndexReader::take(const EntryMark& mark) {
  uint64_t entries = 0;
  if (!takeValues(mark.field, mark.value, true, entries)) return false;
  return std::all_of(mark.companions.begin(), mark.companions.end(), [&](std::string_view name) {
    uint64_t others = 0;
    return takeValues(name, {}, false, others) && others == entries;
  });
}

// Follows the values of the field `name`, the newest first. Adds to `entries` how many entries have
// one of them; if `value` is not empty, only that value counts. If `listed`, follows their lists
// too. A compressed value does not begin with the field's name, so one such value makes this return
// false.
bool MarkedEntries::IndexReader::takeValues(std::string_view name, std::string_view value,
                                            bool listed, uint64_t& entries) {
  const size_t headerSize = file_.dataHeaderSize();
  std::array<uint8_t, 256> bytes;
  uint64_t previous = kNone;
  uint64_t offset = std::find_if(fields_.begin(), fields_.end(), [&](const Field& field) {
                      return field.name == name;
                    })->firstValue;
  for (size_t values = 0; offset != 0; ++values) {
    if (values == kMaxValues || offset >= previous ||
        !readObject(offset, kData, headerSize + name.size() + 1, bytes))
      return false;
    const uint64_t size = load<uint64_t>(bytes.data() + kObjectSizeAt) - headerSize;
    const std::string_view text =
        textAt(bytes.data() + headerSize, std::min<uint64_t>(size, bytes.size() - headerSize));
    const auto count = load<uint64_t>(bytes.data() + kDataEntryCountAt);
    if (text.size() <= name.size() || !text.starts_with(name) || text[name.size()] != '=' ||
        count == 0 || count > file_.header().entryCount)
      return false;
    const bool counts =
        value.empty() || (size == text.size() && text.substr(name.size() + 1) == value);
    entries += counts ? count : 0;
    if (listed && counts && !addList(bytes.data(), count)) return false;
    previous = std::exchange(offset, load<uint64_t>(bytes.data() + kNextValueAt));
  }
  return true;
}

// The data object itself names its first entry, because most values occur once and then need no
// array.
bool MarkedEntries::IndexReader::addList(const uint8_t* data, uint64_t entries) {
  if (lists_.size() == kMaxLists) return false;
  const auto first = load<uint64_t>(data + kDataFirstEntryAt);
  lists_.push_back(
      {EntryChain(file_, load<uint64_t>(data + kDataEntryArrayAt), entries - 1, kListPiece),
       entries - 1, first, 0});
  return first != 0 && lookAhead(lists_.back());
}

std::unique_ptr<MarkedEntries> MarkedEntries::of(JournalFile& file,
                                                 std::span<const EntryMark> marks,
                                                 size_t& listsLeft, const StopFlag& stop) {
  IndexReader reader(file, stop);
  if (!reader.read(marks)) return nullptr;
  auto marked = std::make_unique<MarkedEntries>();
  marked->lists_ = reader.lists();
  if (marked->lists_.size() > listsLeft) return nullptr;
  listsLeft -= marked->lists_.size();  // not given back: all files are opened before one ends
  marked->nearest_ = kNone;
  for (const List& list : marked->lists_) marked->nearest_ = std::min(marked->nearest_, list.next);
  return marked;
}

// `offset` is the nearest listed offset or greater. If it is greater, the reader met no entry at
// the listed offset, so that offset is wrong.
bool MarkedEntries::look(uint64_t offset) {
  missed_ = nearest_ < offset;
  usable_ = !missed_;
  nearest_ = kNone;
  for (List& list : lists_) {
    if (list.next == offset) usable_ = advance(list) && usable_;
    nearest_ = std::min(nearest_, list.next);
  }
  return true;
}

// Reads one entry further than we need. An offset that is too large would hide all marked entries
// up to it; the smaller offset behind it shows the damage before that happens. False if the list is
// damaged, or longer or shorter than its value says.
bool MarkedEntries::lookAhead(List& list) {
  const uint64_t ahead = list.rest.next();
  const bool more = list.left != 0;
  list.left -= more;
  list.ahead = more ? ahead : kNone;
  return !list.rest.gapBefore() && (ahead != 0) == more && (!more || ahead > list.next);
}

bool MarkedEntries::advance(List& list) {
  list.next = list.ahead;
  return list.next == kNone || lookAhead(list);
}

}  // namespace tessel
