// walkPayload(): reads the payload of a row, member by member, for every output format.
//
// A payload goes from the parser's events straight to the writer of a format. A document tree
// between them was discarded: it costs several allocations per member and prints numbers anew, so
// that the spool's digits would be lost.

#pragma once

#include <algorithm>
#include <cstdint>
#include <iterator>
#include <limits>
#include <nlohmann/json.hpp>
#include <string>
#include <string_view>
#include <utility>

namespace tessel {

// These members are floating-point numbers. The spool writes 2.0 for 2, but rows of an older
// version may wait in it that have 2, which looks like an integer. A backend that receives both
// kinds under one name may refuse one of them.
inline constexpr std::string_view kFloatingKeys[] = {"DurationInSeconds", "FrameRate",
                                                     "ProcessingDurationInSeconds"};

// Calls `sink` for each member in payload order, and stops at anything that is not flat. Texts are
// valid UTF-8. A sink has these functions, each with the key first:
//
//   text(key, text)
//   boolean(key, value)
//   integer(key, value)               from -2^63 to 2^63-1
//   largeInteger(key, digits)         from 2^63 to 2^64-1; no format but JSON has a kind for it
//   floating(key, value, digits)      the digits are those of the spool
//   nothing(key)                      the spool writes null for a number that is not finite
template <typename Sink>
class PayloadWalk final : public nlohmann::json_sax<nlohmann::json> {
  using Json = nlohmann::json;

 public:
  explicit PayloadWalk(Sink& sink) : sink_(sink) {}

  bool null() override {
    if (inside_) sink_.nothing(key_);
    return inside_;
  }
  bool boolean(bool value) override {
    if (inside_) sink_.boolean(key_, value);
    return inside_;
  }
  bool number_integer(int64_t value) override {
    if (isFloatingKey()) return number_float(static_cast<double>(value), fraction(value));
    if (inside_) sink_.integer(key_, value);
    return inside_;
  }
  bool number_unsigned(uint64_t value) override {
    if (isFloatingKey()) return number_float(static_cast<double>(value), fraction(value));
    if (!inside_) return false;
    if (value <= uint64_t{std::numeric_limits<int64_t>::max()}) {
      sink_.integer(key_, static_cast<int64_t>(value));
    } else {
      sink_.largeInteger(key_, std::to_string(value));
    }
    return true;
  }
  bool number_float(double value, const std::string& digits) override {
    if (inside_) sink_.floating(key_, value, digits);
    return inside_;
  }
  bool string(std::string& value) override {
    if (inside_) sink_.text(key_, value);
    return inside_;
  }
  bool binary(Json::binary_t& /*value*/) override { return false; }
  bool start_object(size_t /*size*/) override { return !std::exchange(inside_, true); }
  bool end_object() override { return true; }
  bool start_array(size_t /*size*/) override { return false; }
  bool end_array() override { return false; }
  bool key(std::string& name) override {
    key_ = std::move(name);
    return true;
  }
  bool parse_error(size_t /*position*/, const std::string& /*token*/,
                   const Json::exception& /*error*/) override {
    return false;
  }

 private:
  bool isFloatingKey() const {
    return std::find(std::begin(kFloatingKeys), std::end(kFloatingKeys), key_) !=
           std::end(kFloatingKeys);
  }
  static std::string fraction(auto integer) { return std::to_string(integer) + ".0"; }

  Sink& sink_;
  std::string key_;
  bool inside_ = false;  // the object
};

// False if the payload is not a flat JSON object. The sink may then have been called all the same.
template <typename Sink>
bool walkPayload(std::string_view payload, Sink& sink) {
  PayloadWalk<Sink> walk(sink);
  return nlohmann::json::sax_parse(payload, &walk);
}

}  // namespace tessel
