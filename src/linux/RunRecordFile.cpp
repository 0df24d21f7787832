// The record of the last run and the notes of the last runs as JSON.
//
// One file holds both, so that they cannot disagree: a run that dies between two files would have
// an end in the one and not in the other. The price: the begin of a run rewrites the whole file.
// The record stands in it as before there were notes, so older programs still read it.
//
// A program may read the file while a run replaces it, and the power may fail meanwhile. So the
// file is replaced as a whole, and a reader finds either the old record or the new one.

#include "linux/RunRecordFile.h"

#include <algorithm>
#include <iterator>
#include <nlohmann/json.hpp>

#include "linux/SystemFacts.h"
#include "os/Files.h"
#include "platform/Invariant.h"
#include "platform/Json.h"
#include "platform/Text.h"

namespace tessel {

namespace {

using Json = nlohmann::ordered_json;

constexpr size_t kMaxFailureBytes = 1024;
// Losses of three codes (skipped files, damage, dropped entries) and of the five codes of writers
// over their share vary without bound, so each of these codes may list 17. JSON escapes double a
// text at most. So 51 losses with two such texts each and 85 with one take 120 KiB with their keys.
constexpr size_t kMaxTextBytes = 256;

// The year 9999. Later dates are damage, and could overflow whoever calculates with them.
constexpr int64_t kLatestDate = 253'402'300'799'000'000;

Date dateAt(const Json& json, const char* key) {
  const auto microseconds = json.at(key).get<int64_t>();
  if (microseconds < 0 || microseconds > kLatestDate)
    throw Json::other_error::create(501, "no date", nullptr);
  return Date{std::chrono::microseconds{microseconds}};
}

uint64_t countAt(const Json& json, const char* key) { return json.at(key).get<uint64_t>(); }

// A name that this version does not know makes the record one that cannot be understood.
template <typename Value>
Value required(std::optional<Value> value) {
  if (!value) throw Json::other_error::create(501, "unknown name", nullptr);
  return *value;
}

std::optional<RunOutcome> outcomeNamed(const std::string& name) {
  const auto* const found = std::find(kRunOutcomeNames.begin(), kRunOutcomeNames.end(), name);
  if (found == kRunOutcomeNames.end()) return std::nullopt;
  return static_cast<RunOutcome>(found - kRunOutcomeNames.begin());
}

Loss lossFrom(const Json& json) {
  Loss loss{required(lossNamed(json.at("code").get<std::string>())),
            countAt(json, "count"),
            json.at("words").get<std::string>(),
            {json.at("place").get<std::string>(), {}},
            countAt(json, "places")};
  if (json.contains("offset")) loss.place.offset = countAt(json, "offset");
  if (json.contains("uid")) loss.place.user = json.at("uid").get<uint32_t>();
  return loss;
}

// Texts are shortened and made plain only here; the list in memory keeps them unchanged. Two long
// paths may become the same text. A reader of the record then sees one loss with the sum of both
// counts.
void addLoss(JsonWriter& json, const Loss& loss) {
  json.member("code", lossName(loss.code)).member("count", loss.count);
  json.member("words", shortPlainText(loss.words, kMaxTextBytes));
  json.member("place", shortPlainText(loss.place.name, kMaxTextBytes));
  json.member("offset", loss.place.offset).member("uid", loss.place.user);
  json.member("places", loss.places);
}

void addReading(JsonWriter& json, const StoreReading& reading) {
  json.member("entries_read", reading.entriesRead);
  json.member("duplicates", reading.duplicateEntries);
  json.member("oldest", reading.oldestEntry).member("range_start", reading.rangeStart);
  json.member("last_entry", reading.lastEntry).member("range_end", reading.rangeEnd);
  json.member("stopped", reading.stopped);
  json.member("sequence_gaps", reading.sequenceGaps);
  json.member("missing_numbers", reading.missingNumbers);
  json.member("files_read", reading.filesRead);
  json.member("files_outside_range", reading.filesOutsideRange);
  json.array("losses", reading.losses.all(),
             [&](const Loss& loss) { json.object([&] { addLoss(json, loss); }); });
}

StoreReading readingFrom(const Json& json) {
  StoreReading reading;
  reading.entriesRead = countAt(json, "entries_read");
  reading.duplicateEntries = countAt(json, "duplicates");
  reading.rangeStart = countAt(json, "range_start");
  reading.sequenceGaps = countAt(json, "sequence_gaps");
  if (json.contains("missing_numbers")) reading.missingNumbers = countAt(json, "missing_numbers");
  reading.filesRead = countAt(json, "files_read");
  reading.filesOutsideRange = countAt(json, "files_outside_range");
  if (json.contains("oldest")) reading.oldestEntry = countAt(json, "oldest");
  if (json.contains("last_entry")) reading.lastEntry = countAt(json, "last_entry");
  // An older service says neither how far the reading came nor where the period ended.
  if (json.contains("range_end")) reading.rangeEnd = countAt(json, "range_end");
  if (json.contains("stopped")) reading.stopped = json.at("stopped").get<bool>();
  // The list bounds itself, so a record that names more losses than we write cannot fill it.
  for (const Json& loss : json.at("losses")) reading.losses.add(lossFrom(loss));
  return reading;
}

// An older service kept sums by kind under the key "reading", and no list of losses.
bool hasReading(const Json& json) {
  return json.contains("reading") && !json.at("reading").contains("malformed");
}

// Throws if a member is missing or has the wrong kind.
RunRecord recordFrom(const Json& json) {
  RunRecord record;
  record.start = dateAt(json, "start");
  record.end = dateAt(json, "end");
  record.outcome = required(outcomeNamed(json.at("outcome").get<std::string>()));
  record.failure = json.at("failure").get<std::string>();
  record.logEvents = countAt(json, "log_events");
  record.inspected = countAt(json, "inspected");
  record.classified = json.at("classified").get<ClassifiedCounts>();
  record.unnamed = countAt(json, "unnamed");
  if (json.contains("unsendable")) record.unsendable = countAt(json, "unsendable");
  record.countEvents = countAt(json, "count_events");
  if (hasReading(json)) record.reading = readingFrom(json.at("reading"));
  record.rowsStored = countAt(json, "rows_stored");
  // Records of an older service lack this.
  record.rowsExpired = json.value("rows_expired", uint64_t{0});
  for (const auto& [reason, count] : json.at("rows_failed").items())
    record.rowsFailed.emplace_back(reason, count.get<uint64_t>());
  record.setAside = json.at("set_aside").get<std::vector<std::string>>();
  record.marker = json.at("marker").get<std::string>();
  if (json.contains("totals")) {  // not in a record of an older service
    record.totals.expired = countAt(json.at("totals"), "expired");
    record.totals.failed = json.at("totals").at("failed").get<std::map<std::string, uint64_t>>();
  }
  record.expiredSince = json.value("expired_since", uint64_t{0});
  if (json.contains("interval"))
    record.interval = std::chrono::seconds{json.at("interval").get<int64_t>()};
  return record;
}

void addRecord(JsonWriter& json, const RunRecord& record) {
  json.member("start", record.start).member("end", record.end);
  json.member("outcome", runOutcomeName(record.outcome));
  json.member("failure", shortPlainText(record.failure, kMaxFailureBytes));
  json.member("log_events", record.logEvents).member("inspected", record.inspected);
  json.array("classified", record.classified, [&](uint64_t count) { json.value(count); });
  json.member("unnamed", record.unnamed).member("unsendable", record.unsendable);
  json.member("count_events", record.countEvents);
  if (record.reading) json.object("reading", [&] { addReading(json, *record.reading); });
  json.member("rows_stored", record.rowsStored).member("rows_expired", record.rowsExpired);
  json.object("rows_failed", [&] {
    for (const auto& [reason, count] : record.rowsFailed) json.member(reason, count);
  });
  json.array("set_aside", record.setAside, [&](const std::string& name) { json.value(name); });
  json.member("marker", record.marker);
  json.object("totals", [&] {
    json.member("expired", record.totals.expired);
    json.object("failed", [&] {
      for (const auto& [reason, count] : record.totals.failed) json.member(reason, count);
    });
  });
  json.member("expired_since", record.expiredSince);
  if (record.interval) json.member("interval", int64_t{record.interval->count()});
}

void addNote(JsonWriter& json, const RunNote& note) {
  json.member("start", note.start).member("end", note.end);
  if (note.outcome) json.member("outcome", runOutcomeName(*note.outcome));
  json.member("boot", note.boot).member("boot_began", note.bootBegan);
  json.member("tasking_written", note.taskingWritten);
  if (!note.sums) return;
  json.member("inspected", note.sums->inspected).member("sent", note.sums->sent);
  json.member("stored", note.sums->stored).member("refused", note.sums->refused);
}

RunNote noteFrom(const Json& json) {
  RunNote note;
  note.start = dateAt(json, "start");
  if (json.contains("end")) {
    note.end = dateAt(json, "end");
    note.outcome = required(outcomeNamed(json.at("outcome").get<std::string>()));
  }
  note.boot = json.at("boot").get<std::string>();
  if (json.contains("boot_began")) note.bootBegan = dateAt(json, "boot_began");
  if (json.contains("tasking_written")) note.taskingWritten = dateAt(json, "tasking_written");
  if (json.contains("sent"))
    note.sums = {countAt(json, "inspected"), countAt(json, "sent"), countAt(json, "stored"),
                 countAt(json, "refused")};
  return note;
}

RunNote noteOf(const RunRecord& record) {
  return {record.start, record.end, record.outcome, {}, {}, {}, record.sums()};
}

RunHistory historyFrom(const Json& json) {
  RunHistory history;
  // Until the first run comes to its end there are notes alone.
  if (json.contains("start") || !json.contains("runs")) history.last = recordFrom(json);
  if (json.contains("runs")) {
    for (const Json& note : json.at("runs")) history.runs.push_back(noteFrom(note));
  } else {
    // An older service kept no notes. Its record says as much of one run.
    history.runs.push_back(noteOf(*history.last));
  }
  // Without the count, as an older service left it, the notes are all that we know of.
  history.begun = std::max(json.value("runs_begun", uint64_t{0}), uint64_t{history.runs.size()});
  return history;
}

void boundNotes(RunHistory& history) {
  if (history.runs.size() > RunHistory::kMaxRuns)
    history.runs.erase(history.runs.begin(), history.runs.end() - RunHistory::kMaxRuns);
}

std::optional<PlatformError> writeHistory(RunHistory history, const std::string& stateDirectory) {
  boundNotes(history);
  std::string text;
  JsonWriter json(text, {.indent = 1});
  json.object([&] {
    if (history.last) addRecord(json, *history.last);
    json.member("runs_begun", history.begun);
    json.array("runs", history.runs,
               [&](const RunNote& note) { json.object([&] { addNote(json, note); }); });
  });
  return replaceFileDurably(runRecordPath(stateDirectory), text + "\n");
}

// A file that is not used is begun anew, because the next run has to leave something.
RunHistory usableHistory(const std::string& stateDirectory) {
  auto read = readRunHistory(stateDirectory);
  auto* history = std::get_if<RunHistory>(&read);
  return history != nullptr ? std::move(*history) : RunHistory{};
}

}  // namespace

std::string runRecordPath(const std::string& stateDirectory) {
  return stateDirectory + "/last_run.json";
}

std::optional<PlatformError> writeRunBegin(Date start, const std::string& taskingFile,
                                           const std::string& stateDirectory) {
  RunHistory history = usableHistory(stateDirectory);
  const Boot boot = thisBoot();
  history.runs.push_back({start, {}, {}, boot.id, boot.began, fileTime(taskingFile), {}});
  ++history.begun;
  return writeHistory(std::move(history), stateDirectory);
}

std::optional<PlatformError> writeRunRecord(const RunRecord& record,
                                            const std::string& stateDirectory) {
  // A run that was not tasked read nothing, so it must not replace the record of a run that did.
  TESSEL_INVARIANT(record.outcome != RunOutcome::notTasked);
  RunHistory history = usableHistory(stateDirectory);
  const auto begun = std::find_if(history.runs.rbegin(), history.runs.rend(),
                                  [&](const RunNote& note) { return note.start == record.start; });
  // The begin may not have been written, for want of room.
  if (begun == history.runs.rend()) ++history.begun;
  RunNote& note = begun != history.runs.rend() ? *begun : history.runs.emplace_back(noteOf(record));
  note.end = record.end;
  note.outcome = record.outcome;
  note.sums = record.sums();
  history.last = record;
  return writeHistory(std::move(history), stateDirectory);
}

std::variant<RunHistory, PlatformError> readRunHistory(const std::string& stateDirectory) {
  const std::string path = runRecordPath(stateDirectory);
  auto content = readOwnFile(path, kMaxRunRecordBytes);
  if (auto* error = std::get_if<PlatformError>(&content)) {
    if (error->code == ErrorCode::notFound) return RunHistory{};
    return std::move(*error);
  }
  try {
    return historyFrom(Json::parse(std::get<std::string>(content)));
  } catch (const nlohmann::json::exception&) {
    // Half a record would show books that do not balance, so a damaged record counts as none.
    return PlatformError{ErrorCode::failed, path + ": it is damaged, or of a newer version"};
  }
}

std::optional<RunRecord> readRunRecord(const std::string& stateDirectory) {
  return usableHistory(stateDirectory).last;
}

}  // namespace tessel
