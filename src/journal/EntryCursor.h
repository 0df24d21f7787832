// The cursor of an entry: its place in text form, as `journalctl --cursor=` takes it.

#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "journal/EntryStream.h"

namespace tessel {

// "s=<sequence id>;i=<number>;b=<boot id>;m=<monotonic>;t=<realtime>;x=<content hash>", in
// hexadecimal.
std::string cursorOf(const EntryHeader& header);

// The header that a cursor names; nothing where a part is missing or no hexadecimal number.
std::optional<EntryHeader> parseCursor(std::string_view cursor);

// 32 hexadecimal digits, with or without the dashes of a UUID; nothing for any other text.
std::optional<Id128> parseId128(std::string_view text);
std::string textOf(const Id128& id);

}  // namespace tessel
