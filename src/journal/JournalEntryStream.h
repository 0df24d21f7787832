// JournalEntryStream: the entries of one journal file, in the file's own order.
//
// The stream follows the chain of entry arrays from entry to entry, and its window moves forward
// over the file. A writer puts a new data object directly before the first entry that refers to it,
// so the window usually holds both. The stream has read older data objects before, and the token
// cache remembers most of them.
//
// If the chain or an entry is damaged, the stream searches the part up to the next listed entry
// object by object. The offsets of delivered entries only grow, so no entry is delivered twice,
// even if the search finds it and the chain lists it too.
//
// Threads: one at a time, except for the stop flag.

#pragma once

#include <array>
#include <memory>
#include <optional>

#include "journal/Decompressor.h"
#include "journal/EntryIndex.h"
#include "journal/EntrySearch.h"
#include "journal/EntryStream.h"
#include "journal/JournalFile.h"
#include "journal/StoreReport.h"
#include "journal/TokenCache.h"

namespace tessel {

// What the readers of all files of a store share, so that memory does not grow with their number.
// Only one of them collects the tokens of an entry at a time, so one set of buffers is enough.
struct JournalReadResources {
  WindowBudget windows;
  TokenCache tokenCache;
  Decompressor decompressor;
  std::array<uint8_t, JournalFile::kMaxDataRead> data;
  std::array<uint8_t, kMaxFieldHead> text;
  std::array<FieldToken, JournalFile::kMaxItems> tokens;  // of the current entry
  size_t entryListsLeft = MarkedEntries::kMaxListsOfStore;
};

class JournalEntryStream final : public EntryStream {
 public:
  // What a stream works with. All of it must outlive the stream.
  struct Context {
    JournalReadResources& resources;
    FieldTokenizer& tokenizer;
    std::span<const EntryMark> marks;  // the tokenizer's, made once for all files
    const StopFlag& stop;
    FileReport& report;
  };

  // Reads the file of `fd`, which has `size` bytes and the header `header`. `number` is different
  // for each file of a store and below JournalStore::kMaxFiles.
  JournalEntryStream(UniqueFd fd, uint64_t size, const JournalHeader& header, uint32_t number,
                     const Context& context);

  bool next() override;
  const EntryHeader& header() const override { return entry_; }
  Entry entry() override;

 private:
  uint64_t nextListed();
  uint64_t nextFound();
  bool take(uint64_t offset);
  bool isMarked(uint64_t offset);
  void searchUpTo(uint64_t listed);
  void endSearch();
  void finish();
  size_t collectTokens();
  template <typename Item>
  size_t tokensOf(const uint8_t* items, size_t count);
  FieldToken newTokenAt(uint64_t offset);
  FieldToken decompressToken(const DataObject& data);
  FieldToken textToken(std::span<const uint8_t> head, uint64_t size);

  JournalFile file_;
  const uint32_t number_;
  Context context_;
  EntryChain chain_;
  std::unique_ptr<MarkedEntries> marked_;  // null: we look into every entry
  std::optional<EntrySearch> search_;
  uint64_t pending_ = 0;   // the listed entry that follows the searched part; 0: none
  bool finished_ = false;  // the chain has ended
  bool reported_ = false;  // finish() was done
  uint64_t delivered_ = 0;
  uint64_t searchedTo_ = 0;  // entries before this offset were delivered or are lost
  uint64_t firstFresh_ = 0;  // data objects from here on were written for the current entry
  EntryHeader entry_;
  uint64_t entryOffset_ = 0;
  uint64_t entrySize_ = 0;
  bool entryMarked_ = true;  // false: entry() leaves out the tokens
};

}  // namespace tessel
