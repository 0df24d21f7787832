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

#include "journal/ExportEntryStream.h"

namespace tessel {

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
