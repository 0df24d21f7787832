// Layouts of a row of the spool.

#include "tesselctl/showing/EventOutput.h"

#include <algorithm>
#include <nlohmann/json.hpp>

#include "platform/Text.h"
#include "tesselctl/reading/TimeArguments.h"

namespace tessel::ctl {

namespace {

using Json = nlohmann::ordered_json;

// The payload as JSON. A payload that is no JSON gives a "discarded" value instead of an exception;
// a discarded value is no object, so member() finds nothing in it.
Json parsed(std::string_view payload) { return Json::parse(payload, nullptr, false); }

std::string member(const Json& payload, const char* key) {
  const auto found = payload.is_object() ? payload.find(key) : payload.end();
  return found != payload.end() && found->is_string() ? found->get<std::string>() : "";
}

// The payload as one line "path key=value ...", which people read more easily than JSON.
std::string glance(const Json& payload, std::string_view text) {
  if (!payload.is_object()) return terminalText(text);
  std::string path;
  for (const char* key : {"Subsystem", "Category", "Name"}) {
    const std::string value = member(payload, key);
    if (!value.empty()) path += (path.empty() ? "" : "/") + value;
  }
  std::string out = terminalText(path);
  for (const auto& [key, value] : payload.items()) {
    if (key == "Subsystem" || key == "Category" || key == "Name") continue;
    out += (out.empty() ? "" : " ") + terminalText(key) + "=";
    out += terminalText(value.is_string()
                            ? value.get_ref<const std::string&>()
                            : value.dump(-1, ' ', false, Json::error_handler_t::replace));
  }
  return out;
}

// All events of the service share one prefix. Without it the rest of the name, which differs, fits
// the column.
std::string shownName(std::string_view name) {
  constexpr std::string_view kCommon = "com.vantor.performance.";
  if (name.starts_with(kCommon)) return "~" + terminalText(name.substr(kCommon.size()));
  return terminalText(name);
}

// Valid JSON with each member on a line of its own. The text is laid out and not parsed: a parser
// would round numbers, and drop all but one of the members of the same name.
std::string laidOut(std::string_view json) {
  // A hostile payload may nest half a million deep. Full indentation would then take gigabytes.
  constexpr size_t kDeepest = 40;  // steps, of two columns; deeper ones would leave the screen
  std::string out;
  size_t depth = 0;
  bool quoted = false;
  bool escaped = false;
  const auto newLine = [&] { out.append(1, '\n').append(2 * std::min(depth, kDeepest), ' '); };
  for (const char byte : json) {
    if (quoted) {
      out += byte;
      quoted = escaped || byte != '"';
      escaped = !escaped && byte == '\\';
    } else if (byte == '{' || byte == '[') {
      out += byte;
      ++depth;
      newLine();
    } else if (byte == '}' || byte == ']') {
      --depth;
      // Nothing stood between the brackets if only the indentation follows the opening one.
      const size_t last = out.find_last_not_of(" \n");
      const bool empty = out[last] == (byte == '}' ? '{' : '[');
      empty ? out.resize(last + 1) : newLine();
      out += byte;
    } else if (byte == ',') {
      out += byte;
      newLine();
    } else if (byte == ':') {
      out += ": ";
    } else if (byte != ' ' && byte != '\t' && byte != '\n' && byte != '\r') {
      out += byte;
      quoted = byte == '"';
    }
  }
  return out;
}

Date dateOf(const SpooledEvent& row) { return Date{std::chrono::microseconds{row.time}}; }

// The fields of a row for other programs. The payload is the last and the only one of any length.
std::string rowFields(const SpooledEvent& row, const Terminal& terminal) {
  return fieldsLine({std::to_string(row.id), terminal.paint(Colour::faint, stampText(dateOf(row))),
                     terminalText(row.name), glance(parsed(row.payload), row.payload)});
}

constexpr size_t kIdWidth = 6;
constexpr size_t kEventWidth = 24;

std::string humanLine(const SpooledEvent& row, const Terminal& terminal) {
  std::string name = shortened(shownName(row.name), kEventWidth);
  name.append(kEventWidth - std::min(kEventWidth, displayWidth(name)), ' ');
  const std::string time = dateText(dateOf(row)).substr(5);
  std::string id = std::to_string(row.id);
  id.insert(0, kIdWidth - std::min(kIdWidth, id.size()), ' ');
  // The payload gets the rest of the line, and one column at least on a narrow terminal.
  const size_t used = id.size() + 2 + time.size() + 2 + kEventWidth + 2;
  const std::string payload = cutOff(glance(parsed(row.payload), row.payload),
                                     terminal.width - std::min(used, terminal.width - 1));
  return id + "  " + terminal.paint(Colour::faint, time) + "  " + name + "  " + payload + "\n";
}

}  // namespace

EventPath pathOf(const SpooledEvent& row) {
  const Json payload = parsed(row.payload);
  return {member(payload, "Subsystem"), member(payload, "Category")};
}

std::string eventJson(const SpooledEvent& row) {
  return objectLine([&](JsonWriter& json) {
    json.member("id", row.id).member("time", row.time).member("name", row.name);
    // Any writer of the spool may have made this row. A payload that is no JSON would break the
    // line around it, so it goes out as a text under another key. A script can tell the two by the
    // key.
    if (Json::accept(row.payload))
      json.rawMember("payload", replaceInvalidUtf8(row.payload));
    else
      json.member("payload_text", row.payload);
  });
}

std::string wholeEvent(const SpooledEvent& row, const Terminal& terminal) {
  const auto line = [&](std::string_view label, const std::string& text) {
    return terminal.paint(Colour::faint, label) + terminalText(text) + "\n";
  };
  std::string out = line("Id       ", std::to_string(row.id)) +
                    line("Time     ", stampText(dateOf(row))) + line("Name     ", row.name);
  if (!Json::accept(row.payload)) return out + line("No JSON  ", row.payload);
  std::string escaped;
  JsonWriter(escaped, {.forTerminal = true}).raw(replaceInvalidUtf8(row.payload));
  return out + laidOut(escaped) + "\n";
}

std::string eventLine(const SpooledEvent& row, const Terminal& terminal) {
  return terminal.interactive ? humanLine(row, terminal) : rowFields(row, terminal);
}

}  // namespace tessel::ctl
