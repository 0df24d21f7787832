// Reading the answer of an OTLP receiver.
//
// Only an answer of the protocol says that a collector has the records. The page on which a network
// asks for a password has status 200, too, and so has {"error": "sign in first"}. So the answer is
// an empty body, or a message with a partial success in it. A field that we do not know may stand
// beside one; fields that we do not know alone are somebody else's answer.

#include <charconv>
#include <nlohmann/json.hpp>
#include <protozero/pbf_reader.hpp>

#include "forwarder/Otlp.h"
#include "platform/Text.h"

namespace tessel {

namespace {

using Json = nlohmann::json;
using Answer = std::optional<PartialSuccess>;

// In OTLP's JSON a 64-bit integer is a decimal string, but some collectors write a number.
uint64_t integerOf(const Json& value) {
  if (value.is_number_unsigned()) return value.get<uint64_t>();
  uint64_t number = 0;
  if (const auto* text = value.get_ptr<const std::string*>()) {
    std::from_chars(text->data(), text->data() + text->size(), number);
  }
  return number;
}

Answer readJson(std::string_view body) {
  const auto json = Json::parse(body, nullptr, false);
  if (!json.is_object()) return {};
  const auto partial = json.find("partialSuccess");
  if (partial == json.end()) return json.empty() ? Answer(PartialSuccess{}) : std::nullopt;
  if (!partial->is_object()) return {};
  PartialSuccess told;
  if (const auto rejected = partial->find("rejectedLogRecords"); rejected != partial->end()) {
    told.rejected = integerOf(*rejected);
  }
  if (const auto message = partial->find("errorMessage");
      message != partial->end() && message->is_string()) {
    told.message = message->get<std::string>();
  }
  return told;
}

PartialSuccess readPartialSuccess(protozero::pbf_reader message) {
  PartialSuccess told;
  while (message.next()) {
    if (message.tag_and_type() == protozero::tag_and_type(1, protozero::pbf_wire_type::varint)) {
      // Nobody rejects less than nothing.
      told.rejected = static_cast<uint64_t>(std::max(message.get_int64(), int64_t{0}));
    } else if (message.tag_and_type() ==
               protozero::tag_and_type(2, protozero::pbf_wire_type::length_delimited)) {
      told.message = message.get_string();
    } else {
      message.skip();
    }
  }
  return told;
}

// protozero tells of bytes that are no message by an exception, which must not leave this room.
Answer readProtobuf(std::string_view body) {
  Answer told;
  try {
    protozero::pbf_reader message(body.data(), body.size());
    while (message.next()) {
      if (message.tag_and_type() ==
          protozero::tag_and_type(1, protozero::pbf_wire_type::length_delimited)) {
        told = readPartialSuccess(message.get_message());
      } else {
        message.skip();
      }
    }
  } catch (const protozero::exception&) {
    return {};
  }
  return told;
}

}  // namespace

std::optional<PartialSuccess> readOtlpSuccess(std::string_view mediaType, std::string_view body) {
  if (body.empty()) return PartialSuccess{};
  if (mediaType == "text/html") return {};
  // No message of the protocol has a brace or a blank for its first byte, so the media type, which
  // a receiver may leave out, need not tell the encodings apart.
  const std::string_view text = trimmed(body);
  if (text.empty()) return PartialSuccess{};
  return text.front() == '{' ? readJson(text) : readProtobuf(body);
}

}  // namespace tessel
