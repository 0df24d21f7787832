// A digest as JSON.

#include <nlohmann/json.hpp>

#include "linux/ReadingDigest.h"

namespace tessel {

namespace {

using OrderedJson = nlohmann::ordered_json;

// Each of `items` as what `write` makes of it.
template <typename Items, typename Write>
OrderedJson arrayOf(const Items& items, Write&& write) {
  OrderedJson array = OrderedJson::array();
  for (const auto& item : items) array.push_back(write(item));
  return array;
}

OrderedJson problemJson(const StoreProblem& problem) {
  return {{"reason", problem.reason},
          {"count", problem.count},
          {"files", problem.files},
          {"path", problem.path},
          {"first_place", problem.firstPlace}};
}

StoreProblem problemFrom(const OrderedJson& json) {
  return {json.at("reason").get<std::string>(), json.at("count").get<uint64_t>(),
          json.at("files").get<uint64_t>(), json.at("path").get<std::string>(),
          json.at("first_place").get<uint64_t>()};
}

FileReport fileFrom(const OrderedJson& json) {
  FileReport file;
  file.path = json.at("path").get<std::string>();
  file.skipped = json.at("skipped").get<std::string>();
  return file;
}

StoreReport storeFrom(const OrderedJson& json) {
  StoreReport store;
  if (json.contains("oldest")) store.oldestEntry = json.at("oldest").get<uint64_t>();
  store.rangeStart = json.at("range_start").get<uint64_t>();
  store.entriesRead = json.at("entries_read").get<uint64_t>();
  store.duplicateEntries = json.at("duplicates").get<uint64_t>();
  store.sequenceGaps = json.at("sequence_gaps").get<uint64_t>();
  store.missingEntries = json.at("missing").get<uint64_t>();
  store.filesNotLookedAt = json.at("files_not_looked_at").get<uint64_t>();
  for (const OrderedJson& unit : json.at("dropped")) {
    store.dropped.push_back({unit.at("unit").get<std::string>(), unit.at("count").get<uint64_t>()});
  }
  return store;
}

}  // namespace

OrderedJson storeJson(const StoreReport& store) {
  OrderedJson json = OrderedJson::object();
  if (store.oldestEntry) json["oldest"] = *store.oldestEntry;
  json["reaches_start"] = store.reachesRangeStart();
  json["range_start"] = store.rangeStart;
  json["entries_read"] = store.entriesRead;
  json["duplicates"] = store.duplicateEntries;
  json["sequence_gaps"] = store.sequenceGaps;
  json["missing"] = store.missingEntries;
  json["files_not_looked_at"] = store.filesNotLookedAt;
  json["dropped"] = arrayOf(store.dropped, [](const DroppedEntries& entries) {
    return OrderedJson{{"unit", entries.unit}, {"count", entries.count}};
  });
  return json;
}

OrderedJson digestJson(const ReadingDigest& digest) {
  OrderedJson json;
  json["malformed"] = OrderedJson::object();
  for (const auto& [reason, count] : digest.malformed) json["malformed"][reason] = count;
  json["intervals"] = {{"dropped", digest.droppedOpenIntervals}};
  json["beyond_pair_limit"] = digest.beyondPairLimit;
  json["without_exe"] = digest.withoutImagePath;
  json["store"] = storeJson(digest.store);
  json["dropped_not_listed"] = digest.droppedNotListed;
  json["files_read"] = digest.filesRead;
  json["files_outside_range"] = digest.filesOutsideRange;
  json["files"] = arrayOf(digest.store.files, [](const FileReport& file) {
    return OrderedJson{{"path", file.path}, {"skipped", file.skipped.value_or("")}};
  });
  json["files_not_listed"] = digest.filesNotListed;
  json["problems"] = arrayOf(digest.problems, problemJson);
  return json;
}

ReadingDigest digestFrom(const OrderedJson& json) {
  ReadingDigest digest;
  for (const auto& [reason, count] : json.at("malformed").items())
    digest.malformed.emplace_back(reason, count.get<uint64_t>());
  digest.droppedOpenIntervals = json.at("intervals").at("dropped").get<uint64_t>();
  digest.beyondPairLimit = json.at("beyond_pair_limit").get<uint64_t>();
  digest.withoutImagePath = json.at("without_exe").get<uint64_t>();
  digest.store = storeFrom(json.at("store"));
  digest.droppedNotListed = json.at("dropped_not_listed").get<uint64_t>();
  digest.filesRead = json.at("files_read").get<uint64_t>();
  digest.filesOutsideRange = json.at("files_outside_range").get<uint64_t>();
  for (const OrderedJson& file : json.at("files")) digest.store.files.push_back(fileFrom(file));
  digest.filesNotListed = json.at("files_not_listed").get<uint64_t>();
  for (const OrderedJson& problem : json.at("problems"))
    digest.problems.push_back(problemFrom(problem));
  return digest;
}

std::string jsonLine(const OrderedJson& json) {
  return json.dump(-1, ' ', false, OrderedJson::error_handler_t::replace);
}

}  // namespace tessel
