// Texts of unknown origin, made fit to be shown: on a terminal, in JSON, in HTML.
//
// Whatever a program recorded or somebody wrote into the spool passes through one of these before
// it is printed. Stateless; any thread.

#pragma once

#include <string>
#include <string_view>

#include "platform/Text.h"

namespace tessel::ctl {

// JSON that is valid already, made one line that a terminal may be shown: what JSON leaves bare
// but a terminal may obey becomes \uNNNN, line breaks between tokens become spaces.
std::string terminalJson(std::string_view json);

// Columns that `text`, which terminalText() answered, takes on a terminal.
size_t displayWidth(std::string_view text);

// At most `width` columns of `text`: what is too much goes from the middle and leaves an ellipsis,
// since names that begin alike differ at their ends.
std::string shortened(std::string_view text, size_t width);
// The same, but it is the end that goes.
std::string cutOff(std::string_view text, size_t width);

}  // namespace tessel::ctl
