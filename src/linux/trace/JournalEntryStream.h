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
#include <optional>
#include <vector>

#include "linux/trace/Decompressor.h"
#include "linux/trace/EntryChain.h"
#include "linux/trace/EntrySearch.h"
#include "linux/trace/EntryStream.h"
#include "linux/trace/JournalFile.h"
#include "linux/trace/StoreReport.h"
#include "linux/trace/TokenCache.h"

namespace tessel {

// What the readers of all files of a store share, to stay within a fixed amount of memory.
struct JournalReadResources {
  WindowBudget windows;
  TokenCache tokens;
  Decompressor decompressor;
  std::array<uint8_t, JournalFile::kMaxDataRead> data;
  std::array<uint8_t, kMaxFieldHead> text;
};

class JournalEntryStream final : public EntryStream {
 public:
  // What a stream works with; all of it must outlive the stream.
  struct Context {
    JournalReadResources& resources;
    FieldTokenizer& tokenizer;
    const StopFlag& stop;
    FileReport& report;
  };

  // Reads the file of `fd`, of `size` bytes, whose header is `header`. `number` tells the files of
  // one store apart and is below TraceStore::kMaxFiles.
  JournalEntryStream(UniqueFd fd, uint64_t size, const JournalHeader& header, uint32_t number,
                     const Context& context);

  bool next() override;
  const EntryHeader& header() const override { return entry_; }
  Entry entry() override;

 private:
  std::optional<uint64_t> nextOffset();
  bool take(uint64_t offset);
  void searchUntil(uint64_t end);
  void endSearch();
  void finish();
  void collectTokens();
  FieldToken tokenAt(uint64_t offset, uint32_t generation);
  FieldToken newTokenAt(uint64_t offset, uint32_t generation);
  std::optional<FieldToken> readToken(const DataObject& data);
  std::optional<FieldToken> decompressToken(const DataObject& data);
  std::optional<FieldToken> textToken(std::span<const uint8_t> head, uint64_t size);

  JournalFile file_;
  const uint32_t number_;
  Context context_;
  EntryChain chain_;
  std::optional<EntrySearch> search_;
  std::optional<uint64_t> pending_;  // what the chain lists behind the stretch being searched
  bool finished_ = false;  // the chain has ended
  bool reported_ = false;  // what was missing is in the report
  uint64_t delivered_ = 0;
  uint64_t searchedTo_ = 0;   // before this, nothing is left to be found
  uint64_t firstFresh_ = 0;   // data from here on is first referred to by the current entry
  EntryHeader entry_;
  uint64_t entryOffset_ = 0;
  uint64_t entrySize_ = 0;
  std::vector<FieldToken> tokens_;
};

}  // namespace tessel
