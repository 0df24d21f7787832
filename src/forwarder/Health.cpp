// Making health records.
//
// The payload is flat, because every format that we send can carry that. The runs are the one list
// in it, so they stand as JSON in a text.
//
// A collector that has all records must know every run, however long it was away. So each record
// tells all runs that no collector has heard of. The service keeps notes of the last 256. A record
// that waits while more runs begin keeps its place, and the next one tells the runs behind it.

#include "forwarder/Health.h"

#include <algorithm>
#include <nlohmann/json.hpp>
#include <utility>
#include <variant>
#include <vector>

#include "linux/RunRecordFile.h"
#include "linux/StateDirectory.h"
#include "os/Files.h"
#include "platform/Json.h"
#include "platform/Text.h"

namespace tessel {

namespace {

using Json = nlohmann::json;

constexpr size_t kMaxStatusBytes = size_t{1} << 20;
// The names that we read are short. Whoever may write to the state directory could put other texts
// there, and those must not fill a record.
constexpr size_t kMaxNameBytes = 64;
constexpr size_t kMaxCodes = 64;

// What `tesselctl status --save` found. Absent members are those that the file does not have.
struct SavedStatus {
  std::optional<bool> good, tasked;
  std::optional<uint64_t> time;  // microseconds since 1970
  std::optional<std::string> version, cohort;
  std::optional<double> share;  // in percent
  std::string problems, notes;  // codes, with commas between them
};

template <typename T>
std::optional<T> valueAt(const Json& json, const char* key) {
  const auto found = json.find(key);
  if (found == json.end()) return {};
  if constexpr (std::is_same_v<T, bool>) {
    if (!found->is_boolean()) return {};
  } else if constexpr (std::is_same_v<T, uint64_t>) {
    if (!found->is_number_unsigned()) return {};
  } else if constexpr (std::is_same_v<T, double>) {
    if (!found->is_number()) return {};
  } else {
    if (!found->is_string()) return {};
    return shortPlainText(found->get<std::string>(), kMaxNameBytes);
  }
  return found->get<T>();
}

// A code has small letters, digits and underscores. Anything else is not of our making.
bool isCode(std::string_view text) {
  return !text.empty() && text.size() <= kMaxNameBytes &&
         text.find_first_not_of("abcdefghijklmnopqrstuvwxyz0123456789_") == std::string_view::npos;
}

std::string codesAt(const Json& json, const char* key) {
  const auto found = json.find(key);
  if (found == json.end() || !found->is_array()) return {};
  std::string codes;
  size_t count = 0;
  for (const Json& each : *found) {
    if (!each.is_object() || count == kMaxCodes) continue;
    const auto code = valueAt<std::string>(each, "code");
    if (!code || !isCode(*code)) continue;
    codes.append(codes.empty() ? "" : ",").append(*code);
    ++count;
  }
  return codes;
}

// Only a file of the service's own user counts, so that no member of its group can speak for it.
SavedStatus readSavedStatus(const std::string& directory) {
  SavedStatus status;
  const auto content = readOwnFile(directory + "/" + kSavedStatusName, kMaxStatusBytes);
  const auto* text = std::get_if<std::string>(&content);
  if (text == nullptr) return status;
  const Json json = Json::parse(*text, nullptr, false);
  if (!json.is_object()) return status;
  status.good = valueAt<bool>(json, "good");
  status.time = valueAt<uint64_t>(json, "time");
  status.version = valueAt<std::string>(json, "version");
  status.problems = codesAt(json, "problems");
  status.notes = codesAt(json, "notes");
  if (const auto tasking = json.find("tasking"); tasking != json.end() && tasking->is_object()) {
    status.tasked = valueAt<bool>(*tasking, "tasked");
    status.share = valueAt<double>(*tasking, "share");
    status.cohort = valueAt<std::string>(*tasking, "cohort");
  }
  return status;
}

// The runs that a record tells: those that no collector has heard of.
struct RunsToTell {
  std::vector<RunNote> runs;
  RunRange numbers;  // of `runs`
  // Runs between the last one told and the first of `runs`. Nobody knows them any more.
  uint64_t missing = 0;
};

// The last run may be under way, so it is told when it has an end, or when another one has begun.
RunsToTell runsAfter(const RunHistory& history, uint64_t taken) {
  // Somebody has removed the file with the count, and it began anew.
  if (taken > history.begun) taken = 0;
  RunsToTell told;
  told.numbers = {taken + 1, taken};
  uint64_t number = history.begun - history.runs.size();
  for (const RunNote& note : history.runs) {
    ++number;
    const bool mayBeUnderWay = !note.end && &note == &history.runs.back();
    if (number <= taken || mayBeUnderWay) continue;
    if (told.runs.empty()) {
      if (taken != 0) told.missing = number - taken - 1;
      told.numbers.first = number;
    }
    told.runs.push_back(note);
    told.numbers.last = number;
  }
  return told;
}

// Whether the record that waits tells a run which is in no note any more: more runs have begun
// since than there are notes, or somebody has removed the file. A new record in its place would
// lose that run.
bool aloneKnowsARun(const RunRange& waiting, const RunHistory& history) {
  const uint64_t oldest = history.begun - history.runs.size() + 1;
  return waiting.first <= waiting.last && (waiting.first < oldest || waiting.last > history.begun);
}

// Every run has every key, so that even a pattern can take the text apart. A run that died has no
// sums: nobody knows what it sent.
std::string runsText(const std::vector<RunNote>& runs) {
  std::string text = "[";
  for (const RunNote& run : runs) {
    if (text.size() > 1) text += ',';
    const auto sum = [&run](uint64_t RunSums::*member) {
      return run.sums ? std::to_string(*run.sums.*member) : std::string("null");
    };
    JsonWriter json(text);
    json.object([&] {
      json.member("start", run.start);
      json.rawMember("end", run.end ? std::to_string(run.end->time_since_epoch().count()) : "null");
      json.member("outcome", run.outcome ? runOutcomeName(*run.outcome) : "died");
      json.rawMember("inspected", sum(&RunSums::inspected));
      json.rawMember("sent", sum(&RunSums::sent)).rawMember("stored", sum(&RunSums::stored));
      json.rawMember("refused", sum(&RunSums::refused));
    });
  }
  return text + "]";
}

// What makes a record due before its day is over. No figure stands here that every run or every
// delivery changes, but for the number of the last run: a record shall follow each run.
std::string factsOf(const SavedStatus& status, uint64_t lastRun) {
  std::string facts;
  JsonWriter json(facts);
  json.object([&] {
    json.member("good", status.good).member("problems", status.problems);
    json.member("notes", status.notes).member("tasked", status.tasked);
    json.member("share", status.share).member("cohort", status.cohort);
    json.member("service", status.version).member("forwarder", TESSEL_VERSION);
    json.member("run", lastRun);
  });
  return facts;
}

uint64_t refusedRows(const RunHistory& history) {
  uint64_t refused = 0;
  if (history.last) {
    for (const auto& [reason, count] : history.last->totals.failed) refused += count;
  }
  return refused;
}

std::string payloadOf(const SavedStatus& status, const RunHistory& history, const RunsToTell& told,
                      const SpoolBooks& books, const ForwarderCounters& counters) {
  const auto unlessZero = [](uint64_t time) {
    return time == 0 ? std::nullopt : std::optional<uint64_t>(time);
  };
  std::string payload;
  JsonWriter json(payload);
  json.object([&] {
    json.member("Good", status.good).member("StatusTime", status.time);
    json.member("Problems", status.problems).member("Notes", status.notes);
    json.member("TaskedOn", status.tasked);
    json.member("SharePercent", status.share).member("Cohort", status.cohort);
    json.member("ServiceVersion", status.version).member("ForwarderVersion", TESSEL_VERSION);
    json.member("Runs", runsText(told.runs)).member("RunsMissing", told.missing);
    json.member("RowsStored", books.stored).member("RowsWaiting", books.waiting);
    json.member("RowsDelivered", counters.delivered).member("RowsRejected", counters.rejected);
    json.member("RowsSetAside", books.setAside);
    json.member("RowsExpired", history.last ? history.last->totals.expired : uint64_t{0});
    json.member("RowsWithdrawn", books.withdrawn).member("RowsRefused", refusedRows(history));
    json.member("Requests", counters.requests).member("Retries", counters.retries);
    json.member("BytesSent", counters.bytesSent);
    json.member("LastSuccess", unlessZero(counters.lastSuccess));
    json.member("LastError", unlessZero(counters.lastErrorAt));
  });
  return payload;
}

bool isDue(const LastHealth& last, const std::string& facts, Date now) {
  const auto age = now - last.made;
  // Somebody has set the clock back, and nobody knows how long ago the last record was made.
  if (age < Date::duration::zero()) return true;
  return age >= Health::kLongest || (age >= Health::kShortest && facts != last.facts);
}

}  // namespace

bool Health::look(Date now) {
  HealthLedger ledger(state_.database());
  const LastHealth last = ledger.last();
  const SavedStatus status = readSavedStatus(stateDirectory_);
  auto read = readRunHistory(stateDirectory_);
  auto* const found = std::get_if<RunHistory>(&read);
  const RunHistory history = found != nullptr ? std::move(*found) : RunHistory{};
  const bool keep = last.waiting && aloneKnowsARun(*last.waiting, history);
  const RunsToTell told = runsAfter(history, keep ? last.waiting->last : last.runTaken);
  const std::string facts = factsOf(status, told.numbers.last);
  if (!isDue(last, facts, now)) return false;
  const auto books = ledger.books();
  if (!books) return false;
  const std::string payload = payloadOf(status, history, told, *books, state_.counters());
  const auto before = keep ? HealthLedger::Before::kept : HealthLedger::Before::replaced;
  return ledger.put(payload, facts, told.numbers, before, now).ok();
}

void Health::withdraw() { HealthLedger(state_.database()).withdrawAll(); }

}  // namespace tessel
