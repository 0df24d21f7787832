// Matching objects with patterns, and finding words that come near a pattern.

#include "tesselctl/judging/ObjectSelection.h"

#include <fnmatch.h>

#include <algorithm>
#include <numeric>
#include <span>
#include <utility>

#include "platform/Text.h"
#include "tesselctl/judging/Judge.h"

namespace tessel::ctl {

namespace {

constexpr size_t kMostNear = 5;  // fit on a line

// ASCII alone: a subsystem or a category hardly has other letters, and the hint needs none.
std::string lower(std::string_view text) {
  std::string out(text);
  std::ranges::transform(out, out.begin(),
                         [](char c) { return c >= 'A' && c <= 'Z' ? c + 32 : c; });
  return out;
}

// How many characters must be added, removed or changed to make `b` of `a`.
size_t editDistance(std::string_view a, std::string_view b) {
  // One row of the table of distances is enough, because each cell needs only its left, upper and
  // upper left neighbour. `diagonal` keeps the last of them.
  std::vector<size_t> row(b.size() + 1);
  std::iota(row.begin(), row.end(), size_t{0});
  for (size_t i = 0; i < a.size(); ++i) {
    size_t diagonal = std::exchange(row[0], i + 1);
    for (size_t j = 0; j < b.size(); ++j) {
      const size_t changed = diagonal + (a[i] == b[j] ? 0 : 1);
      diagonal = std::exchange(row[j + 1], std::min({row[j + 1] + 1, row[j] + 1, changed}));
    }
  }
  return row[b.size()];
}

// The words that a user is likely to mean: those that hold the pattern or a part of it, or differ
// in a quarter of their letters. The best come first.
std::vector<std::string> nearWords(const std::unordered_set<std::string>& words,
                                   const std::string& pattern) {
  // A name of kilobytes was not typed, and the distance costs time in the product of both lengths.
  constexpr size_t kLongest = 128;
  std::string wanted = lower(pattern);
  std::erase_if(wanted, [](char c) { return c == '*' || c == '?'; });
  std::vector<std::pair<size_t, std::string>> found;
  for (const std::string& word : words) {
    if (word.empty() || word.size() > kLongest || wanted.empty() || wanted.size() > kLongest)
      continue;
    const std::string known = lower(word);
    const size_t distance = editDistance(wanted, known);
    // People leave out a part of a long name more often than they mistype it. So a name that holds
    // the pattern is near however long it is.
    const bool holds = known.find(wanted) != known.npos || wanted.find(known) != wanted.npos;
    if (holds || distance <= std::max<size_t>(2, known.size() / 4))
      found.emplace_back(distance, word);
  }
  std::ranges::sort(found);
  std::vector<std::string> near;
  for (const auto& [distance, word] : std::span(found).first(std::min(found.size(), kMostNear)))
    near.push_back(word);
  return near;
}

}  // namespace

struct ObjectSelection::Kind {
  const char* option;
  const char* one;
  const char* many;
  std::vector<std::string> ObjectPatterns::*patterns;
};

const std::array<ObjectSelection::Kind, 4> ObjectSelection::kKinds = {
    {{"--subsystem", "subsystem", "subsystems", &ObjectPatterns::subsystems},
     {"--category", "category", "categories", &ObjectPatterns::categories},
     {"--name", "name", "names", &ObjectPatterns::names},
     {"--verdict", "verdict", "verdicts", &ObjectPatterns::verdicts}}};

bool fitsOne(const std::vector<std::string>& patterns, const std::string& text) {
  return patterns.empty() ||
         // Without flags a star matches a dot and a slash, too: in "com.vantor.*" people mean all
         // below.
         std::any_of(patterns.begin(), patterns.end(), [&](const std::string& pattern) {
           return ::fnmatch(pattern.c_str(), text.c_str(), 0) == 0;
         });
}

// A million objects may pass here, so a text is copied for the pattern matcher only where there is
// a pattern.
bool ObjectSelection::fitsPath(StringRef subsystem, StringRef category, StringRef name) const {
  const auto fits = [](const std::vector<std::string>& patterns, StringRef text) {
    return patterns.empty() || fitsOne(patterns, std::string(text.textOr("")));
  };
  return fits(patterns_.subsystems, subsystem) && fits(patterns_.categories, category) &&
         fits(patterns_.names, name);
}

bool ObjectSelection::chooses(const TesselObject& object, TesselReporterClassification verdict) {
  const std::string_view verdictWord = verdictName(verdict);
  const auto& verdicts = patterns_.verdicts;
  if ((verdicts.empty() || fitsOne(verdicts, std::string(verdictWord))) &&
      fitsPath(object.subsystem(), object.category(), object.name())) {
    chose_ = true;
    return true;
  }
  // Words are for the answer "nothing fits". Once something fits, nobody asks, and a day of a
  // million objects is spared the copies.
  if (chose_) return false;
  remember(0, object.subsystem().textOr(""));
  remember(1, object.category().textOr(""));
  remember(2, object.name().textOr(""));
  remember(3, verdictWord);
  return false;
}

bool ObjectSelection::choosesBegin(StringRef subsystem, StringRef category, StringRef name) {
  if (!chose_) {
    remember(0, subsystem.textOr(""));
    remember(1, category.textOr(""));
    remember(2, name.textOr(""));
  }
  // A begin has no verdict yet. Whoever asks for one does not mean begins.
  const bool chosen = patterns_.verdicts.empty() && fitsPath(subsystem, category, name);
  choseBegin_ = choseBegin_ || chosen;
  return chosen;
}

void ObjectSelection::remember(size_t kind, std::string_view word) {
  if ((patterns_.*kKinds[kind].patterns).empty() || met_[kind].size() == kMostWords) return;
  met_[kind].emplace(word);
}

std::vector<std::string> ObjectSelection::whyNone() const {
  std::vector<std::string> lines;
  bool asked = false;
  for (size_t kind = 0; kind < kKinds.size(); ++kind) {
    const auto& words = met_[kind];
    for (const std::string& pattern : patterns_.*kKinds[kind].patterns) {
      asked = true;
      const auto fits = [&](const std::string& word) { return fitsOne({pattern}, word); };
      // A pattern that fits something is not to blame, though another one may be.
      if (words.empty() || std::ranges::any_of(words, fits)) continue;
      std::string line = std::string(kKinds[kind].option) + " " + pattern + " fits none of " +
                         counted(words.size(), kKinds[kind].one, kKinds[kind].many);
      const auto near = nearWords(words, pattern);
      for (const std::string& word : near)
        line += (&word == near.data() ? "; near: " : ", ") + word;
      lines.push_back(std::move(line));
    }
  }
  const bool met = std::ranges::any_of(met_, [](const auto& words) { return !words.empty(); });
  if (asked && met && lines.empty() && !choseBegin_)
    lines.emplace_back("each pattern fits something, but no trace object fits all of them");
  return lines;
}

}  // namespace tessel::ctl
