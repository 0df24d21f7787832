// The run record as JSON.
//
// A program may read the file while a run replaces it, and the power may fail meanwhile. So the
// file is replaced as a whole, and a reader finds either the old record or the new one.

#include "linux/RunRecordFile.h"

#include <algorithm>
#include <iterator>
#include <nlohmann/json.hpp>

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

Date dateAt(const Json& json, const char* key) {
  return Date{std::chrono::microseconds{json.at(key).get<int64_t>()}};
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
  return record;
}

}  // namespace

std::string runRecordPath(const std::string& stateDirectory) {
  return stateDirectory + "/last_run.json";
}

std::optional<PlatformError> writeRunRecord(const RunRecord& record,
                                            const std::string& stateDirectory) {
  // A run that was not tasked read nothing, so it must not replace the record of a run that did.
  TESSEL_INVARIANT(record.outcome != RunOutcome::notTasked);
  std::string text;
  JsonWriter json(text, {.indent = 1});
  json.object([&] {
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
  });
  return replaceFileDurably(runRecordPath(stateDirectory), text + "\n");
}

std::optional<RunRecord> readRunRecord(const std::string& stateDirectory) {
  const auto content = readOwnFile(runRecordPath(stateDirectory), kMaxRunRecordBytes);
  const auto* text = std::get_if<std::string>(&content);
  if (text == nullptr) return {};
  try {
    return recordFrom(Json::parse(*text));
  } catch (const nlohmann::json::exception&) {
    // Half a record would show books that do not balance, so a damaged record counts as none.
    return {};
  }
}

}  // namespace tessel
