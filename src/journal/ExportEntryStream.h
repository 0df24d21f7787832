// Entries in the Journal Export Format, from a file or a pipe.
//
// An entry has one line, NAME=value, for each field, and ends with an empty line. A value that a
// line cannot hold is written differently: NAME, a newline, the length of the value in eight bytes
// (little-endian), the value, and a newline. If an entry breaks these rules, the stream counts it
// in the report with its place and goes on after the next empty line.
//
// Other processes may append while we read. A last entry without its empty line is incomplete:
// next() returns false, and the next call of next() reads that entry again.
//
// ForeignJournalStream reads a journal file of a layout that we do not know: journalctl prints the
// file, and we read what it prints. journalctl runs as a child with limits on its time and memory,
// so a damaged file can kill the child but not us. We do not read all files like this: it costs
// some sixty times as much as our reader, because journalctl prints every field.
//
// Threads: one at a time, except for the stop flag.

#pragma once

#include <sys/types.h>

#include <memory>
#include <string>
#include <vector>

#include "journal/EntryStream.h"
#include "journal/FileWindows.h"
#include "journal/StoreReport.h"

namespace tessel {

// What all export streams of a store share, so that memory does not grow with their number.
struct ExportReadResources {
  WindowBudget& windows;
  size_t bytesKept = 0;              // by all streams, without kUsualEntry of each
  std::string longHead{};            // the beginning of a line that is read in pieces
  std::vector<FieldToken> tokens{};  // of the current entry
};

class ExportEntryStream final : public EntryStream {
 public:
  // Bytes. The journal's own tools refuse longer values, so a greater length is damage. Without
  // this bound we would first read over as many bytes and only then see it.
  static constexpr uint64_t kMaxValueLength = 768ull * 1024 * 1024;
  // The most fields that the tokenizer wants, and the most bytes of them, that we keep of one
  // entry.
  static constexpr size_t kMaxFieldsKept = 1024;
  static constexpr size_t kMaxBytesKept = size_t{1024} * 1024;
  // Bytes, bookkeeping included. A merge holds one entry of each stream, and a store can have
  // thousands of streams. Each of them may always keep kUsualEntry, so a usual entry is never
  // refused. The bytes that larger entries need beyond it may not exceed kMaxBytesKeptByAll for all
  // streams together.
  static constexpr size_t kUsualEntry = 1024;
  static constexpr size_t kMaxBytesKeptByAll = 4 * kMaxBytesKept;

  // Owns the descriptor. Adds problems to `report`, but does not count entries there. Everything
  // that is passed by reference must outlive the stream.
  ExportEntryStream(int fd, ExportReadResources& resources, FieldTokenizer& tokenizer,
                    const StopFlag& stop, FileReport& report);
  ~ExportEntryStream() override { dropKept(); }

  bool next() override;
  const EntryHeader& header() const override { return header_; }
  std::span<const FieldToken> tokens() override;

 private:
  enum class Outcome { complete, skipped, bad, ended };
  struct Line {
    std::string_view head;  // the first kMaxFieldHead bytes
    uint64_t size = 0;      // bytes of the whole line, without the newline
  };
  struct KeptField {
    uint32_t offset;
    uint32_t nameLength;
    uint32_t length;  // of the kept part: name, '=' and the head of the value
    uint32_t size;    // of the whole value; UINT32_MAX: at least that
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
  uint64_t incompletePlace_ = ~uint64_t{0};  // of the incomplete entry that was counted last
  uint64_t wentBack_ = 0;                    // bytes that were read again after wrong lengths
  std::string kept_;                         // the kept parts of all wanted fields
  std::vector<KeptField> keptFields_;
};

// A journal file of a layout that we do not know, read by journalctl.
class ForeignJournalStream final : public EntryStream {
 public:
  // Starts journalctl on the file at `path`, which should hold `entryCount` entries. Returns null
  // if journalctl cannot be started. The stream adds problems to `report`.
  static std::unique_ptr<ForeignJournalStream> start(const std::string& path, uint64_t entryCount,
                                                     ExportReadResources& resources,
                                                     FieldTokenizer& tokenizer,
                                                     const StopFlag& stop, FileReport& report);
  // Kills the child if it still runs, and waits for it.
  ~ForeignJournalStream() override;

  bool next() override;
  const EntryHeader& header() const override { return entries_.header(); }
  std::span<const FieldToken> tokens() override { return entries_.tokens(); }

 private:
  ForeignJournalStream(pid_t child, int output, uint64_t entryCount, ExportReadResources& resources,
                       FieldTokenizer& tokenizer, const StopFlag& stop, FileReport& report)
      : child_(child),
        missing_(entryCount),
        stop_(stop),
        report_(report),
        entries_(output, resources, tokenizer, stop, report) {}

  pid_t child_;       // 0: it has ended and was waited for
  uint64_t missing_;  // entries that the file should hold and that did not come yet
  const StopFlag& stop_;
  FileReport& report_;
  ExportEntryStream entries_;
};

}  // namespace tessel
