// ReadingDigest: what the reader of a run knew about the trace store, cut down to what the record
// of the run keeps: every sum is whole, every list is short, every text is fit for a terminal.
//
// A plain value; any thread.

#pragma once

#include <cstdint>
#include <nlohmann/json_fwd.hpp>
#include <string>
#include <utility>
#include <vector>

#include "trace/ExtractionReport.h"

namespace tessel {

// One thing that was wrong, in however many files.
struct StoreProblem {
  std::string reason;
  uint64_t count = 0;       // how often, in all of them
  uint64_t files = 0;       // in how many
  std::string path;         // of the first of them
  uint64_t firstPlace = 0;  // byte offset there

  bool operator==(const StoreProblem&) const = default;
};

struct ReadingDigest {
  static constexpr size_t kMaxListed = 16;  // of files, of problems and of units
  static constexpr size_t kMaxTextBytes = 256;

  uint64_t filesRead = 0;
  uint64_t filesOutsideRange = 0;
  uint64_t filesNotListed = 0;         // files that were not read, beyond those in `store`
  std::vector<StoreProblem> problems;  // those of one reason too many under "other", at the end
  MalformedCounts malformed;           // entries that are no trace points
  uint64_t droppedOpenIntervals = 0;
  uint64_t beyondPairLimit = 0;   // trace objects
  uint64_t withoutImagePath = 0;  // trace points
  // Of its files those that were not read although they may belong to the range; of the units that
  // dropped entries those that dropped most, where they are too many.
  StoreReport store;
  uint64_t droppedNotListed = 0;  // entries dropped by further units

  bool operator==(const ReadingDigest&) const = default;
};

ReadingDigest digestOf(const ExtractionReport& report);

// The store beside its files, and the digest, as `tesselctl` shows them.
nlohmann::ordered_json storeJson(const StoreReport& store);
nlohmann::ordered_json digestJson(const ReadingDigest& digest);
// What digestJson() made. Throws nlohmann::json::exception where a member is missing or of the
// wrong kind.
ReadingDigest digestFrom(const nlohmann::ordered_json& json);
// `json` on one line; what is no UTF-8 in it becomes U+FFFD.
std::string jsonLine(const nlohmann::ordered_json& json);

}  // namespace tessel
