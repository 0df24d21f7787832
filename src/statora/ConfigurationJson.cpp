// Building a configuration value from parser events, so that depth is limited before it is built.

#include "statora/ConfigurationJson.h"

#include <limits>
#include <nlohmann/json.hpp>
#include <utility>
#include <vector>

namespace tessel {

namespace {

using Json = nlohmann::json;

// Each handler answers whether parsing goes on.
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
    open_.back().key = std::move(name);
    return true;
  }
  bool parse_error(size_t /*position*/, const std::string& /*token*/,
                   const Json::exception& /*error*/) override {
    return false;
  }

  ConfigurationValue take() { return std::move(root_); }

 private:
  struct Open {
    ConfigurationValue value;
    std::string key;  // of the member that is being read
  };

  bool open(ConfigurationValue container) {
    if (open_.size() == kMaxConfigurationDepth) return false;
    open_.push_back({std::move(container), {}});
    return true;
  }
  bool closeInnermost() {
    ConfigurationValue finished = std::move(open_.back().value);
    open_.pop_back();
    return add(std::move(finished));
  }
  bool add(ConfigurationValue value) {
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
  ConfigurationValue root_;
};

}  // namespace

std::shared_ptr<const ConfigurationValue> parseConfiguration(std::string_view text) {
  // The parser takes a null byte for the end of its input.
  if (text.find('\0') != std::string_view::npos) return nullptr;
  Builder builder;
  if (!Json::sax_parse(text.begin(), text.end(), &builder)) return nullptr;
  return std::make_shared<const ConfigurationValue>(builder.take());
}

}  // namespace tessel
