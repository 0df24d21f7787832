// ExportEntryStream: the entries of a file or pipe in the Journal Export Format.
//
// An entry is a block of lines NAME=value, or NAME, eight bytes of length, the value and a newline
// for a value of any bytes; an empty line ends it. The input is not trusted: what does not fit is
// counted in the report with its place, and reading goes on after the next empty line.
//
// Other processes may append meanwhile. An entry whose empty line is not there yet is no entry;
// next() looks at it again, so a stream that has ended may go on when it is asked later.
//
// Threads: one at a time, but for the stop flag.
//
// ForeignJournalStream: a journal file of a layout that we do not know, read by journalctl.
//
// It runs as a child with limits on its time and its memory, so what a damaged file does to it does
// not happen to us. What it prints is read as an export stream.
//
// Threads: one at a time, but for the stop flag.

#pragma once

#include <sys/types.h>

#include <memory>
#include <string>
#include <vector>

#include "journal/EntryStream.h"
#include "journal/FileWindows.h"
#include "journal/StoreReport.h"

namespace tessel {

// What the export streams of one store share, to stay within a fixed amount of memory.
struct ExportReadResources {
  WindowBudget& windows;
  size_t bytesKept = 0;              // of the current entries of all streams, beyond what is usual
  std::string longHead{};            // of a line that is read in pieces
  std::vector<FieldToken> tokens{};  // of the entry that is looked at
};

class ExportEntryStream final : public EntryStream {
 public:
  // Largest value that is believed.
  static constexpr uint64_t kMaxValueLength = 768ull * 1024 * 1024;
  // Most that is kept of one entry, of the fields that the tokenizer wants.
  static constexpr size_t kMaxFieldsKept = 1024;
  static constexpr size_t kMaxBytesKept = size_t{1024} * 1024;
  // What any stream may keep of an entry, and the most that all may keep beyond, both with the
  // bookkeeping.
  static constexpr size_t kUsualEntry = 1024;
  static constexpr size_t kMaxBytesKeptByAll = 4 * kMaxBytesKept;

  // Takes the descriptor and closes it. Problems are added to `report`; its entries are not
  // counted. Whatever is passed by reference must outlive the stream.
  ExportEntryStream(int fd, ExportReadResources& resources, FieldTokenizer& tokenizer,
                    const StopFlag& stop, FileReport& report);
  ~ExportEntryStream() override { dropKept(); }

  bool next() override;
  const EntryHeader& header() const override { return header_; }
  Entry entry() override;

 private:
  enum class Outcome { complete, skipped, bad, ended };
  struct Line {
    std::string_view head;  // up to kMaxFieldHead bytes
    uint64_t size = 0;      // of the whole line without its newline
  };
  struct KeptField {
    uint32_t offset;
    uint32_t nameLength;
    uint32_t length;  // of what is kept, name and all
    uint32_t size;    // of the whole value
  };

  void startEntry();
  size_t keptBeyondUsual(size_t added) const;
  void dropKept();
  Outcome readEntry();
  Outcome readField(const Line& line);
  Outcome readBinaryField(std::string_view name);
  Outcome finishEntry();
  bool readLine(Line& line);
  bool readLongLine(Line& line);
  void goBackWithin(uint64_t place);
  bool resynchronise();
  void waitAtEntry();
  Outcome bad(std::string_view reason);
  Outcome takeField(size_t nameLength, std::string_view head, uint64_t size);
  Outcome takeAddress(std::string_view name, std::string_view value);

  ExportReadResources& resources_;
  ByteWindow window_;
  FieldTokenizer& tokenizer_;
  const StopFlag& stop_;
  FileReport& report_;

  EntryHeader header_;
  bool hasRealtime_ = false;
  bool resynchronising_ = false;
  uint64_t entryPlace_ = 0;
  uint64_t incompletePlace_ = ~uint64_t{0};  // where an incomplete entry was counted
  uint64_t wentBack_ = 0;                    // bytes, for wrong lengths
  std::string kept_;                         // heads of the wanted fields of the entry
  std::vector<KeptField> keptFields_;
};

class ForeignJournalStream final : public EntryStream {
 public:
  // Starts journalctl on the file at `path`, which should hold `entryCount` entries; null where it
  // cannot be started. Problems are added to `report`.
  static std::unique_ptr<ForeignJournalStream> start(const std::string& path, uint64_t entryCount,
                                                     ExportReadResources& resources,
                                                     FieldTokenizer& tokenizer,
                                                     const StopFlag& stop, FileReport& report);
  // Ends the child where it still runs.
  ~ForeignJournalStream() override;

  bool next() override;
  const EntryHeader& header() const override { return entries_.header(); }
  Entry entry() override { return entries_.entry(); }

 private:
  ForeignJournalStream(pid_t child, int output, uint64_t entryCount, ExportReadResources& resources,
                       FieldTokenizer& tokenizer, const StopFlag& stop, FileReport& report)
      : child_(child),
        missing_(entryCount),
        stop_(stop),
        report_(report),
        entries_(output, resources, tokenizer, stop, report) {}

  pid_t child_;       // 0 once it was waited for
  uint64_t missing_;  // entries that the file should hold and that were not read yet
  const StopFlag& stop_;
  FileReport& report_;
  ExportEntryStream entries_;
};

}  // namespace tessel
