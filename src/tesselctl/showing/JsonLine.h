// JsonObject: a JSON object written member by member, on one line, fit for a terminal.
//
// Appends to a text that the caller owns; end() closes the object. One thread at a time.

#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Json.h"
#include "platform/Payload.h"
#include "platform/SharedString.h"

namespace tessel::ctl {

// Appends `text` as a string literal in which nothing is left that a terminal may obey.
void appendJsonText(std::string& out, std::string_view text);

class JsonObject {
 public:
  explicit JsonObject(std::string& out) : out_(out) { out_ += '{'; }
  JsonObject(const JsonObject&) = delete;
  JsonObject& operator=(const JsonObject&) = delete;

  JsonObject& text(std::string_view key, std::string_view value);
  // An absent string leaves its key out.
  JsonObject& text(std::string_view key, StringRef value);
  JsonObject& number(std::string_view key, const Number& value);
  JsonObject& count(std::string_view key, uint64_t value) { return number(key, Number{value}); }
  JsonObject& boolean(std::string_view key, bool value) { return number(key, Number{value}); }
  JsonObject& null(std::string_view key) { return raw(key, "null"); }
  // `json` is one valid value.
  JsonObject& raw(std::string_view key, std::string_view json);
  // The value is what `write(std::string&)` appends.
  template <typename Write>
  JsonObject& nested(std::string_view key, Write&& write) {
    this->key(key);
    write(out_);
    return *this;
  }
  // The value is an array: for each of `items` what `write(std::string&, item)` appends.
  template <typename Items, typename Write>
  JsonObject& array(std::string_view key, const Items& items, Write&& write) {
    this->key(key);
    out_ += '[';
    bool first = true;
    for (const auto& item : items) {
      if (!first) out_ += ',';
      first = false;
      write(out_, item);
    }
    out_ += ']';
    return *this;
  }
  void end() { out_ += '}'; }

 private:
  void key(std::string_view name);

  std::string& out_;
  bool empty_ = true;
};

}  // namespace tessel::ctl
