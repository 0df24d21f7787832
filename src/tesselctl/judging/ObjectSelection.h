// ObjectSelection: which trace objects a command line asks for, and what there was to choose from.
//
// An empty answer has many reasons: a name that is spelled otherwise, another period, a begin
// without an end. So the selection remembers what it met as long as nothing fits, and can say which
// pattern fits nothing and what comes near it. Memory: at most kMostWords words of each kind.
// Threads: one at a time.

#pragma once

#include <array>
#include <string>
#include <unordered_set>
#include <vector>

#include "objects/TesselObject.h"
#include "objects/TesselReporterClassification.h"

namespace tessel::ctl {

// Whether `text` fits one of the patterns. A pattern may hold *, ? and [...]. Without patterns each
// text fits.
bool fitsOne(const std::vector<std::string>& patterns, const std::string& text);

struct ObjectPatterns {
  std::vector<std::string> subsystems;
  std::vector<std::string> categories;
  std::vector<std::string> names;
  std::vector<std::string> verdicts;
};

class ObjectSelection {
 public:
  // REQUIRES: `patterns` outlives the selection.
  explicit ObjectSelection(const ObjectPatterns& patterns) : patterns_(patterns) {}

  bool chooses(const TesselObject& object, TesselReporterClassification verdict);
  // The same for a begin that waits for its end. It has no verdict yet.
  bool choosesBegin(StringRef subsystem, StringRef category, StringRef name);

  // One line for each pattern that fits nothing that was met; a line about all of them if each fits
  // something. Empty without patterns, and where a begin was chosen, which explains enough.
  // REQUIRES: no object was chosen.
  std::vector<std::string> whyNone() const;

 private:
  static constexpr size_t kMostWords = 4096;
  struct Kind;
  static const std::array<Kind, 4> kKinds;

  void remember(size_t kind, std::string_view word);
  bool fitsPath(StringRef subsystem, StringRef category, StringRef name) const;

  const ObjectPatterns& patterns_;
  bool chose_ = false;
  bool choseBegin_ = false;
  std::array<std::unordered_set<std::string>, 4> met_;  // by the place in kKinds
};

}  // namespace tessel::ctl
