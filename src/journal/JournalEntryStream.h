// JournalEntryStream: the entries of one journal file, in the file's own order.
//
// EntryWalk finds the entries, and the window moves forward over the file. A writer puts a new data
// object directly before the first entry that refers to it, so the window usually holds both. The
// stream has read older data objects before, and the token cache remembers most of them.
//
// Few entries of a day have a mark (see FieldTokenizer::marks()), and to make tokens of all fields
// of all entries would be most of the work. So we first ask of each field only whether it is a
// mark. DataMarks answers that, because the walk has shown it every data object. Nothing but the
// entry itself and the data objects that it names has a say, so no wrong word elsewhere can hide an
// entry. A trace point has several marks, so one wrong word in the entry cannot hide it either.
//
// Each entry that has a mark is compared with its own hash, which covers the texts of all its
// fields. If they differ, a text or the list of fields is not what the daemon wrote. The hashes of
// the data objects tell which: a field with a wrong text is left out; if all texts are right, the
// entry names wrong ones and all its fields are left out. Entries without a mark are not compared,
// because reading every text would cost more than all else.
//
// Threads: one at a time, except for the stop flag.

#pragma once

#include <array>
#include <map>
#include <memory>
#include <optional>
#include <string_view>
#include <vector>

#include "journal/DataMarks.h"
#include "journal/Decompressor.h"
#include "journal/EntryStream.h"
#include "journal/EntryWalk.h"
#include "journal/JournalFile.h"
#include "journal/StoreReport.h"
#include "journal/TokenCache.h"

namespace tessel {

// What the readers of all files of a store share, so that memory does not grow with their number.
// Only one of them collects the tokens of an entry at a time, so one set of buffers is enough.
struct JournalReadResources {
  // Bytes. An entry with a longer text is not compared with its hash. Nearly all texts of trace
  // points have less than 100 bytes.
  static constexpr size_t kLongestHashed = size_t{64} << 10;

  WindowBudget windows;
  TokenCache tokenCache;
  Decompressor decompressor;
  std::array<uint8_t, JournalFile::kMaxDataHeader + kLongestHashed> data;
  std::array<uint8_t, kLongestHashed> text;
  std::array<FieldToken, JournalFile::kMaxItems> tokens;  // of the current entry
  size_t placesLeft = DataMarks::kTotal;
  // Nanoseconds that the values of all files may take beyond what the size of each file allows. A
  // small file may hold a value that unpacks to a thousand times its size.
  uint64_t spareWork = 100'000'000;
};

class JournalEntryStream final : public EntryStream {
 public:
  // What a stream works with. All of it must outlive the stream.
  struct Context {
    JournalReadResources& resources;
    FieldTokenizer& tokenizer;
    std::span<const std::string_view> marks;  // the tokenizer's, made once for all files
    const StopFlag& stop;
    FileReport& report;
  };

  // `number` is different for each file of a store and below JournalStore::kMaxFiles.
  JournalEntryStream(std::unique_ptr<JournalFile> file, uint32_t number, const Context& context);

  bool next() override;
  const EntryHeader& header() const override { return walk_.header(); }
  std::span<const FieldToken> tokens() override;

 private:
  struct Text {
    std::span<const uint8_t> head;
    uint64_t size = 0;   // of the whole text, or any greater number than that of `head`
    bool whole = false;  // `head` is the whole text
  };

  // Here and below: what few entries need is not inlined, so that it takes no registers and no
  // stack from next() and tokens(). Together this saves 40 of 860 instructions an entry.
  void checkTime();
  [[gnu::noinline]] void finish();
  bool lastHasOtherTimes();
  bool stopped() const { return context_.stop.load(std::memory_order_relaxed); }
  template <typename Item>
  size_t collectTokens();
  template <typename Item>
  bool hasMark(const uint8_t* items, size_t count);
  [[gnu::noinline]] bool isMark(uint64_t offset);
  template <typename Item>
  size_t tokensOf(const uint8_t* items, size_t count);
  template <typename Item>
  [[gnu::noinline]] size_t intactTokensOf(const uint8_t* items, size_t count);
  [[gnu::noinline]] TokenCache::Value missed(uint64_t offset);
  TokenCache::Value rememberedOrNew(uint64_t offset);
  TokenCache::Value newTokenAt(uint64_t offset);
  void remember(uint64_t offset, const DataObject& data, TokenCache::Value value);
  std::optional<Text> textAt(uint64_t offset, DataObject& data);
  FieldToken tokenOf(const Text& text);
  bool allows(uint64_t nanoseconds);
  std::optional<Decompressor::Result> decompress(const DataObject& data, std::span<uint8_t> target);

  const std::unique_ptr<JournalFile> owned_;
  JournalFile& file_;
  const uint32_t number_;
  Context context_;
  const uint32_t& generation_;  // of the tokenizer
  const uint64_t allowed_;      // nanoseconds that the values of the file may take
  uint64_t work_ = 0;           // that they took, estimated
  DataMarks marks_;
  EntryWalk walk_;
  // The objects from here to the entry were written for it, and it has not named them yet. So
  // nothing is remembered of them.
  uint64_t fresh_ = 0;
  size_t markIndex_ = 0;  // which field of the last entry with a mark was found to be one
  // Boot and difference of the two clocks, as the entries before had them.
  Id128 usualBoot_{};
  uint64_t usualDifference_ = 0;
  uint64_t unusualEntry_ = 0;  // offset of the last entry, if it differed from that; 0: it did not
  // The tokens of texts that are too long for the cache. A compressed one takes long to read, and
  // all entries of a program may have it. A file that has more than 256 of them is read more
  // slowly.
  static constexpr size_t kMaxLongTexts = 256;
  std::map<uint64_t, FieldToken> longTexts_;
  uint32_t longTextsGeneration_ = 0;
  bool finished_ = false;
  bool comparable_ = true;  // the current entry can be compared with its hash
};

}  // namespace tessel
