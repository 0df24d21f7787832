// The run record as JSON.

#include "linux/RunRecord.h"

#include <algorithm>
#include <fstream>
#include <iterator>
#include <nlohmann/json.hpp>
#include <numeric>

#include "os/DurableFile.h"
#include "platform/Text.h"

namespace tessel {

namespace {

using OrderedJson = nlohmann::ordered_json;

constexpr const char* kOutcomes[] = {"completed", "interrupted", "bailed_out", "failed"};
constexpr size_t kMaxRecordBytes = size_t{1} << 20;
constexpr size_t kMaxFailureBytes = 1024;

std::string recordPath(const std::string& stateDirectory) {
  return stateDirectory + "/last_run.json";
}

int64_t microseconds(Date date) { return date.time_since_epoch().count(); }

OrderedJson named(const RunRecord::Named& facts) {
  OrderedJson object = OrderedJson::object();
  for (const auto& [name, value] : facts) object[name] = value;
  return object;
}

RunRecord::Named namedFrom(const OrderedJson& object) {
  RunRecord::Named facts;
  for (const auto& [name, value] : object.items()) facts.emplace_back(name, value.get<uint64_t>());
  return facts;
}

RunOutcome outcomeFrom(const std::string& name) {
  const auto* const found = std::find(std::begin(kOutcomes), std::end(kOutcomes), name);
  if (found == std::end(kOutcomes))
    throw OrderedJson::other_error::create(501, "unknown outcome", nullptr);
  return static_cast<RunOutcome>(found - std::begin(kOutcomes));
}

// Throws where a member is missing or of the wrong kind.
RunRecord recordFrom(const OrderedJson& json) {
  RunRecord record;
  record.start = Date{std::chrono::microseconds{json.at("start").get<int64_t>()}};
  record.end = Date{std::chrono::microseconds{json.at("end").get<int64_t>()}};
  record.outcome = outcomeFrom(json.at("outcome").get<std::string>());
  record.failure = json.at("failure").get<std::string>();
  record.logEvents = json.at("log_events").get<uint64_t>();
  record.inspected = json.at("inspected").get<uint64_t>();
  record.classified =
      json.at("classified").get<std::array<uint64_t, RunRecord::kClassifications>>();
  record.unnamed = json.at("unnamed").get<uint64_t>();
  record.countEvents = json.at("count_events").get<uint64_t>();
  record.rowsStored = json.at("rows_stored").get<uint64_t>();
  record.rowsFailed = namedFrom(json.at("rows_failed"));
  record.setAside = json.at("set_aside").get<std::vector<std::string>>();
  record.store = namedFrom(json.at("store"));
  if (json.contains("reading")) record.reading = digestFrom(json.at("reading"));
  record.marker = json.at("marker").get<std::string>();
  return record;
}

}  // namespace

const char* runOutcomeName(RunOutcome outcome) { return kOutcomes[static_cast<size_t>(outcome)]; }

void RunRecord::addReading(const ExtractionReport& found) {
  const ReadingDigest digest = digestOf(found);
  const std::vector<FileReport>& files = found.store.files;
  const auto damaged = std::count_if(files.begin(), files.end(),
                                     [](const FileReport& file) { return !file.problems.empty(); });
  uint64_t malformed = 0;
  for (const auto& [reason, count] : digest.malformed) malformed += count;
  logEvents = found.entriesRead;
  store = {{"files", files.size()},
           {"files_skipped", digest.store.files.size() + digest.filesNotListed},
           {"files_damaged", static_cast<uint64_t>(damaged)},
           {"entries_missing", digest.store.missingEntries},
           {"malformed", malformed},
           {"open_intervals_dropped", digest.droppedOpenIntervals},
           {"beyond_pair_limit", digest.beyondPairLimit}};
  if (!files.empty()) reading = digest;
}

bool RunRecord::objectsBalance() const {
  return std::accumulate(classified.begin(), classified.end(), uint64_t{0}) == inspected;
}

uint64_t RunRecord::rowsExpected() const {
  return 2 * classified[kReported] - unnamed + countEvents + 1;
}

bool RunRecord::rowsBalance() const { return rowsStored == rowsExpected(); }

std::optional<std::string> RunRecord::write(const std::string& stateDirectory) const {
  OrderedJson json;
  json["start"] = microseconds(start);
  json["end"] = microseconds(end);
  json["outcome"] = runOutcomeName(outcome);
  json["failure"] = shortPlainText(failure, kMaxFailureBytes);
  json["log_events"] = logEvents;
  json["inspected"] = inspected;
  json["classified"] = classified;
  json["unnamed"] = unnamed;
  json["count_events"] = countEvents;
  json["rows_stored"] = rowsStored;
  json["rows_failed"] = named(rowsFailed);
  json["set_aside"] = setAside;
  json["store"] = named(store);
  if (reading) json["reading"] = digestJson(*reading);
  json["marker"] = marker;
  // Words of the system are not always UTF-8.
  const std::string text = json.dump(1, ' ', false, OrderedJson::error_handler_t::replace);
  return replaceFileDurably(recordPath(stateDirectory), text + "\n");
}

std::optional<RunRecord> RunRecord::read(const std::string& stateDirectory) {
  std::ifstream file(recordPath(stateDirectory), std::ios::binary);
  std::string text(kMaxRecordBytes, '\0');
  file.read(text.data(), static_cast<std::streamsize>(text.size()));
  text.resize(static_cast<size_t>(file.gcount()));
  try {
    return recordFrom(OrderedJson::parse(text));
  } catch (const nlohmann::json::exception&) {
    return {};
  }
}

}  // namespace tessel
