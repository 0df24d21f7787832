// One trace object and what became of it, as JSON, as fields for programs, and as lines for people.
//
// Stateless but for the layout of the lines; any thread.

#pragma once

#include <optional>
#include <string>

#include "journal/EntryStream.h"
#include "tesselctl/judging/Judge.h"
#include "tesselctl/reading/TimeArguments.h"
#include "tesselctl/showing/Terminal.h"
#include "trace/IntervalAssembler.h"

namespace tessel::ctl {

// One trace object and what became of it.
struct Explanation {
  const TesselObject& object;
  const EntryHeader& entry;
  const FilterDecision& decision;
  EntryProcess process;  // that recorded it; of an interval, its end
  std::string scope;     // the part of the downsampling table that decided; may be empty
  std::string payload;   // JSON; empty where nothing would be reported or --payload is not given
};

// One JSON object on a line.
std::string explanationJson(const Explanation& explanation);
// One line of fields with tabs between.
std::string explanationFields(const Explanation& explanation, bool withPayload,
                              const Terminal& terminal);

// The lines for one object on a terminal: its columns, and below them the reason of the verdict. A
// long path takes several lines.
class ExplanationLines {
 public:
  // `since` is given where no period is read: the lines begin then.
  ExplanationLines(const Terminal& terminal, const Period& period, std::optional<Date> since)
      : terminal_(terminal),
        withDay_(period.length() > std::chrono::hours{24}),
        shownPeriod_(since ? "Since " + zonedText(*since) : periodText(period)) {}

  std::string heading() const;
  std::string lines(const Explanation& explanation) const;

 private:
  // The time, with the day if the period is longer than one day, and a gap of two columns. Within a
  // day the time alone says which entry is meant.
  size_t timeWidth() const { return withDay_ ? 16 : 10; }
  // A label longer than its column reaches `beyond` columns further, see wrappedBeside().
  std::string indented(const std::string& text, size_t indent, size_t beyond = 0) const {
    return wrappedBeside(text, terminal_.width, indent, beyond) + "\n";
  }

  const Terminal terminal_;
  const bool withDay_;
  const std::string shownPeriod_;
};

}  // namespace tessel::ctl
