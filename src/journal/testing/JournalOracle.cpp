#include "journal/testing/JournalOracle.h"

#include <systemd/sd-journal.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <ostream>

#include "journal/EntryStream.h"
#include "journal/ExportEntryStream.h"

namespace tessel::testing {

bool operator==(const PlainEntry& a, const PlainEntry& b) {
  return a.header.realtime == b.header.realtime && a.header.monotonic == b.header.monotonic &&
         a.header.bootId == b.header.bootId && a.fields == b.fields;
}

std::ostream& operator<<(std::ostream& out, const PlainEntry& entry) {
  out << "\n@" << entry.header.realtime << "+" << entry.header.monotonic << " #"
      << entry.header.sequenceNumber;
  for (const std::string& field : entry.fields) out << " " << field.substr(0, 60);
  return out;
}

FieldToken RecordingTokenizer::tokenFor(std::string_view field, std::string_view value,
                                        uint64_t size) {
  ++shown_;
  std::string text = std::string(field) + "=" + std::string(value);
  if (size > value.size()) text += "...";
  const auto [known, isNew] = tokens_.try_emplace(text, static_cast<FieldToken>(texts_.size() + 1));
  if (isNew) texts_.push_back(text);
  return known->second;
}

std::vector<PlainEntry> readAll(EntryStream& stream, RecordingTokenizer& tokenizer) {
  std::vector<PlainEntry> entries;
  while (stream.next()) {
    const Entry entry = stream.entry();
    PlainEntry plain{entry.header, {}};
    for (const FieldToken token : entry.tokens) plain.fields.push_back(tokenizer.text(token));
    std::sort(plain.fields.begin(), plain.fields.end());
    entries.push_back(std::move(plain));
    tokenizer.beginNext();
  }
  return entries;
}

namespace {

// The store needs this field itself, to tell the daemon's own messages from others, and does not
// show it.
constexpr std::string_view kKeptByStore = "_TRANSPORT=driver";

PlainEntry currentEntry(sd_journal* journal) {
  PlainEntry plain;
  sd_id128_t boot{};
  sd_journal_get_realtime_usec(journal, &plain.header.realtime);
  sd_journal_get_monotonic_usec(journal, &plain.header.monotonic, &boot);
  std::copy_n(boot.bytes, plain.header.bootId.size(), plain.header.bootId.begin());
  const void* data = nullptr;
  size_t length = 0;
  SD_JOURNAL_FOREACH_DATA(journal, data, length) {
    std::string field(static_cast<const char*>(data), std::min(length, kMaxFieldHead));
    if (length > kMaxFieldHead) field += "...";
    if (field != kKeptByStore) plain.fields.push_back(std::move(field));
  }
  std::sort(plain.fields.begin(), plain.fields.end());
  return plain;
}

}  // namespace

std::vector<PlainEntry> readWithLibsystemd(const std::vector<std::string>& files) {
  std::vector<const char*> paths;
  paths.reserve(files.size() + 1);
  for (const std::string& file : files) paths.push_back(file.c_str());
  paths.push_back(nullptr);
  sd_journal* journal = nullptr;
  if (sd_journal_open_files(&journal, paths.data(), 0) < 0) std::abort();
  sd_journal_set_data_threshold(journal, 0);
  std::vector<PlainEntry> entries;
  SD_JOURNAL_FOREACH(journal) entries.push_back(currentEntry(journal));
  sd_journal_close(journal);
  return entries;
}

std::vector<PlainEntry> readWithJournalctl(const std::string& path) {
  const std::string place =
      (std::filesystem::is_directory(path) ? "--directory=" : "--file=") + path;
  FILE* pipe = ::popen(("journalctl --quiet --all --output=export '" + place + "'").c_str(), "r");
  if (pipe == nullptr) std::abort();
  RecordingTokenizer tokenizer;
  const StopFlag stop{false};
  FileReport report;
  WindowBudget windows;
  ExportReadResources resources{windows};
  ExportEntryStream stream(::dup(::fileno(pipe)), resources, tokenizer, stop, report);
  std::vector<PlainEntry> entries = readAll(stream, tokenizer);
  if (::pclose(pipe) != 0 || !report.problems.empty()) entries.clear();
  // In the export format the boot is a part of the header and not a field, so we add the field
  // here.
  for (PlainEntry& entry : entries) {
    std::erase(entry.fields, kKeptByStore);
    entry.fields.push_back("_BOOT_ID=" + textOf(entry.header.bootId));
    std::sort(entry.fields.begin(), entry.fields.end());
  }
  return entries;
}

}  // namespace tessel::testing
