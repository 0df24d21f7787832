// Text of unknown origin: made fit for a terminal, freed of blanks.

#pragma once

#include <string>
#include <string_view>

namespace tessel {

// `text` with every control character and every byte that is not part of well-formed UTF-8 written
// as \xNN, so that it can neither move a cursor nor start a line. Tabs stay; a line feed becomes
// `lineFeed`.
std::string plainText(std::string_view text, std::string_view lineFeed);

// `text` without the blanks at either end of it.
std::string_view trimmed(std::string_view text, std::string_view blanks = " \t\r\n");

}  // namespace tessel
