// JournalEntryStream: the entries of one journal file, in the file's own order.
//
// The chain of entry arrays leads from entry to entry while a window moves forward over the file,
// which shows nearly every data object just before the first entry that refers to it. Where the
// chain is damaged, the stretch that it should cover is searched object by object. Offsets only
// ever grow, so no entry is delivered twice.
//
// Threads: one at a time, but for the stop flag.

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

// What the readers of all files of a store share, to stay within a fixed amount of memory.
struct JournalReadResources {
  WindowBudget windows;
  TokenCache tokenCache;
  Decompressor decompressor;
  std::array<uint8_t, JournalFile::kMaxDataRead> data;
  std::array<uint8_t, kMaxFieldHead> text;
  std::array<FieldToken, JournalFile::kMaxItems> tokens;  // of the entry that is looked at
  size_t entryListsLeft = MarkedEntries::kMaxListsOfStore;
};

class JournalEntryStream final : public EntryStream {
 public:
  // What a stream works with; all of it must outlive the stream.
  struct Context {
    JournalReadResources& resources;
    FieldTokenizer& tokenizer;
    std::span<const EntryMark> marks;  // of the tokenizer
    const StopFlag& stop;
    FileReport& report;
  };

  // Reads the file of `fd`, of `size` bytes, whose header is `header`. `number` tells the files of
  // one store apart and is below JournalStore::kMaxFiles.
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
  std::unique_ptr<MarkedEntries> marked_;  // null: every entry may carry a mark
  std::optional<EntrySearch> search_;
  uint64_t pending_ = 0;   // what the chain lists behind the stretch being searched; 0: nothing
  bool finished_ = false;  // the chain has ended
  bool reported_ = false;  // what was missing is in the report
  uint64_t delivered_ = 0;
  uint64_t searchedTo_ = 0;  // before this, nothing is left to be found
  uint64_t firstFresh_ = 0;  // data from here on is first referred to by the current entry
  EntryHeader entry_;
  uint64_t entryOffset_ = 0;
  uint64_t entrySize_ = 0;
  bool entryMarked_ = true;
};

}  // namespace tessel
