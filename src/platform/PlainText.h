// Text of unknown origin: made fit for a terminal, freed of blanks.

#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace tessel {

// `text` with every control character and every byte that is not part of well-formed UTF-8 written
// as \xNN, so that it can neither move a cursor nor start a line. Tabs stay; a line feed becomes
// `lineFeed`.
std::string plainText(std::string_view text, std::string_view lineFeed);

// plainText() with a line feed as \x0a, at most `maximum` bytes of it: what is too much goes from
// the middle and leaves "...", since the end of a path says more than its middle. REQUIRES: maximum
// >= 16.
std::string shortPlainText(std::string_view text, size_t maximum);

// `text` without the blanks at either end of it.
std::string_view trimmed(std::string_view text, std::string_view blanks = " \t\r\n");

}  // namespace tessel
