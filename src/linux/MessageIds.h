// Which log lines the journal can explain: their identifiers in the message catalog.

#pragma once

#include <array>
#include <optional>
#include <string_view>

namespace tessel {

struct CatalogedMessage {
  std::string_view beginning;  // of the line; the first that fits decides
  std::string_view id;         // 32 hexadecimal digits
};

// packaging/systemd/tessel.catalog has an entry for each.
inline constexpr std::array<CatalogedMessage, 6> kCatalogedMessages{{
    {"Bailing due to cookie file", "88bc816f3d5048b0ace67b9e33914435"},
    {"Could not clear cookie file: ", "9cb66619cda440b487900bffc379e114"},
    {"Failed to process tessel data due to error: ", "a945202e0c6242889cfdf3bf6a9058b7"},
    {"Not reporting ", "aab21dd8ab154e9e9b6bcf90786745c9"},
    {"Trying to stop in-flight reporting work.", "028e77c9a30243d590fb466bdd747234"},
    {"Done processing ", "23f0765b490247bfb6e565c7b662573f"},
}};

constexpr std::optional<std::string_view> messageIdOf(std::string_view text) {
  for (const CatalogedMessage& message : kCatalogedMessages) {
    if (text.starts_with(message.beginning)) return message.id;
  }
  return std::nullopt;
}

}  // namespace tessel
