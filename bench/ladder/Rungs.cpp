#include "Rungs.h"

#include <systemd/sd-journal.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <optional>
#include <string_view>

#include "journal/JournalStore.h"
#include "trace/JournalExtractor.h"
#include "trace/TracePointTable.h"

namespace tessel::bench {

namespace {

// Wants what a trace point needs and looks at it no further.
class Glance final : public FieldTokenizer {
 public:
  std::vector<std::string_view> marks() const override { return TracePointTable().marks(); }
  bool wants(std::string_view name) const override {
    return name.starts_with("TESSEL_") || name == "_EXE" || name == "_COMM" || name == "_PID";
  }
  FieldToken tokenFor(std::string_view name, std::string_view, uint64_t) override {
    return wants(name) ? 1 : kNoToken;
  }
  const uint32_t& generation() const override { return generation_; }

 private:
  uint32_t generation_ = 0;
};

[[noreturn]] void fail(const std::string& why) {
  std::fprintf(stderr, "%s\n", why.c_str());
  std::exit(1);
}

uint64_t readAlone(const std::string& directory) {
  Glance glance;
  StopFlag stop{false};
  auto opened = JournalStore::open(directory, {}, glance, stop);
  if (auto* error = std::get_if<PlatformError>(&opened)) fail(error->words);
  EntryStream& entries = std::get<0>(opened)->entries();
  uint64_t count = 0;
  size_t tokens = 0;
  while (entries.next()) {
    ++count;
    tokens += entries.tokens().size();
  }
  if (tokens == 0) fail("no tokens");
  return count;
}

uint64_t readAndPair(const std::string& directory) {
  JournalExtractor extractor(std::nullopt);
  extractor.setEmitEventProcessingBlock([](const auto&) { return true; });
  extractor.setIntervalCompletionProcessingBlock([](const auto&) { return true; });
  extractor.setAnimationIntervalCompletionProcessingBlock([](const auto&) { return true; });
  std::optional<PlatformError> error;
  if (!extractor.processLogArchiveWithPath(directory, Date{}, Date::max(), error))
    fail(error->words);
  return extractor.processedEventCount();
}

using Journal = std::unique_ptr<sd_journal, void (*)(sd_journal*)>;

Journal openWithLibsystemd(const std::string& directory) {
  sd_journal* journal = nullptr;
  if (sd_journal_open_directory(&journal, directory.c_str(), 0) < 0)
    fail("sd_journal_open_directory");
  sd_journal_set_data_threshold(journal, 0);
  return {journal, sd_journal_close};
}

uint64_t loopOverAllFields(sd_journal* journal) {
  uint64_t count = 0;
  size_t bytes = 0;
  SD_JOURNAL_FOREACH(journal) {
    ++count;
    uint64_t realtime = 0;
    sd_journal_get_realtime_usec(journal, &realtime);
    const void* data = nullptr;
    size_t length = 0;
    SD_JOURNAL_FOREACH_DATA(journal, data, length) bytes += length;
  }
  if (bytes == 0) fail("no fields");
  return count;
}

uint64_t libsystemdAll(const std::string& directory) {
  return loopOverAllFields(openWithLibsystemd(directory).get());
}

uint64_t libsystemdMatches(const std::string& directory) {
  const Journal journal = openWithLibsystemd(directory);
  for (const char* match : {"TESSEL_KIND=event", "TESSEL_KIND=begin", "TESSEL_KIND=end"})
    sd_journal_add_match(journal.get(), match, 0);
  return loopOverAllFields(journal.get());
}

}  // namespace

const std::vector<Rung>& rungs() {
  static const std::vector<Rung> all = {
      {"cat", nullptr, "cat $FILES >/dev/null", false},
      {"reader alone", readAlone, {}, false},
      {"reader and pairing", readAndPair, {}, false},
      {"explain --summary", nullptr,
       "$TESSELCTL explain --summary --store $DIRECTORY --since 2026-11-21 --until 2026-11-24 "
       ">/dev/null",
       false},
      {"libsystemd, all fields", libsystemdAll, {}, false},
      {"libsystemd, matches", libsystemdMatches, {}, false},
      {"journalctl -o export", nullptr, "journalctl -D $DIRECTORY -o export >/dev/null", true},
      {"journalctl -o json", nullptr, "journalctl -D $DIRECTORY -o json >/dev/null", true},
  };
  return all;
}

}  // namespace tessel::bench
