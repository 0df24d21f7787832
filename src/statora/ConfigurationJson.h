// Reading a configuration from its JSON text.

#pragma once

#include <memory>
#include <string_view>

#include "platform/Analytics.h"

namespace tessel {

// Deepest nesting of lists and dictionaries that is read.
inline constexpr size_t kMaxConfigurationDepth = 32;

// The configuration that `text` holds; null where it is not one JSON value in UTF-8 with nothing
// after it, or is nested too deeply. Numbers keep their kind: true and false are boolean numbers,
// an integer is signed where that holds it and else unsigned, any other is a double. Of two members
// with the same key the last counts.
std::shared_ptr<const ConfigurationValue> parseConfiguration(std::string_view text);

}  // namespace tessel
