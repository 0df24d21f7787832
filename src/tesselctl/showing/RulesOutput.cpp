// The rules of the build in four forms.
//
// A list may repeat a text. Every form shows it once, since people count what they see.

#include "tesselctl/showing/RulesOutput.h"

#include <algorithm>
#include <cctype>
#include <set>
#include <utility>
#include <variant>

#include "platform/Text.h"
#include "whitelist/StringWhitelist.h"

namespace tessel::ctl {

namespace {

constexpr size_t kMostNear = 5;      // more would be a list to read, not a hint
constexpr size_t kShortestNear = 3;  // a shorter text begins too many values
constexpr size_t kPageWidth = 100;

std::vector<std::string_view> distinctValues(const StringListRow& row) {
  std::vector<std::string_view> values;
  std::set<std::string_view> seen;
  for (const std::string_view value : row.list()) {
    if (seen.insert(value).second) values.push_back(value);
  }
  return values;
}

// ASCII alone: the lists hold no other letters, and the letters of a locale would make the hint
// differ from machine to machine.
std::string lowered(std::string_view text) {
  std::string out(text);
  for (char& c : out) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return out;
}

template <typename Texts>
std::string joined(const Texts& texts, std::string_view between) {
  std::string out;
  for (const auto& text : texts) out.append(out.empty() ? "" : between).append(text);
  return out;
}

std::vector<std::string_view> namesOf(const ListRows& rows) {
  std::vector<std::string_view> names;
  for (const StringListRow* row : rows) names.push_back(row->name);
  return names;
}

// What the profile knows of performance logging, if it has the rule: the list of each string.
constexpr StringListSource kPerfLoggingLists[] = {perfLoggingComponentNames,
                                                  perfLoggingActionNames};

// In the table of the build an empty text stands for any. On a screen it would look like a mistake,
// so a star stands for it, as in patterns.
std::string anyIfEmpty(std::string_view text) { return text.empty() ? "*" : std::string(text); }

std::string shareWords(uint64_t cap, uint64_t ratio) {
  // A cap of zero outranks the ratio: "one in 100, until 0 were" would read like a share.
  if (cap == 0) return "none is reported";
  const std::string share = ratio == 1 ? "each" : "one in " + grouped(ratio);
  return share + " is reported, until " + grouped(cap) +
         " were, as long as the service's process lives";
}

// A line of a list that programs read: its kind and its fields, as JSON or with tabs between.
// Keys and fields stand side by side in one table, so a line and its JSON cannot tell different
// things.
struct Field {
  const char* key;
  std::variant<std::string_view, uint64_t> value;
  bool any = false;  // absent in JSON, "*" in a line
};
std::string recordLine(bool asJson, std::string_view kind, const std::vector<Field>& fields) {
  if (asJson) {
    return objectLine([&](JsonWriter& json) {
      json.member("kind", kind);
      for (const Field& field : fields) {
        if (field.any) continue;
        std::visit([&](const auto& value) { json.member(field.key, value); }, field.value);
      }
    });
  }
  std::vector<std::string> texts = {std::string(kind)};
  for (const Field& field : fields) {
    const auto* text = std::get_if<std::string_view>(&field.value);
    texts.push_back(field.any ? "*"
                    : text    ? terminalText(*text)
                              : std::to_string(std::get<uint64_t>(field.value)));
  }
  return fieldsLine(texts);
}

// --- The answer to a check.

// `string` as people call it: its slot and text in a trace point, or the text alone.
std::string shownString(const StringAnswer& string, bool inPoint) {
  if (!inPoint) return "'" + terminalText(string.value) + "'";
  const std::string slot = "string " + std::to_string(string.slot);
  if (!string.present) return slot + ", which is absent,";
  return slot + ", " + terminalText(string.label) + "=" + terminalText(string.value) + ",";
}

std::string stringWords(const StringAnswer& string, const CheckAnswer& answer) {
  std::string words = shownString(string, !answer.path.empty());
  if (string.list != nullptr)
    return words + " stands on the list " + std::string(string.list->name) + " (" +
           std::string(string.list->words) + ")";
  if (answer.special) {
    words += " must stand on the list " + joined(namesOf(string.allowed), ", ");
  } else {
    words += " stands on no list of " + std::string(nameForPlatform(answer.machine.platform));
  }
  if (!string.near.empty())
    words +=
        (string.near.size() == 1 ? "; a known value near it: '" : "; known values near it: '") +
        joined(string.near, "', '") + "'";
  if (!string.elsewhere.empty())
    words += "; it is a known value on " + joined(string.elsewhere, ", ");
  return words;
}

// What decided, first; then what else applies to the strings.
std::vector<std::string> reasons(const CheckAnswer& answer) {
  std::vector<std::string> out;
  const bool inPoint = !answer.path.empty();
  if (answer.downsampling) {
    out.push_back("the downsampling row " + terminalText(answer.downsampling->scope) + ": " +
                  shareWords(answer.downsampling->cap, answer.downsampling->ratio));
  } else if (inPoint && answer.failedSlot == 0) {
    out.emplace_back("no downsampling row covers it");
  }
  for (const StringAnswer& string : answer.strings) {
    // A build with internal diagnostics let it pass without asking a list.
    const bool asked = string.list != nullptr || string.slot == answer.failedSlot;
    std::string words = !asked && answer.machine.internal
                            ? "a build with internal diagnostics asks no list"
                            : stringWords(string, answer);
    // The string that failed decided, so it comes first.
    out.insert(string.slot == answer.failedSlot ? out.begin() : out.end(), std::move(words));
  }
  return out;
}

void writeString(JsonWriter& json, const StringAnswer& string, bool inPoint) {
  json.object([&] {
    if (inPoint) {
      json.member("slot", string.slot);
      if (string.present) json.member("label", string.label);
    }
    if (string.present) json.member("value", string.value);
    if (string.list != nullptr) json.member("list", string.list->name);
    json.array("allowed", namesOf(string.allowed),
               [&](std::string_view name) { json.value(name); });
    if (string.list != nullptr) return;
    json.array("near", string.near, [&](std::string_view value) { json.value(value); });
    json.array("elsewhere", string.elsewhere, [&](std::string_view name) { json.value(name); });
  });
}

// --- All rules.

// The number of distinct values, as the lists show them below it. The length of the raw list would
// not agree with what a reader counts.
std::string listSummary(const StringListRow& row) {
  return std::string(row.name) + " (" + grouped(distinctValues(row).size()) +
         "): " + std::string(row.words);
}

std::string perfLoggingWords() {
  const auto lists = namesOf(listRows(kPerfLoggingLists));
  return joined(kPerfLoggingOperation, " / ") + ": string 1 must stand on the list " +
         std::string(lists[0]) + " and string 2 on the list " + std::string(lists[1]) +
         ", in every build.";
}

// The page is written by the program and compared with docs/rules.md by a test. So a list that is
// extended cannot leave a page behind that says otherwise.
constexpr char kPageHead[] = R"(# The rules of the build

This page is the output of `tesselctl rules --markdown`.

A labelled string of a marked trace point is reported only if its value stands on a list of the
platform, letter for letter. If one string fails, the trace point is not reported: only its
subsystem and category are counted. A build with internal diagnostics asks no list.
`tesselctl rules check VALUE` says whether a value would pass, and
`tesselctl rules check SUBSYSTEM CATEGORY NAME` says it of a trace point.

## Platforms

| platform | known values | lists |
|---|---|---|
)";
constexpr char kPageDownsampling[] = R"(
## Downsampling

Of the trace points that a row covers, one in so many is reported, until the cap is reached. The
counters live as long as the service's process: under the timer that is one run. `*` stands for any.

| platform | subsystem | category | name | cap | one in |
|---|---|---|---|---|---|
)";

// The rows stand in the order of the build, so that the table can be held against its source.
Table downsamplingTable(const PlatformProfile& profile) {
  Table table({{"SUBSYSTEM", Table::Align::left, true},
               {"CATEGORY", Table::Align::left, true},
               {"NAME", Table::Align::left, true},
               {"AT MOST", Table::Align::right},
               {"ONE IN", Table::Align::right}});
  for (const DownsampleRow& row : profile.downsampling) {
    table.add({std::string(row.subsystem), anyIfEmpty(row.category), anyIfEmpty(row.name),
               grouped(row.cap), grouped(row.ratio)});
  }
  return table;
}

}  // namespace

ListRows listRows(std::span<const StringListSource> lists) {
  ListRows rows;
  for (const StringListRow& row : stringLists()) {
    if (std::ranges::find(lists, row.list) != lists.end()) rows.push_back(&row);
  }
  return rows;
}

// A search along the lists, not in the set of the filter: the set knows only whether a value is
// known, and people ask where it stands. It runs once for each string of a command line.
const StringListRow* listWith(const ListRows& rows, std::string_view value) {
  const auto found = std::ranges::find_if(rows, [&](const StringListRow* row) {
    return std::ranges::find(row->list(), value) != row->list().end();
  });
  return found == rows.end() ? nullptr : *found;
}

std::vector<std::string_view> nearValues(const ListRows& rows, std::string_view value) {
  std::vector<std::string_view> near;
  const std::string wanted = lowered(value);
  for (const StringListRow* row : rows) {
    for (const std::string_view known : distinctValues(*row)) {
      const std::string other = lowered(known);
      // A value that begins alike is most often a plural or a longer form, such as "weekly" for
      // "week". An edit distance would also offer "weak", which is another word.
      const bool shortOne = std::min(wanted.size(), other.size()) < kShortestNear;
      if (wanted == other ||
          (!shortOne && (wanted.starts_with(other) || other.starts_with(wanted))))
        near.push_back(known);
      if (near.size() == kMostNear) return near;
    }
  }
  return near;
}

std::string checkText(const CheckAnswer& answer, const Terminal& terminal) {
  const auto why = reasons(answer);
  const std::string platform(nameForPlatform(answer.machine.platform));
  // The verdict and the platform come before the reasons: scripts count fields from the first, and
  // the reasons are the only part of any length.
  if (!terminal.interactive) {
    return fieldsLine({answer.passes ? "passes" : "fails", std::string(answer.verdict), platform,
                       joined(why, "; ")});
  }
  std::string out = terminal.paint(answer.passes ? Colour::good : Colour::bad,
                                   answer.passes ? "It would pass" : "It would not pass") +
                    " on " + platform + ":\n";
  for (const std::string& reason : why)
    out += "  " + wrappedBeside(reason, terminal.width, 2) + "\n";
  return out;
}

std::string checkJson(const CheckAnswer& answer) {
  return objectLine([&](JsonWriter& json) {
    json.member("passes", answer.passes).member("verdict", answer.verdict);
    json.member("platform", nameForPlatform(answer.machine.platform));
    json.member("internal", answer.machine.internal);
    static constexpr const char* kKeys[] = {"subsystem", "category", "name"};
    for (size_t at = 0; at < answer.path.size(); ++at) json.member(kKeys[at], answer.path[at]);
    if (answer.failedSlot != 0) json.member("slot", answer.failedSlot);
    if (answer.special) json.member("special", true);
    if (answer.downsampling) {
      json.object("downsampling", [&] {
        json.member("scope", answer.downsampling->scope).member("cap", answer.downsampling->cap);
        json.member("ratio", answer.downsampling->ratio);
      });
    }
    json.array("strings", answer.strings, [&](const StringAnswer& string) {
      writeString(json, string, !answer.path.empty());
    });
    json.member("reason", joined(reasons(answer), "; "));
  });
}

std::string rulesLines(const PlatformProfile& profile, bool json) {
  std::string out;
  // The first profile is that of no platform. All others are listed, since the same value may pass
  // on another one.
  for (const PlatformProfile& platform : platformProfiles().subspan<1>()) {
    out += recordLine(json, "platform",
                      {{"platform", platform.name},
                       {"build", platform.platform == currentPlatform() ? "this" : "other"},
                       {"values", stringWhitelistForPlatform(platform.platform).size()},
                       {"rows", platform.downsampling.size()}});
  }
  for (const StringListRow* row : listRows(profile.whitelist)) {
    for (const std::string_view value : distinctValues(*row))
      out += recordLine(json, "value",
                        {{"platform", profile.name}, {"list", row->name}, {"value", value}});
  }
  if (profile.hasPerfLoggingRule) {
    const auto lists = namesOf(listRows(kPerfLoggingLists));
    out += recordLine(json, "special",
                      {{"platform", profile.name},
                       {"subsystem", kPerfLoggingOperation[0]},
                       {"category", kPerfLoggingOperation[1]},
                       {"name", kPerfLoggingOperation[2]},
                       {"string1", lists[0]},
                       {"string2", lists[1]}});
  }
  for (const DownsampleRow& row : profile.downsampling) {
    out += recordLine(json, "downsampling",
                      {{"platform", profile.name},
                       {"subsystem", row.subsystem},
                       {"category", row.category, row.category.empty()},
                       {"name", row.name, row.name.empty()},
                       {"cap", row.cap},
                       {"ratio", row.ratio}});
  }
  return out;
}

std::string rulesText(const PlatformProfile& profile, bool internal, const Terminal& terminal) {
  const auto paragraph = [&](const std::string& text, size_t indent = 0) {
    return std::string(indent, ' ') + wrappedBeside(text, terminal.width, indent) + "\n";
  };
  // Whoever asks about another platform must see that this machine judges by other lists.
  const bool own = profile.platform == currentPlatform();
  std::string out =
      paragraph("Platform " + std::string(profile.name) + (own ? ", this build's" : "") +
                ". A labelled string" + " is reported only if its value is one of these " +
                grouped(stringWhitelistForPlatform(profile.platform).size()) +
                ". All platforms: " + platformNames() + ".");
  if (internal)
    out += paragraph("Internal diagnostics: this build asks no list, and every value is reported.");
  for (const StringListRow* row : listRows(profile.whitelist)) {
    out += "\n" + paragraph(terminal.paint(Colour::strong, listSummary(*row)));
    out += paragraph(joined(distinctValues(*row), " "), 2);
  }
  if (profile.hasPerfLoggingRule) out += "\n" + paragraph(perfLoggingWords());
  if (profile.downsampling.empty()) return out + "\nNothing is downsampled.\n";
  return out + "\nDownsampling, as long as the service's process lives:\n" +
         downsamplingTable(profile).render(terminal, 2);
}

std::string rulesMarkdown() {
  std::string out = kPageHead;
  const auto platforms = platformProfiles().subspan<1>();
  for (const PlatformProfile& profile : platforms) {
    const auto names = namesOf(listRows(profile.whitelist));
    const bool own = profile.platform == currentPlatform();
    out += "| " + std::string(profile.name) + (own ? " (this build)" : "") + " | " +
           grouped(stringWhitelistForPlatform(profile.platform).size()) + " | " +
           (names.empty() ? "none" : joined(names, ", ")) + " |\n";
  }
  for (const PlatformProfile& profile : platforms) {
    if (profile.hasPerfLoggingRule)
      out += "\nOn " + std::string(profile.name) + " one trace point has a rule of its own.\n" +
             wrapped(perfLoggingWords(), kPageWidth, 0) + "\n";
  }
  out += kPageDownsampling;
  for (const PlatformProfile& profile : platforms) {
    for (const DownsampleRow& row : profile.downsampling)
      out += "| " + std::string(profile.name) + " | `" + std::string(row.subsystem) + "` | `" +
             anyIfEmpty(row.category) + "` | `" + anyIfEmpty(row.name) + "` | " + grouped(row.cap) +
             " | " + grouped(row.ratio) + " |\n";
  }
  for (const StringListRow& row : stringLists()) {
    out += "\n## " + listSummary(row) + "\n\n```\n" +
           wrapped(joined(distinctValues(row), " "), kPageWidth, 0) + "\n```\n";
  }
  return out;
}

}  // namespace tessel::ctl
