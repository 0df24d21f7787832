// JournalStore: the journal and export files of one place, merged, for one time range.
//
// A store is a directory that holds `*.journal`, `*.journal~` or `*.export` files, one such file,
// or the journal of this machine. All files are opened at the beginning, and each stays open until
// it is read. So a rotation while we read neither hides a file nor shows it twice.
//
// Threads: one at a time, except for the stop flag.

#pragma once

#include <memory>
#include <optional>
#include <string>
#include <variant>

#include "journal/EntryStream.h"
#include "journal/StoreReport.h"
#include "os/UniqueFd.h"
#include "platform/Error.h"
#include "platform/System.h"

namespace tessel {

// Microseconds since 1970, UTC: start <= realtime < end.
struct TimeRange {
  uint64_t start = 0;
  uint64_t end = UINT64_MAX;
};

class JournalStore {
 public:
  // Each file takes a descriptor, a window and some 2 KiB. 8,192 files take some 40 MB, a third of
  // the memory of a run. The report only counts further files. The keys of TokenCache have 13 bits
  // for the number of a file, so this is also the most that they can tell apart.
  static constexpr size_t kMaxFiles = 8192;
  // The most files of an unknown layout that are read. Each takes a process with up to 1 GiB of
  // address space. All these processes run at the same time, because their entries are merged.
  static constexpr size_t kMaxForeignFiles = 16;

  // Opens the store at `path`; without a path, the journal of this machine. An error has a code and
  // names the path: notFound, noAccess, notAStore (no file there is a journal), or failed. A
  // damaged file among good ones is no error; the report tells of it. `status` may be null. It gets
  // the progress: each file that is opened, and every few entries. All references must outlive the
  // store.
  static std::variant<std::unique_ptr<JournalStore>, PlatformError> open(
      const std::optional<std::string>& path, TimeRange range, FieldTokenizer& tokenizer,
      const StopFlag& stop, ServiceStatus* status = nullptr);

  // A store of one export stream, from a file, pipe or socket that is read forward. `name` is what
  // the report calls it. All references must outlive the store.
  static std::unique_ptr<JournalStore> ofExport(UniqueFd stream, std::string name, TimeRange range,
                                                FieldTokenizer& tokenizer, const StopFlag& stop);

  ~JournalStore();
  JournalStore(const JournalStore&) = delete;
  JournalStore& operator=(const JournalStore&) = delete;

  // The entries of the range in the journal's own order, each once.
  EntryStream& entries();
  // What is known so far. Complete after entries().next() has returned false.
  StoreReport report() const;

 private:
  struct State;
  explicit JournalStore(std::unique_ptr<State> state);

  std::unique_ptr<State> state_;
};

}  // namespace tessel
