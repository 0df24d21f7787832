// Texts of unknown origin, made fit to be shown: on a terminal, in JSON, in HTML.
//
// Whatever a program recorded or somebody wrote into the spool passes through one of these before
// it is printed. Stateless; any thread.

#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace tessel::ctl {

// One line for a terminal: control characters and bytes that are no UTF-8 as \xNN, characters that
// reorder or break a line as \uNNNN.
std::string terminalText(std::string_view text);

// JSON that is valid already, made one line that a terminal may be shown: what JSON leaves bare
// but a terminal may obey becomes \uNNNN, line breaks between tokens become spaces.
std::string terminalJson(std::string_view json);

// Content of an element or of a quoted attribute: nothing in it is markup, bytes that are no UTF-8
// become U+FFFD, control characters become their pictures.
std::string htmlText(std::string_view text);

// Columns that `text`, which terminalText() answered, takes on a terminal.
size_t displayWidth(std::string_view text);

// At most `width` columns of `text`: what is too much goes from the middle and leaves an ellipsis,
// since names that begin alike differ at their ends.
std::string shortened(std::string_view text, size_t width);
// The same, but it is the end that goes.
std::string cutOff(std::string_view text, size_t width);

// "1,234,567".
std::string grouped(uint64_t number);
// "1 event", "2 events".
std::string counted(uint64_t number, std::string_view singular, std::string_view plural);

}  // namespace tessel::ctl
