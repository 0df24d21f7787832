// Any name and any text as a row of the spool, and any body as a collector's answer. The forwarder
// must send what each format allows, and the same bytes for the same row: a retry sends the row
// again.

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <nlohmann/json.hpp>
#include <protozero/pbf_reader.hpp>
#include <string_view>

#include "forwarder/DeliveryPolicy.h"
#include "forwarder/Encoder.h"
#include "platform/Text.h"

namespace {

using namespace tessel;

const std::vector<std::unique_ptr<Encoder>>& encoders() {
  static const auto& made = *[] {
    const ResourceAttributes odd{{"os", "\xff\""}, {"Name", "x"}, {"", "y"}};
    auto* const all = new std::vector<std::unique_ptr<Encoder>>;
    for (const OutputFormat* format : outputFormats())
      all->push_back(format->makeEncoder({odd, odd}));
    all->push_back(makeTextEncoder({odd, odd}));
    return all;
  }();
  return made;
}

// Every field of the message and of the messages in it can be read to its end.
void checkMessage(protozero::pbf_reader message, int depth) {
  while (message.next()) {
    if (depth > 0 && message.wire_type() == protozero::pbf_wire_type::length_delimited) {
      checkMessage(message.get_message(), depth - 1);
    } else {
      message.skip();
    }
  }
}

void checkBody(const Encoder& encoder, const std::string& body) {
  if (encoder.contentType() == "application/x-protobuf") {
    // Three levels lead to the records.
    checkMessage(protozero::pbf_reader(body), 2);
    return;
  }
  if (!isValidUtf8(body)) std::abort();
  if (encoder.contentType() == "application/json" && !nlohmann::json::accept(body)) std::abort();
  if (encoder.contentType() == "application/x-ndjson" &&
      (std::count(body.begin(), body.end(), '\n') != 2 ||
       !nlohmann::json::accept(body.substr(0, body.find('\n')))))
    std::abort();
}

void checkRow(const SpooledEvent& event) {
  for (const auto& encoder : encoders()) {
    const auto record = encoder->record(event, "00112233445566778899aabbccddeeff");
    if (!record) continue;
    if (encoder->record(event, "00112233445566778899aabbccddeeff") != record) std::abort();
    if (!nlohmann::json::accept(event.payload)) std::abort();
    const OutgoingRecord outgoing[] = {{event, *record}, {event, *record}};
    checkBody(*encoder, encoder->body(outgoing));
  }
}

void checkAnswer(std::string_view body) {
  CollectorAnswer answer;
  answer.status = 200;
  answer.body = body;
  for (const auto& encoder : encoders()) verdictOn(answer, *encoder);
  answer.status = 400;
  const std::string words = answerWords(answer);
  if (plainText(words, "") != words || words.find('\n') != std::string::npos) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  const size_t nameLength = std::min(text.find('\n'), text.size());
  SpooledEvent event;
  event.id = static_cast<int64_t>(size);
  if (size >= sizeof event.time) std::memcpy(&event.time, data, sizeof event.time);
  event.name = text.substr(0, nameLength);
  event.payload = text.substr(std::min(text.size(), nameLength + 1));
  checkRow(event);
  checkAnswer(event.payload);
  return 0;
}
