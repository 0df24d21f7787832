// Payload storage and its JSON form.

#include "platform/Payload.h"

namespace tessel {

namespace {

constexpr std::string_view kReplacementCharacter = "\xef\xbf\xbd";

struct Utf8Step {
  size_t length;  // bytes consumed
  bool valid;
};

bool isContinuation(std::string_view text, size_t at, unsigned low = 0x80, unsigned high = 0xbf) {
  if (at >= text.size()) return false;
  const auto byte = static_cast<unsigned char>(text[at]);
  return byte >= low && byte <= high;
}

// The well-formed sequence at `at`, or the length of the longest part of it that could start one.
Utf8Step utf8Step(std::string_view text, size_t at) {
  const auto lead = static_cast<unsigned char>(text[at]);
  if (lead < 0x80) return {1, true};
  size_t length = 0;
  unsigned low = 0x80;
  unsigned high = 0xbf;
  if (lead >= 0xc2 && lead <= 0xdf) {
    length = 2;
  } else if (lead >= 0xe0 && lead <= 0xef) {
    length = 3;
    if (lead == 0xe0) low = 0xa0;
    if (lead == 0xed) high = 0x9f;
  } else if (lead >= 0xf0 && lead <= 0xf4) {
    length = 4;
    if (lead == 0xf0) low = 0x90;
    if (lead == 0xf4) high = 0x8f;
  } else {
    return {1, false};
  }
  if (!isContinuation(text, at + 1, low, high)) return {1, false};
  for (size_t i = 2; i < length; ++i) {
    if (!isContinuation(text, at + i)) return {i, false};
  }
  return {length, true};
}

void appendEscaped(std::string& out, unsigned char byte) {
  switch (byte) {
    case '"':
      out += "\\\"";
      return;
    case '\\':
      out += "\\\\";
      return;
    case '\b':
      out += "\\b";
      return;
    case '\f':
      out += "\\f";
      return;
    case '\n':
      out += "\\n";
      return;
    case '\r':
      out += "\\r";
      return;
    case '\t':
      out += "\\t";
      return;
    default:
      break;
  }
  if (byte < 0x20 || byte == 0x7f) {
    constexpr char kDigits[] = "0123456789abcdef";
    out += "\\u00";
    out += kDigits[byte >> 4];
    out += kDigits[byte & 15];
  } else {
    out += static_cast<char>(byte);
  }
}

}  // namespace

void Payload::set(std::string_view key, SharedString value) {
  if (value) store(key, std::move(value));
}

void Payload::set(std::string_view key, Number value) { store(key, value); }

void Payload::store(std::string_view key, Value value) {
  for (Entry& entry : entries_) {
    if (entry.first == key) {
      entry.second = std::move(value);
      return;
    }
  }
  entries_.emplace_back(key, std::move(value));
}

const Payload::Value* Payload::find(std::string_view key) const {
  for (const Entry& entry : entries_) {
    if (entry.first == key) return &entry.second;
  }
  return nullptr;
}

bool isValidUtf8(std::string_view text) {
  for (size_t at = 0; at < text.size();) {
    const Utf8Step step = utf8Step(text, at);
    if (!step.valid) return false;
    at += step.length;
  }
  return true;
}

std::string replaceInvalidUtf8(std::string_view text) {
  std::string out;
  for (size_t at = 0; at < text.size();) {
    const Utf8Step step = utf8Step(text, at);
    if (step.valid) {
      out.append(text, at, step.length);
    } else {
      out += kReplacementCharacter;
    }
    at += step.length;
  }
  return out;
}

void appendJsonString(std::string& out, std::string_view text) {
  out += '"';
  for (size_t at = 0; at < text.size();) {
    const Utf8Step step = utf8Step(text, at);
    if (!step.valid) {
      out += kReplacementCharacter;
    } else if (step.length == 1) {
      appendEscaped(out, static_cast<unsigned char>(text[at]));
    } else {
      out.append(text, at, step.length);
    }
    at += step.length;
  }
  out += '"';
}

std::string payloadJson(const Payload& payload) {
  std::string out = "{";
  for (const Payload::Entry& entry : payload.entries()) {
    if (out.size() > 1) out += ',';
    appendJsonString(out, entry.first);
    out += ':';
    if (const auto* text = std::get_if<SharedString>(&entry.second)) {
      appendJsonString(out, text->text());
    } else {
      out += numberText(std::get<Number>(entry.second));
    }
  }
  out += '}';
  return out;
}

}  // namespace tessel
