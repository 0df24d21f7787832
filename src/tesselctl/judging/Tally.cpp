// Counting what a dry run finds.
//
// A day may hold millions of objects, so counting one must cost little. Keys are compared as
// borrowed strings, and only a new key allocates. The lists are sorted when a caller asks for them,
// not while we count.

#include "tesselctl/judging/Tally.h"

#include <algorithm>
#include <ctime>
#include <tuple>

namespace tessel::ctl {

namespace {

using std::chrono::hours;
using std::chrono::microseconds;
using std::chrono::minutes;

// The shortest usual length that needs no more than kMaxSlices slices. People read "each 15
// minutes" at a glance, but not "each 17 minutes".
microseconds sliceLengthFor(const Period& period) {
  static constexpr microseconds kLengths[] = {
      minutes{1}, minutes{2}, minutes{5}, minutes{10}, minutes{15}, minutes{30},  hours{1},
      hours{2},   hours{3},   hours{6},   hours{12},   hours{24},   hours{7 * 24}};
  // Slices begin at round times and the period need not, so the first and the last may be cut. That
  // takes up to two slices more than the division says.
  for (const microseconds length : kLengths) {
    if (period.length() / length + 2 <= static_cast<int64_t>(Tally::kMaxSlices)) return length;
  }
  // A period of many years: whole weeks, rounded up, so that the number of slices stays bounded.
  const microseconds week = hours{7 * 24};
  return (period.length() / (static_cast<int64_t>(Tally::kMaxSlices - 2) * week) + 1) * week;
}

// The beginning of the slice that holds `date`. Slices count from a local midnight, so that they
// begin at full hours for people. Where summer time begins within the period, the later slices keep
// the offset of the first: they are of equal length, but an hour off.
Date sliceHolding(Date date, microseconds length) {
  const std::time_t whole =
      std::chrono::floor<std::chrono::seconds>(date).time_since_epoch().count();
  std::tm parts{};
  localtime_r(&whole, &parts);
  const microseconds offset = std::chrono::seconds{parts.tm_gmtoff};
  const microseconds local = date.time_since_epoch() + offset;
  // The remainder of a date before 1970 is negative.
  const microseconds into = (local % length + length) % length;
  return date - into;
}

std::string textOf(const SharedString& text) { return std::string(text.textOr("")); }

}  // namespace

Tally::Tally(const Period& period)
    : period_(period),
      sliceLength_(sliceLengthFor(period)),
      firstSlice_(sliceHolding(period.start, sliceLength_)),
      slices_(static_cast<size_t>((period.end - firstSlice_ - microseconds{1}) / sliceLength_) +
              1) {}

void Tally::count(const TesselObject& object, const FilterDecision& decision,
                  const EntryHeader& entry) {
  ++verdicts_[decision.classification];
  countKind(object, decision.shouldReport());
  countPair(object, decision.classification);
  countSlice(decision.classification, entry.realtime);
  if (decision.classification == TesselReporterClassificationFailedStringWhitelist)
    countMiss(object, decision);
  durations_.count(object);
}

void Tally::countPair(const TesselObject& object, TesselReporterClassification classification) {
  const decltype(pairs_)::Key key{{object.subsystem(), object.category()}};
  VerdictCounts* const known = pairs_.find(key);
  ++(known != nullptr ? *known : pairs_.add(key))[classification];
}

void Tally::countKind(const TesselObject& object, bool reported) {
  // An animation interval is an interval as well, so the narrower class is asked first. The numbers
  // are places in kKinds.
  const size_t kind = object.isKindOf(TesselClass::animationInterval) ? 2
                      : object.isKindOf(TesselClass::interval)        ? 1
                                                                      : 0;
  ++(reported ? kinds_[kind].reported : kinds_[kind].unreported);
}

void Tally::countSlice(TesselReporterClassification classification, uint64_t realtime) {
  const Date date{microseconds{static_cast<int64_t>(realtime)}};
  // An interval counts at the time of its end. `explain --follow` reads on after the end of the
  // period: such an object counts in the sums but has no slice.
  if (date < firstSlice_) return;
  const auto slice = static_cast<size_t>((date - firstSlice_) / sliceLength_);
  if (slice < slices_.size()) ++slices_[slice][classification];
}

void Tally::countMiss(const TesselObject& object, const FilterDecision& decision) {
  // Programs choose the values, and each object may bring a new one. Without a bound on number and
  // bytes one program could fill the memory. We count the objects that the list cannot take, so
  // listed and unlisted ones still add up to the verdict.
  const decltype(misses_)::Key key{
      {object.subsystem(), object.category(), object.name(), decision.stringValue},
      decision.stringSlot};
  if (uint64_t* const known = misses_.find(key)) {
    ++*known;
    return;
  }
  size_t bytes = 0;
  for (const StringRef text : key.texts) bytes += text.textOr("").size();
  if (misses_.entries().size() >= kMaxMisses || missBytes_ + bytes > kMaxMissBytes) {
    ++missesNotListed_;
    return;
  }
  missBytes_ += bytes;
  misses_.add(key) = 1;
}

// Equal counts are ordered by name. Otherwise the order in which objects arrived would decide, and
// two reports of one period could differ.
std::vector<Tally::Pair> Tally::pairs() const {
  std::vector<Pair> pairs;
  for (const auto& [texts, slot, counts] : pairs_.entries())
    pairs.push_back({textOf(texts[0]), textOf(texts[1]), counts});
  std::sort(pairs.begin(), pairs.end(), [](const Pair& a, const Pair& b) {
    const uint64_t sumA = sumOf(a.counts);
    const uint64_t sumB = sumOf(b.counts);
    return sumA != sumB ? sumA > sumB
                        : std::tie(a.subsystem, a.category) < std::tie(b.subsystem, b.category);
  });
  return pairs;
}

std::vector<Tally::Miss> Tally::misses() const {
  std::vector<Miss> misses;
  for (const auto& [texts, slot, count] : misses_.entries()) {
    misses.push_back(
        {textOf(texts[0]), textOf(texts[1]), textOf(texts[2]), slot, textOf(texts[3]), count});
  }
  std::sort(misses.begin(), misses.end(), [](const Miss& a, const Miss& b) {
    if (a.count != b.count) return a.count > b.count;
    return std::tie(a.subsystem, a.category, a.name, a.slot, a.value) <
           std::tie(b.subsystem, b.category, b.name, b.slot, b.value);
  });
  return misses;
}

}  // namespace tessel::ctl
