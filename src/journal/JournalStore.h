// JournalStore: the journal and export files of one place, opened for one time range and merged.
//
// A store is a directory that holds `*.journal`, `*.journal~` or `*.export` files at any depth, one
// such file, or the machine's own journal. Its files are held open from the beginning and known by
// device and inode, so that a rotation meanwhile neither loses a file nor reads it twice.
//
// Threads: one at a time, but for the stop flag.

#pragma once

#include <memory>
#include <optional>
#include <string>
#include <variant>

#include "journal/EntryStream.h"
#include "journal/StoreReport.h"
#include "platform/Error.h"

namespace tessel {

// Microseconds since 1970, UTC: start <= realtime < end.
struct TimeRange {
  uint64_t start = 0;
  uint64_t end = UINT64_MAX;
};

class JournalStore {
 public:
  // Files of a store that are looked at; the others are counted in the report.
  static constexpr size_t kMaxFiles = 8192;
  // Files of a layout that is not known; each is read by a journalctl of its own.
  static constexpr size_t kMaxForeignFiles = 16;

  // Opens the store at `path`, the machine's own journal where it is absent. An error names the
  // path and the reason: there is no such place, it may not be read, it holds nothing that is a
  // journal store. A damaged file among good ones is no error but a line of the report.
  // `tokenizer` and `stop` must outlive the store.
  static std::variant<std::unique_ptr<JournalStore>, PlatformError> open(
      const std::optional<std::string>& path, TimeRange range, FieldTokenizer& tokenizer,
      const StopFlag& stop);

  ~JournalStore();
  JournalStore(const JournalStore&) = delete;
  JournalStore& operator=(const JournalStore&) = delete;

  // The entries of the range in the journal's own order, each once.
  EntryStream& entries();
  // What is known so far; complete once entries().next() has answered false.
  StoreReport report() const;

 private:
  struct State;
  explicit JournalStore(std::unique_ptr<State> state);

  std::unique_ptr<State> state_;
};

}  // namespace tessel
