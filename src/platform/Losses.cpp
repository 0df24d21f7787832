// The names of losses, and the list of them.
//
// The list is short, so it is searched from one end to the other. A usual day has fewer than ten
// losses. The most are fourteen codes with 17 losses each: 16 and the "other" one.

#include "platform/Losses.h"

#include <algorithm>
#include <iterator>

#include "platform/Invariant.h"

namespace tessel {

namespace {

constexpr std::string_view kOther = "other";

// These names stand in the records of runs and in what programs read, so none is ever changed.
constexpr std::array<std::string_view, kLossCodes> kNames = {
    "file_skipped",      "files_not_looked_at",   "file_damaged",      "entries_missing",
    "dropped_by_daemon", "no_image_path",         "malformed",         "lost_at_source",
    "lost_earlier",      "open_interval_dropped", "beyond_pair_limit", "beyond_image_limit",
    "beyond_text_limit", "beyond_time_limit"};

// A failing disk damages many files in the same way. The kind of damage then says more than the
// list of files, so damage is summed over all files. Losses of the other codes stay apart by place.
bool sumsPlaces(LossCode code) { return code == LossCode::fileDamaged; }

bool isSame(const Loss& a, const Loss& b) {
  return a.code == b.code && a.words == b.words &&
         (sumsPlaces(a.code) || (a.place.name == b.place.name && a.place.user == b.place.user));
}

}  // namespace

std::string_view lossName(LossCode code) { return kNames[static_cast<size_t>(code)]; }

std::optional<LossCode> lossNamed(std::string_view name) {
  const auto* const found = std::find(kNames.begin(), kNames.end(), name);
  if (found == kNames.end()) return std::nullopt;
  return static_cast<LossCode>(found - kNames.begin());
}

// The offset is that of the first place: whoever looks into a damaged file begins there.
std::string Loss::where() const {
  std::string where = place.name;
  if (isOfWriter(code) && !where.empty()) {
    // A writer is a user first: anyone can give a program any path.
    where = (place.user ? "user " + std::to_string(*place.user) : "unknown user") + ", " + where;
  }
  if (place.offset) where += (where.empty() ? "byte " : ", byte ") + std::to_string(*place.offset);
  if (places > 1) where += ", and " + std::to_string(places - 1) + " more";
  return where;
}

std::string Loss::description() const {
  const std::string at = where();
  return std::string(lossName(code)) + ": " + words + (at.empty() ? "" : " (" + at + ")");
}

bool Loss::isOther() const { return words == kOther; }

void Losses::add(Loss loss) {
  if (loss.count == 0) return;
  const LossCode code = loss.code;
  uint64_t& sum = sums_[static_cast<size_t>(code)];
  sum += loss.count;
  const auto first = std::ranges::lower_bound(losses_, code, {}, &Loss::code);
  const auto last = std::ranges::upper_bound(losses_, code, {}, &Loss::code);
  // The "other" loss stays the last of its code, so a new loss goes in before it.
  const auto other = first != last && std::prev(last)->isOther() ? std::prev(last) : last;
  auto known = std::find_if(first, last, [&](const Loss& one) { return isSame(one, loss); });
  // A store of many bad files must not fill the list, but no loss may go uncounted either.
  if (known == last && static_cast<size_t>(other - first) >= kMaxOfACode) loss.words = kOther;
  if (loss.isOther()) known = other;
  if (known != last) {
    known->count += loss.count;
    if (known->place.name != loss.place.name) known->places += loss.places;
  } else {
    losses_.insert(loss.isOther() ? last : other, std::move(loss));
  }
  // Merged or moved to "other", a loss keeps its count: the list and the sum must agree.
  uint64_t listed = 0;
  for (const Loss& one : losses_) listed += one.code == code ? one.count : 0;
  TESSEL_INVARIANT(listed == sum);
}

void Losses::add(LossCode code, std::string_view words, const LossPlace& place, uint64_t count) {
  add({code, count, std::string(words), place});
}

void Losses::add(const Losses& others) {
  for (const Loss& loss : others.losses_) add(loss);
}

// Entries come nearly in the order of their times, and one may even be of before the period. So the
// last one says how far the reading came, within the period.
uint64_t StoreReading::unread() const {
  if (!stopped) return 0;
  return rangeEnd - std::clamp(lastEntry.value_or(rangeStart), rangeStart, rangeEnd);
}

uint64_t Losses::notListed(LossCode code) const {
  uint64_t count = 0;
  for (const Loss& loss : losses_) count += loss.code == code && loss.isOther() ? loss.count : 0;
  return count;
}

}  // namespace tessel
