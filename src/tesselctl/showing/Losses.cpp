// Laying out losses.
//
// Programs read the members `malformed`, `store`, `files` and `problems`. They repeat what `losses`
// says. We derive them from that list, so the two cannot disagree.

#include "tesselctl/showing/Losses.h"

#include "platform/Text.h"
#include "tesselctl/reading/TimeArguments.h"

namespace tessel::ctl {

namespace {

// The losses of one code that name a file or a unit. The loss "other" sums up the rest and names
// neither, so it goes out as a count of its own.
std::vector<Loss> toldApart(const Losses& losses, LossCode code) {
  std::vector<Loss> found;
  for (const Loss& loss : losses.all()) {
    if (loss.code == code && !loss.isOther()) found.push_back(loss);
  }
  return found;
}

}  // namespace

// This is no loss with a count: nobody knows how many entries the journal has already removed.
std::string partOfPeriod(const StoreReading& reading) {
  if (!reading.oldestEntry || reading.reachesRangeStart()) return {};
  const Date oldest{std::chrono::microseconds{static_cast<int64_t>(*reading.oldestEntry)}};
  return "The store reaches back to " + dateText(oldest) + " only";
}

// Each line tells what is not there without being a loss.
std::vector<std::string> notesOn(const StoreReading& reading) {
  std::vector<std::string> notes;
  if (std::string part = partOfPeriod(reading); !part.empty()) notes.push_back(std::move(part));
  if (reading.missingNumbers != 0 && reading.losses.sum(LossCode::entriesMissing) == 0)
    notes.push_back(grouped(reading.missingNumbers) +
                    " numbers of entries that no file holds: vacuumed, not exported or lost");
  if (reading.filesOutsideRange != 0) {
    std::string note = grouped(reading.filesOutsideRange) + " not read, of another period:";
    for (const std::string& path : reading.outsideRange) note += " " + path;
    if (reading.outsideRange.size() < reading.filesOutsideRange) note += " ...";
    notes.push_back(std::move(note));
  }
  return notes;
}

void addLosses(JsonWriter& json, const Losses& losses) {
  json.array("losses", losses.all(), [&](const Loss& loss) {
    json.object([&] {
      json.member("code", lossName(loss.code)).member("count", loss.count);
      json.member("words", loss.words);
      if (!loss.place.name.empty()) json.member("place", loss.place.name);
      json.member("offset", loss.place.offset).member("uid", loss.place.user);
      // One place is named already, so its number would say nothing.
      if (loss.places > 1) json.member("places", loss.places);
    });
  });
}

void addMalformed(JsonWriter& json, const Losses& losses) {
  json.object("malformed", [&] {
    for (const Loss& loss : toldApart(losses, LossCode::malformed))
      json.member(loss.words, loss.count);
  });
}

void addOverShare(JsonWriter& json, const Losses& losses) {
  // In the order of the codes, from openIntervalDropped on.
  static constexpr std::string_view kWhat[] = {"open_intervals", "pairs", "images", "text", "time"};
  std::vector<Loss> overShare = losses.all();
  std::erase_if(overShare, [](const Loss& loss) { return !isOverShare(loss.code); });
  json.array("over_share", overShare, [&](const Loss& loss) {
    json.object([&] {
      // The loss "other" sums up further writers, and the place is that of the first of them.
      if (!loss.isOther()) json.member("uid", loss.place.user);
      json.member("image", loss.isOther() ? loss.words : loss.place.name);
      json.member("what", kWhat[static_cast<size_t>(loss.code) -
                                static_cast<size_t>(LossCode::openIntervalDropped)]);
      json.member("count", loss.count);
    });
  });
}

void addStore(JsonWriter& json, const StoreReading& reading) {
  const Losses& losses = reading.losses;
  json.member("beyond_pair_limit", losses.sum(LossCode::beyondPairLimit));
  json.member("lost_at_source", losses.sum(LossCode::lostAtSource));
  json.member("lost_earlier", losses.sum(LossCode::lostEarlier));
  json.member("without_exe", losses.sum(LossCode::noImagePath));
  json.object("store", [&] {
    json.member("oldest", reading.oldestEntry);
    json.member("reaches_start", reading.reachesRangeStart());
    json.member("range_start", reading.rangeStart).member("entries_read", reading.entriesRead);
    json.member("duplicates", reading.duplicateEntries);
    json.member("sequence_gaps", reading.sequenceGaps);
    json.member("missing", reading.missingNumbers);
    json.member("files_not_looked_at", losses.sum(LossCode::filesNotLookedAt));
    json.array("dropped", toldApart(losses, LossCode::droppedByDaemon), [&](const Loss& loss) {
      json.object([&] { json.member("unit", loss.place.name).member("count", loss.count); });
    });
  });
}

void addReading(JsonWriter& json, const StoreReading& reading) {
  const Losses& losses = reading.losses;
  addMalformed(json, losses);
  json.object("intervals",
              [&] { json.member("dropped", losses.sum(LossCode::openIntervalDropped)); });
  addStore(json, reading);
  addOverShare(json, losses);
  json.member("stopped", reading.stopped).member("unread_microseconds", reading.unread());
  json.member("dropped_not_listed", losses.notListed(LossCode::droppedByDaemon));
  json.member("files_read", reading.filesRead);
  json.member("files_outside_range", reading.filesOutsideRange);
  json.array("files", toldApart(losses, LossCode::fileSkipped), [&](const Loss& loss) {
    json.object([&] { json.member("path", loss.place.name).member("skipped", loss.words); });
  });
  json.member("files_not_listed", losses.notListed(LossCode::fileSkipped));
  // Damage that had no room is listed here with the reason "other", and not as a count beside.
  std::vector<Loss> problems = losses.all();
  std::erase_if(problems, [](const Loss& loss) { return loss.code != LossCode::fileDamaged; });
  json.array("problems", problems, [&](const Loss& loss) {
    json.object([&] {
      json.member("reason", loss.words).member("count", loss.count);
      json.member("files", loss.places).member("path", loss.place.name);
      json.member("first_place", loss.place.offset);
    });
  });
  addLosses(json, losses);
}

std::string unreadPart(const StoreReading& reading) {
  if (!reading.stopped) return {};
  return "The run was cut short: " + durationText(std::chrono::microseconds{reading.unread()}) +
         " of its day were not read";
}

std::string unknownPrograms(const Losses& losses) {
  const uint64_t count = losses.sum(LossCode::noImagePath);
  if (count == 0) return {};
  return "The program of " + counted(count, "trace point is", "trace points is") +
         " not known: the process was gone before the journal looked";
}

std::vector<std::string> lossLines(const Losses& losses, size_t mostOfACode) {
  std::vector<std::string> lines;
  const std::vector<Loss>& all = losses.all();
  for (size_t at = 0; at < all.size();) {
    const LossCode code = all[at].code;
    if (!isLost(code)) {
      ++at;
      continue;
    }
    // The rest is the sum less the shown losses, so the lines always add up to the sum.
    uint64_t further = losses.sum(code);
    for (size_t shown = 0; at < all.size() && all[at].code == code; ++at, ++shown) {
      if (shown >= mostOfACode) continue;
      lines.push_back(grouped(all[at].count) + " " + all[at].description());
      further -= all[at].count;
    }
    if (further != 0) lines.push_back(grouped(further) + " more " + std::string(lossName(code)));
  }
  return lines;
}

// Lines and not a table: the end of a path, the byte in the file and a unit's name all matter, and
// the columns of a table would cut them.
std::string lossText(const Losses& losses, const Terminal& terminal) {
  std::string out;
  const auto lines = lossLines(losses, Losses::kMaxOfACode);
  if (!lines.empty()) out += "\n" + terminal.paint(Colour::strong, "What was lost") + "\n";
  for (const std::string& line : lines)
    out += "  " + wrapped(terminalText(line), terminal.width - 2, 4) + "\n";
  if (const std::string unknown = unknownPrograms(losses); !unknown.empty())
    out += "\n" + wrapped(unknown, terminal.width, 2) + ".\n";
  return out;
}

}  // namespace tessel::ctl
