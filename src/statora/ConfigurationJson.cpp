// The JSON of configurations: parsing it, and changing one member of it.

#include <algorithm>
#include <cstdint>
#include <limits>
#include <nlohmann/json.hpp>
#include <utility>
#include <vector>

#include "statora/ConfigurationFiles.h"

namespace tessel {

namespace {

using Json = nlohmann::json;

// Builds the value from the parser's events. A finished document was discarded, because it would be
// built before we could bound its depth. Each handler answers whether parsing goes on.
class Builder final : public nlohmann::json_sax<Json> {
 public:
  bool null() override { return add({}); }
  bool boolean(bool value) override { return add({Number{value}}); }
  bool number_integer(int64_t value) override { return add({Number{value}}); }
  bool number_unsigned(uint64_t value) override {
    const bool fitsSigned = value <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max());
    return add({fitsSigned ? Number{static_cast<int64_t>(value)} : Number{value}});
  }
  bool number_float(double value, const std::string& /*text*/) override {
    return add({Number{value}});
  }
  bool string(std::string& value) override { return add({std::move(value)}); }
  bool binary(Json::binary_t& /*value*/) override { return false; }

  bool start_object(size_t /*size*/) override { return open({ConfigurationValue::Dictionary{}}); }
  bool start_array(size_t /*size*/) override { return open({ConfigurationValue::List{}}); }
  bool end_object() override { return closeInnermost(); }
  bool end_array() override { return closeInnermost(); }
  bool key(std::string& name) override {
    if (tooDeep_ == 0) open_.back().key = std::move(name);
    return true;
  }
  bool parse_error(size_t /*position*/, const std::string& /*token*/,
                   const Json::exception& error) override {
    constexpr int kOutOfRange = 406;  // the library's number for this error
    metHugeNumber_ = error.id == kOutOfRange;
    return false;
  }

  ConfigurationValue take() { return std::move(root_); }
  // Whether parsing ended at a number that no double can hold.
  bool metHugeNumber() const { return metHugeNumber_; }

 private:
  struct Open {
    ConfigurationValue value;
    std::string key;  // of the member that is being read
  };

  bool open(ConfigurationValue container) {
    if (tooDeep_ != 0 || open_.size() == kMaxConfigurationDepth) {
      ++tooDeep_;
    } else {
      open_.push_back({std::move(container), {}});
    }
    return true;
  }
  bool closeInnermost() {
    if (tooDeep_ != 0) return --tooDeep_ != 0 || add({});
    ConfigurationValue finished = std::move(open_.back().value);
    open_.pop_back();
    return add(std::move(finished));
  }
  bool add(ConfigurationValue value) {
    if (tooDeep_ != 0) return true;
    if (open_.empty()) {
      root_ = std::move(value);
    } else if (auto* list = std::get_if<ConfigurationValue::List>(&open_.back().value.value)) {
      list->push_back(std::move(value));
    } else {
      auto& dictionary = std::get<ConfigurationValue::Dictionary>(open_.back().value.value);
      dictionary.insert_or_assign(std::move(open_.back().key), std::move(value));
    }
    return true;
  }

  std::vector<Open> open_;
  size_t tooDeep_ = 0;  // how many containers below the bound are open; their content is dropped
  bool metHugeNumber_ = false;
  ConfigurationValue root_;
};

// The tokens of a JSON text: strings, marks, and words (numbers, true, false, null). It finds where
// a token ends and judges none, so the text must be valid or be parsed afterwards.
class JsonTokens {
 public:
  explicit JsonTokens(std::string_view text) : text_(text) {}

  // Empty at the end.
  std::string_view next() {
    begin_ = std::min(text_.find_first_not_of(" \t\r\n", end_), text_.size());
    end_ = begin_ == text_.size() ? begin_ : endOf(text_[begin_]);
    return text_.substr(begin_, end_ - begin_);
  }
  // The place of the token that next() has answered.
  size_t begin() const { return begin_; }
  size_t end() const { return end_; }

 private:
  size_t endOf(char first) const {
    constexpr std::string_view kMarks = "{}[]:,";
    if (kMarks.find(first) != std::string_view::npos) return begin_ + 1;
    if (first != '"') return std::min(text_.find_first_of(" \t\r\n{}[]:,\"", begin_), text_.size());
    size_t place = begin_ + 1;
    while (place < text_.size() && text_[place] != '"') place += text_[place] == '\\' ? 2 : 1;
    return std::min(place + 1, text_.size());
  }

  const std::string_view text_;
  size_t begin_ = 0, end_ = 0;
};

bool isHugeNumber(std::string_view token) {
  constexpr size_t kShortest = std::string_view("2e308").size();
  if (token.size() < kShortest || token.front() == '"') return false;
  Builder builder;
  return !Json::sax_parse(token.begin(), token.end(), &builder) && builder.metHugeNumber();
}

// The text with null in place of each number that no double can hold.
std::string withoutHugeNumbers(std::string_view text) {
  std::string changed;
  size_t copied = 0;
  JsonTokens tokens(text);
  for (std::string_view token = tokens.next(); !token.empty(); token = tokens.next()) {
    if (!isHugeNumber(token)) continue;
    changed.append(text, copied, tokens.begin() - copied).append("null");
    copied = tokens.end();
  }
  return changed.append(text, copied);
}

}  // namespace

// The parser gives up at a number that no double can hold, and it cannot go on behind it. So we
// take such numbers out and parse once more. A text without them costs nothing more.
std::shared_ptr<const ConfigurationValue> parseConfiguration(std::string_view text) {
  // The parser takes a null byte for the end and would accept whatever follows.
  if (text.find('\0') != std::string_view::npos) return nullptr;
  Builder first, second;
  if (Json::sax_parse(text.begin(), text.end(), &first))
    return std::make_shared<const ConfigurationValue>(first.take());
  if (!first.metHugeNumber() || !Json::sax_parse(withoutHugeNumbers(text), &second)) return nullptr;
  return std::make_shared<const ConfigurationValue>(second.take());
}

// Printing the parsed value would lose what its owners wrote: the form of numbers, and all that we
// do not keep. So we find the member's place in the text and change nothing else.
std::string withMember(std::string_view text, std::string_view key, std::string_view value) {
  // Of equal keys the last counts, so the last one is changed.
  std::optional<std::pair<size_t, size_t>> place;
  size_t depth = 0, previousEnd = 0, closing = 0;
  bool isEmpty = true, keyIsNext = false, valueIsNext = false, inMember = false;
  std::string name;
  JsonTokens tokens(text);
  for (std::string_view token = tokens.next(); !token.empty(); token = tokens.next()) {
    const char first = token.front();
    if (depth == 1 && (first == ',' || first == '}')) {
      if (std::exchange(inMember, false)) place->second = previousEnd;
      keyIsNext = first == ',';
      closing = previousEnd;
    } else if (std::exchange(keyIsNext, false)) {
      name = Json::parse(token).get<std::string>();
      isEmpty = false;
    } else if (std::exchange(valueIsNext, false) && name == key) {
      place = {tokens.begin(), tokens.end()};
      inMember = true;
    }
    valueIsNext = depth == 1 && first == ':';
    if (first == '}' || first == ']') --depth;
    if (first == '{' || first == '[') keyIsNext = ++depth == 1;
    previousEnd = tokens.end();
  }
  std::string changed(text);
  if (place) return changed.replace(place->first, place->second - place->first, value);
  const std::string member = Json(key).dump() + ": " + std::string(value);
  return changed.insert(closing, isEmpty ? member : ", " + member);
}

}  // namespace tessel
