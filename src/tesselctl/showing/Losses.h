// Losses: what was lost of a period between the programs that recorded and the reader, in words.
//
// The words are not yet fit for a terminal: they hold names of units and files as they were met.
// Stateless; any thread.

#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "linux/ReadingDigest.h"
#include "trace/ExtractionReport.h"

namespace tessel::ctl {

struct Loss {
  uint64_t count = 0;
  std::string what;  // reads on after the count
};

// Without those that are zero.
std::vector<Loss> thoseThatOccurred(std::vector<Loss> losses);
// Of what no trace object came although the entries were read.
std::vector<Loss> entryLosses(const MalformedCounts& malformed, uint64_t droppedOpenIntervals,
                              uint64_t beyondPairLimit);
// What the store itself has lost or never had.
std::vector<Loss> storeLosses(const StoreReport& store, uint64_t withoutImagePath);
// That the store holds only a part of the period, without a full stop; empty where it holds all.
std::string partOfPeriod(const StoreReport& store);
// REQUIRES: it was not.
std::string whyNotRead(const FileReport& file);
// All of these, of a run: a line for each, or for the first of each kind.
std::vector<std::string> wordsForLosses(const ReadingDigest& reading);

}  // namespace tessel::ctl
