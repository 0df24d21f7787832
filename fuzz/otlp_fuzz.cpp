// Any name and any text as a row of the spool, and any body as a collector's answer. The forwarder
// must send valid JSON, and the same bytes for the same row: a retry sends the row again.

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <nlohmann/json.hpp>
#include <string_view>

#include "forwarder/Encoder.h"
#include "forwarder/Forwarder.h"
#include "platform/Text.h"

namespace {

using namespace tessel;

const Encoder& encoder() {
  static const std::unique_ptr<Encoder>& made = *new std::unique_ptr<Encoder>(
      outputFormats().front()->makeEncoder({"1", "os", "\xff\"", "amd64", std::nullopt}));
  return *made;
}

void checkRow(const SpooledEvent& event) {
  const auto record = encoder().record(event, "00112233445566778899aabbccddeeff");
  if (!record) return;
  if (encoder().record(event, "00112233445566778899aabbccddeeff") != record) std::abort();
  if (!nlohmann::json::accept(event.payload)) std::abort();
  const OutgoingRecord outgoing[] = {{event, *record}, {event, *record}};
  const auto whole = nlohmann::json::parse(encoder().body(outgoing), nullptr, false);
  if (whole.is_discarded()) std::abort();
}

void checkAnswer(std::string_view body) {
  CollectorAnswer answer;
  answer.status = 200;
  answer.body = body;
  encoder().partialSuccess(answer.body);
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
