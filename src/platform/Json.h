// JsonWriter: writes one JSON value, front to back, into a text that the caller owns.
//
//   json.object([&] {
//     json.member("name", name).member("count", count);
//     json.array("files", files, [&](const File& file) { json.value(file.path); });
//   });
//
// All JSON that this system writes passes through here: payloads in the spool, the run record,
// requests to a collector and the output of tesselctl. One thread at a time uses a writer.

#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <variant>

namespace tessel {

struct JsonStyle {
  // Escapes every character that a terminal may obey.
  bool forTerminal = false;
  // Spaces for each level. 0: everything stands on one line, without spaces.
  size_t indent = 0;
};

// Appends `text` as a JSON string. Each maximal invalid part of its UTF-8 becomes U+FFFD.
void appendJsonString(std::string& out, std::string_view text, bool forTerminal = false);

class JsonWriter {
 public:
  explicit JsonWriter(std::string& out, JsonStyle style = {}) : out_(out), style_(style) {}
  JsonWriter(const JsonWriter&) = delete;
  JsonWriter& operator=(const JsonWriter&) = delete;

  // A text, a number, a bool, a date (microseconds since 1970), or an optional or a variant that
  // holds one of these. Numbers get the shortest digits that read back as the same number of their
  // own type. They show their kind: a float or double has a point or an exponent, an integer has
  // neither. JSON has no infinity and no NaN, so a number that is not finite is written as null.
  template <typename T>
  JsonWriter& value(const T& value);
  // `json` is one valid JSON value in UTF-8.
  JsonWriter& raw(std::string_view json);

  // A member of an object. Nothing is written if the text is absent or the optional is empty.
  template <typename T>
  JsonWriter& member(std::string_view name, const T& value);
  JsonWriter& rawMember(std::string_view name, std::string_view json) {
    return key(name).raw(json);
  }

  // An object, whose members `write()` writes.
  template <typename Write>
  JsonWriter& object(Write&& write);
  template <typename Write>
  JsonWriter& object(std::string_view name, Write&& write) {
    return key(name).object(std::forward<Write>(write));
  }
  // An array, whose values `write()` writes, or `write(item)` for each of `items`.
  template <typename Write>
  JsonWriter& array(std::string_view name, Write&& write);
  template <typename Items, typename Write>
  JsonWriter& array(std::string_view name, const Items& items, Write&& write);

 private:
  // What was written last.
  enum class Place { nothing, opening, key, value };

  JsonWriter& key(std::string_view name);
  void open(char bracket);
  void close(char bracket);
  void separate();
  void newLine();
  void string(std::string_view text);
  void number(int64_t value);
  void number(uint64_t value);
  void number(float value);
  void number(double value);
  void fraction(bool finite, std::string_view shortest);

  std::string& out_;
  const JsonStyle style_;
  size_t depth_ = 0;
  Place place_ = Place::nothing;
};

template <typename T>
JsonWriter& JsonWriter::value(const T& value) {
  if constexpr (std::is_convertible_v<const T&, std::string_view>) {
    string(value);
  } else if constexpr (std::is_same_v<T, bool>) {
    raw(value ? "true" : "false");
  } else if constexpr (std::is_floating_point_v<T>) {
    number(value);
  } else if constexpr (std::is_signed_v<T>) {
    number(int64_t{value});
  } else if constexpr (std::is_integral_v<T> || std::is_enum_v<T>) {
    number(static_cast<uint64_t>(value));
  } else if constexpr (requires { value.text(); }) {
    string(value.text());
  } else if constexpr (requires { value.time_since_epoch(); }) {
    number(int64_t{value.time_since_epoch().count()});
  } else if constexpr (requires { value.has_value(); }) {
    this->value(*value);
  } else {
    std::visit([this](const auto& held) { this->value(held); }, value);
  }
  return *this;
}

template <typename T>
JsonWriter& JsonWriter::member(std::string_view name, const T& value) {
  if constexpr (requires { value.present(); }) {
    if (!value.present()) return *this;
  } else if constexpr (requires { value.has_value(); }) {
    if (!value.has_value()) return *this;
  }
  return key(name).value(value);
}

template <typename Write>
JsonWriter& JsonWriter::object(Write&& write) {
  open('{');
  write();
  close('}');
  return *this;
}

template <typename Write>
JsonWriter& JsonWriter::array(std::string_view name, Write&& write) {
  key(name).open('[');
  write();
  close(']');
  return *this;
}

template <typename Items, typename Write>
JsonWriter& JsonWriter::array(std::string_view name, const Items& items, Write&& write) {
  return array(name, [&] {
    for (const auto& item : items) write(item);
  });
}

}  // namespace tessel
