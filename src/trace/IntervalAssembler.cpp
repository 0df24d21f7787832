// Sorts the tokens of an entry into slots, pairs begins with ends, and makes the objects.

#include "trace/IntervalAssembler.h"

#include <algorithm>

namespace tessel {

namespace {

// labelled() counts kinds two by two, so FieldKind must have a label and a value for each labelled
// argument of an object.
static_assert(labelled(FieldKind::string1Name, kLabelledStrings) == FieldKind::number1Name &&
              labelled(FieldKind::number1Name, kLabelledNumbers) == FieldKind::duration);

}  // namespace

// A store may hold millions of entries. So we count in plain numbers while we read, and put them
// into words only at the end.
void addLosses(const AssemblyCounts& counts, Losses& losses) {
  losses.add(LossCode::noImagePath, "process gone before _EXE was read", {},
             counts.withoutImagePath);
  for (size_t reason = 0; reason < kMalformedReasons; ++reason) {
    losses.add(LossCode::malformed, malformedReasonText(static_cast<MalformedReason>(reason)), {},
               counts.malformed[reason]);
  }
}

IntervalAssembler::IntervalAssembler(TracePointTable& table, Writers& writers,
                                     TraceObjectSink& sink, OpenIntervalLimits limits)
    : table_(table), writers_(writers), sink_(sink), open_(writers, limits) {}

AssemblyCounts IntervalAssembler::counts() const {
  AssemblyCounts counts = counts_;
  counts.droppedOpenIntervals = writers_.lostOf(LossCode::openIntervalDropped);
  counts.openIntervals = open_.size();
  return counts;
}

// The reader collects the tokens of one entry before this call, and those of the next entry after
// it. So when take() is done, only the open intervals hold tokens, and we may empty the table.
void IntervalAssembler::consume(const Entry& entry) {
  take(entry);
  if (table_.full()) [[unlikely]]
    startGeneration();
}

void IntervalAssembler::take(const Entry& entry) {
  const bool isPoint = meansToBeATracePoint(entry.tokens);
  if (!isPoint && std::ranges::find(entry.tokens, FieldKind::lost, &TracePointTable::kind) ==
                      entry.tokens.end())
    return;
  read(entry.tokens);
  if (point_.lost != 0) [[unlikely]]
    tellLosses(entry.header);
  if (!isPoint) return;
  if (const auto reason = fault()) {
    ++counts_.malformed[static_cast<size_t>(*reason)];
    return;
  }
  ++counts_.tracePoints;
  // The daemon looks up _EXE after it received the entry. If the process has ended by then, the
  // entry has no _EXE, and nobody can say which program the object came from.
  if (point_[FieldKind::imagePath] == kNoToken) ++counts_.withoutImagePath;
  switch (table_.pointKind(point_[FieldKind::pointKind])) {
    case PointKind::event:
      return emitEvent();
    case PointKind::begin:
      return begin(entry.header);
    case PointKind::end:
      return end(entry.header);
  }
}

// An entry that has at least one required field, good or bad, means to be a trace point. If it
// lacks another, it counts as malformed. All other entries are ordinary log messages.
bool IntervalAssembler::meansToBeATracePoint(std::span<const FieldToken> tokens) const {
  return std::any_of(tokens.begin(), tokens.end(), [this](FieldToken token) {
    const FieldKind kind = TracePointTable::kind(token);
    return isRequired(kind) || (kind == FieldKind::malformed && table_.malformedIsRequired(token));
  });
}

// All entries share the buffers of point_, so most entries allocate nothing.
void IntervalAssembler::read(std::span<const FieldToken> tokens) {
  point_.tokens.fill(kNoToken);
  point_.attributes.clear();
  point_.malformed = kNoToken;
  point_.lost = 0;
  point_.lostSince = 0;
  FieldToken repeated = kNoToken;
  for (const FieldToken token : tokens) {
    const FieldKind kind = TracePointTable::kind(token);
    if (kind < FieldKind::attribute) [[likely]] {
      FieldToken& slot = point_.tokens[static_cast<size_t>(kind)];
      repeated |= slot;
      slot = token;
    } else if (kind == FieldKind::attribute) {
      point_.attributes.push_back(token);
    } else if (kind == FieldKind::malformed) {
      point_.malformed = lesserFault(point_.malformed, token);
    } else if (kind == FieldKind::lost) {
      point_.lost = std::max(point_.lost, table_.count(token));
    } else if (kind == FieldKind::lostSince) {
      point_.lostSince = std::max(point_.lostSince, table_.count(token));
    }
  }
  if (repeated != kNoToken) [[unlikely]]
    readRepeated(tokens);
}

void IntervalAssembler::tellLosses(const EntryHeader& header) {
  sink_.addTold({writer(), header.bootId, table_.user(point_[FieldKind::process]).value_or(0),
                 point_.lostSince, point_.lost});
}

// A journal sorts the fields of an entry, so which of several values came first cannot be known.
// The greatest counts, so that each kind of file gives the same object.
void IntervalAssembler::readRepeated(std::span<const FieldToken> tokens) {
  for (const FieldToken token : tokens) {
    const FieldKind kind = TracePointTable::kind(token);
    if (kind >= FieldKind::attribute) continue;
    FieldToken& slot = point_.tokens[static_cast<size_t>(kind)];
    if (table_.isGreater(token, slot)) slot = token;
  }
}

FieldToken IntervalAssembler::lesserFault(FieldToken a, FieldToken b) const {
  return a == kNoToken || table_.malformedReason(b) < table_.malformedReason(a) ? b : a;
}

// An entry with several faults counts under one reason only. So the sum over all reasons is the
// number of malformed entries.
std::optional<MalformedReason> IntervalAssembler::fault() const {
  if (point_.malformed != kNoToken) return table_.malformedReason(point_.malformed);
  for (size_t slot = 0; slot < kRequiredFields; ++slot) {
    if (point_.tokens[slot] == kNoToken) return kJournalFields[slot].whenMissing;
  }
  if (point_.attributes.size() > kMaxAttributes) return MalformedReason::tooManyAttributes;
  return std::nullopt;
}

void IntervalAssembler::emitEvent() {
  ++counts_.events;
  if (!sink_.admits({table_, point_.tokens, point_.tokens})) return;
  // An event lasts no time unless it states a duration.
  sink_.deliverEvent(
      std::make_shared<const TesselEvent>(fieldsOf(point_.tokens, 0), processOf(point_.tokens)));
}

void IntervalAssembler::begin(const EntryHeader& header) {
  const auto [place, replaced] =
      open_.open(keyOf(header), writerNumber(), header.monotonic, point_.tokens, point_.attributes);
  if (replaced) ++counts_.replacedBegins;
  // The end has the same id, and so nearly always the same token.
  table_.setNumberOn(point_[FieldKind::intervalId], place);
}

// Few writers make nearly all begins. A comparison of tokens costs a third of reading their values.
uint32_t IntervalAssembler::writerNumber() {
  const FieldToken image = point_[FieldKind::imagePath];
  RecentWriter& recent = recentWriters_[image % kRecentWriters];
  const RecentWriter wanted{image, point_[FieldKind::user], point_[FieldKind::sessionOwner],
                            recent.number};
  if (recent != wanted || recent.number == FlatIndex::kNone) [[unlikely]] {
    recent = wanted;
    recent.number = writers_.numberOf(writer());
  }
  return recent.number;
}

void IntervalAssembler::end(const EntryHeader& header) {
  const OpenInterval* begin =
      open_.find(keyOf(header), table_.numberOn(point_[FieldKind::intervalId]));
  if (begin == nullptr) {
    ++counts_.unmatchedEnds;
    return;
  }
  ++counts_.pairedEnds;
  // The pointer stays valid until close(), because a sink cannot reach `open_`. If the end has an
  // earlier time than its begin, the interval gets a negative duration. We deliver it all the same,
  // because the filter counts such intervals.
  const auto microseconds = static_cast<int64_t>(header.monotonic - begin->monotonic);
  const auto seconds = static_cast<float>(static_cast<double>(microseconds) / 1e6);
  if (sink_.admits({table_, begin->tokens, point_.tokens}))
    deliverMerged(begin->tokens, begin->attributes, seconds);
  open_.close(begin);
}

// If begin and end state the same field, the end's value counts, because the writer knew more by
// then. Telemetry is different: a writer may mark an interval at either side, so one mark is
// enough. The object names the process of the begin and the process of the end.
void IntervalAssembler::deliverMerged(const PointTokens& begin,
                                      const std::vector<FieldToken>& beginAttributes,
                                      float measuredSeconds) {
  PointTokens merged;
  for (size_t slot = 0; slot < kPointSlots; ++slot) {
    merged[slot] = point_.tokens[slot] != kNoToken ? point_.tokens[slot] : begin[slot];
  }
  TracePointFields fields = fieldsOf(merged, measuredSeconds);
  fields.telemetryEnabled = table_.flag(tokenOf(begin, FieldKind::telemetry)) ||
                            table_.flag(point_[FieldKind::telemetry]);
  IntervalFields interval{processOf(begin), processOf(point_.tokens), {}};
  appendAttributes(point_.attributes, interval);
  appendAttributes(beginAttributes, interval);
  const FieldToken frameRate = tokenOf(merged, FieldKind::frameRate);
  if (frameRate == kNoToken) {
    sink_.deliverInterval(
        std::make_shared<const TesselInterval>(std::move(fields), std::move(interval)));
  } else {
    sink_.deliverAnimationInterval(std::make_shared<const TesselAnimationInterval>(
        std::move(fields), std::move(interval), table_.real(frameRate)));
  }
}

// The monotonic clock starts anew with each boot, so a difference between two boots means nothing.
// That is why the key holds the boot. Two processes may use the same id by chance. That is why the
// key holds the process, unless the writer asked for system scope.
IntervalKey IntervalAssembler::keyOf(const EntryHeader& header) {
  const bool system = table_.flag(point_[FieldKind::scope]);
  return {table_.identity(point_[FieldKind::intervalId]),
          table_.bootToken(header.bootId),
          point_[FieldKind::subsystem],
          point_[FieldKind::category],
          point_[FieldKind::name],
          system ? IntervalKey::kSystemScope : point_[FieldKind::process]};
}

// A writer may time something else than the moments at which it writes. So a duration that it
// states counts, and the measured one is only the fallback.
TracePointFields IntervalAssembler::fieldsOf(const PointTokens& tokens,
                                             float measuredSeconds) const {
  const auto text = [&](FieldKind kind) { return table_.text(tokenOf(tokens, kind)); };
  const auto number = [&](FieldKind kind) { return table_.number(tokenOf(tokens, kind)); };
  const FieldToken duration = tokenOf(tokens, FieldKind::duration);
  TracePointFields fields;
  fields.pool = table_.strings();
  fields.subsystem = text(FieldKind::subsystem);
  fields.category = text(FieldKind::category);
  fields.name = text(FieldKind::name);
  for (size_t slot = 0; slot < kLabelledStrings; ++slot) {
    fields.strings[slot] = {text(labelled(FieldKind::string1Name, slot)),
                            text(labelled(FieldKind::string1Value, slot))};
  }
  for (size_t slot = 0; slot < kLabelledNumbers; ++slot) {
    fields.numbers[slot] = {text(labelled(FieldKind::number1Name, slot)),
                            number(labelled(FieldKind::number1Value, slot))};
  }
  fields.durationSeconds = duration == kNoToken ? measuredSeconds : table_.real(duration);
  fields.statesDuration = duration != kNoToken;
  fields.telemetryEnabled = table_.flag(tokenOf(tokens, FieldKind::telemetry));
  return fields;
}

void IntervalAssembler::forEachOpen(const OpenVisitor& visit) const {
  open_.forEach([&](const OpenInterval& interval) {
    const auto text = [&](FieldKind kind) { return table_.text(tokenOf(interval.tokens, kind)); };
    visit(text(FieldKind::subsystem), text(FieldKind::category), text(FieldKind::name));
  });
}

EmittingProcess IntervalAssembler::processOf(const PointTokens& tokens) const {
  return {table_.text(tokenOf(tokens, FieldKind::imagePath)),
          table_.text(tokenOf(tokens, FieldKind::processName))};
}

// Adds the attributes of one entry. An attribute that the interval has from the other entry stays.
// Of several with one key in this entry, the greatest value counts. All keys come from one pool, so
// equal keys have the same record. An entry has at most 32 attributes, so a linear search is quick.
void IntervalAssembler::appendAttributes(const std::vector<FieldToken>& tokens,
                                         IntervalFields& interval) const {
  const size_t fromOther = interval.attributes.size();
  for (const FieldToken token : tokens) {
    const auto& attribute = table_.attribute(token);
    const auto known = std::find_if(
        interval.attributes.begin(), interval.attributes.end(),
        [&](const auto& other) { return other.first.record() == attribute.first.record(); });
    if (known == interval.attributes.end()) {
      interval.attributes.push_back(attribute);
    } else if (static_cast<size_t>(known - interval.attributes.begin()) >= fromOther &&
               known->second.text() < attribute.second.text()) {
      known->second = attribute.second;
    }
  }
}

// A key consists of tokens, so each key changes with the generation. Different values get different
// tokens in the new generation too, so two different keys never become equal.
void IntervalAssembler::startGeneration() {
  TracePointTable::Renewal renewal = table_.startGeneration();
  recentWriters_.fill(RecentWriter{});
  open_.renewAll([&](OpenInterval& interval) -> std::optional<size_t> {
    if (!renewal.hasRoom()) return std::nullopt;
    const size_t before = table_.bytes();
    for (FieldToken& token : interval.tokens) token = renewal.renewed(token);
    for (FieldToken& token : interval.attributes) token = renewal.renewed(token);
    const auto token = [&](FieldKind kind) { return tokenOf(interval.tokens, kind); };
    IntervalKey& key = interval.key;
    key.boot = renewal.renewed(key.boot);
    key.subsystem = token(FieldKind::subsystem);
    key.category = token(FieldKind::category);
    key.name = token(FieldKind::name);
    key.id = table_.identity(token(FieldKind::intervalId));
    if (key.process != IntervalKey::kSystemScope) key.process = token(FieldKind::process);
    return table_.bytes() - before;
  });
}

}  // namespace tessel
