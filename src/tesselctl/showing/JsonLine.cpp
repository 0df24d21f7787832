// Members of JSON objects.

#include "tesselctl/showing/JsonLine.h"

#include <algorithm>

#include "tesselctl/showing/ShownText.h"

namespace tessel::ctl {

namespace {

bool needsNoEscape(std::string_view text) {
  return std::all_of(text.begin(), text.end(), [](char byte) {
    return byte >= 0x20 && byte < 0x7f && byte != '"' && byte != '\\';
  });
}

}  // namespace

void appendJsonText(std::string& out, std::string_view text) {
  if (needsNoEscape(text)) {
    out.append(1, '"').append(text).append(1, '"');
    return;
  }
  std::string literal;
  appendJsonString(literal, text);
  out += terminalJson(literal);
}

JsonObject& JsonObject::text(std::string_view key, std::string_view value) {
  this->key(key);
  appendJsonText(out_, value);
  return *this;
}

JsonObject& JsonObject::text(std::string_view key, StringRef value) {
  return value ? text(key, value.text()) : *this;
}

JsonObject& JsonObject::number(std::string_view key, const Number& value) {
  return raw(key, numberText(value));
}

JsonObject& JsonObject::raw(std::string_view key, std::string_view json) {
  this->key(key);
  out_ += json;
  return *this;
}

void JsonObject::key(std::string_view name) {
  if (!empty_) out_ += ',';
  empty_ = false;
  appendJsonText(out_, name);
  out_ += ':';
}

}  // namespace tessel::ctl
