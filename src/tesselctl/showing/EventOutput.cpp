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

// Anybody may have written the row, so a key may hold a number where the service writes a text.
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

Date dateOf(int64_t time) { return Date{std::chrono::microseconds{time}}; }

// A record that the forwarder itself has made has no id.
std::string idText(const SpooledEvent& event) {
  return event.id == 0 ? "" : std::to_string(event.id);
}

// The fields of a row for other programs. The payload is the last and the only one of any length.
std::string rowFields(const SpoolRow& row, const Terminal& terminal) {
  const SpooledEvent& event = row.event;
  return fieldsLine({idText(event), terminal.paint(Colour::faint, stampText(dateOf(event.time))),
                     terminalText(event.name),
                     row.delivery ? stampText(dateOf(row.delivery->at)) : "",
                     row.delivery ? terminalText(row.delivery->destination) : "",
                     glance(parsed(event.payload), event.payload)});
}

constexpr size_t kIdWidth = 6;
// A quarter of 80 columns. A wider name would take room from the payload, which tells the same
// trace point and more.
constexpr size_t kEventWidth = 22;

Date timeOf(const SpoolRow& row, RowTime time) {
  return dateOf(time == RowTime::ofDelivery ? row.delivery->at : row.event.time);
}

std::string humanLine(const SpoolRow& row, RowTime which, const Terminal& terminal) {
  const SpooledEvent& event = row.event;
  std::string name = shortened(shownName(event.name), kEventWidth);
  name.append(kEventWidth - std::min(kEventWidth, displayWidth(name)), ' ');
  const std::string time = dateText(timeOf(row, which)).substr(5);
  std::string id = idText(event);
  id.insert(0, kIdWidth - std::min(kIdWidth, id.size()), ' ');
  // Of one width, so that the names stand below each other.
  const std::string state = row.delivery ? "delivered" : "waits    ";
  // The payload gets the rest of the line, and one column at least on a narrow terminal.
  const size_t used = id.size() + 2 + time.size() + 2 + state.size() + 2 + kEventWidth + 2;
  const std::string payload = cutOff(glance(parsed(event.payload), event.payload),
                                     terminal.width - std::min(used, terminal.width - 1));
  return id + "  " + terminal.paint(Colour::faint, time) + "  " + state + "  " + name + "  " +
         payload + "\n";
}

}  // namespace

std::string eventHeading(const SpoolRow& first, RowTime time, const Terminal& terminal) {
  return terminal.paint(Colour::faint,
                        (time == RowTime::ofDelivery ? "First delivery: " : "First row: ") +
                            zonedText(timeOf(first, time))) +
         "\n";
}

EventPath pathOf(const SpooledEvent& row) {
  const Json payload = parsed(row.payload);
  return {member(payload, "Subsystem"), member(payload, "Category")};
}

std::string eventJson(const SpoolRow& row) {
  const SpooledEvent& event = row.event;
  return objectLine([&](JsonWriter& json) {
    if (event.id != 0) json.member("id", event.id);
    json.member("time", event.time).member("name", event.name);
    json.member("state", row.delivery ? "sent" : "waiting");
    if (row.delivery) {
      json.member("delivered", row.delivery->at);
      json.member("destination", row.delivery->destination);
    }
    // Any writer of the spool may have made this row. A payload that is no JSON would break the
    // line around it, so it goes out as a text under another key. A script can tell the two by the
    // key.
    if (Json::accept(event.payload))
      json.rawMember("payload", replaceInvalidUtf8(event.payload));
    else
      json.member("payload_text", event.payload);
  });
}

std::string wholeEvent(const SpoolRow& row, const Terminal& terminal) {
  const SpooledEvent& event = row.event;
  const auto line = [&](std::string_view label, const std::string& text) {
    return terminal.paint(Colour::faint, label) + terminalText(text) + "\n";
  };
  std::string out = line("Id         ", idText(event)) +
                    line("Time       ", stampText(dateOf(event.time))) +
                    line("Name       ", event.name);
  if (row.delivery) {
    out += line("Delivered  ",
                stampText(dateOf(row.delivery->at)) + " to " + row.delivery->destination);
  }
  if (!Json::accept(event.payload)) return out + line("No JSON    ", event.payload);
  std::string escaped;
  JsonWriter(escaped, {.forTerminal = true}).raw(replaceInvalidUtf8(event.payload));
  return out + laidOut(escaped) + "\n";
}

std::string eventLine(const SpoolRow& row, RowTime time, const Terminal& terminal) {
  return terminal.interactive ? humanLine(row, time, terminal) : rowFields(row, terminal);
}

namespace {

std::string rowsText(int64_t count) { return counted(static_cast<uint64_t>(count), "row", "rows"); }

std::string stateCounts(int64_t waiting, int64_t delivered) {
  return rowsText(waiting) + (waiting == 1 ? " waits" : " wait") + ", " + rowsText(delivered) +
         " delivered";
}

std::string destinationLines(const std::vector<Delivered>& destinations) {
  std::string out;
  for (const Delivered& one : destinations) {
    out += rowsText(one.rows) + " to " + terminalText(one.destination) + ", the last at " +
           zonedText(dateOf(one.last)) + "\n";
  }
  return out;
}

std::string refusedLine(const SpoolContents& contents) {
  if (contents.setAside == 0) return "";
  return rowsText(contents.setAside) +
         " refused by the collector and set aside; 'statora_forwarder --requeue' lets them wait"
         " again\n";
}

}  // namespace

std::string eventTotals(const SpoolContents& contents, const std::vector<Delivered>& deliveries) {
  return stateCounts(contents.rows, contents.delivered) + " and still here\n" +
         destinationLines(deliveries) + refusedLine(contents);
}

// A spool may hold rows for any number of destinations that somebody has written. People read a few
// lines.
void ChosenRows::add(const SpoolRow& row) {
  constexpr size_t kMostDestinations = 8;
  if (!row.delivery) {
    ++waiting;
    return;
  }
  ++delivered;
  const auto& [at, destination] = *row.delivery;
  auto known = std::ranges::find(destinations, destination, &Delivered::destination);
  if (known == destinations.end()) {
    if (destinations.size() == kMostDestinations) return;
    known = destinations.insert(known, Delivered{destination});
  }
  ++known->rows;
  known->last = std::max(known->last, at);
}

std::string chosenTotals(const ChosenRows& chosen, const SpoolContents& contents) {
  const std::string shown =
      chosen.none() ? "" : "Shown: " + stateCounts(chosen.waiting, chosen.delivered) + "\n";
  return shown + destinationLines(chosen.destinations) +
         "In the whole spool: " + stateCounts(contents.rows, contents.delivered) +
         " and still here\n" + refusedLine(contents);
}

}  // namespace tessel::ctl
