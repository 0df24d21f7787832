// A line that is wrong costs that line and no other: whoever feeds us through a pipe cannot see how
// far we came, so stopping would lose points that are right.

#include "tesselctl/commands/RecordLines.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <string_view>
#include <variant>

#include <nlohmann/json.hpp>

#include "os/Files.h"
#include "platform/Text.h"

namespace tessel::ctl {

namespace {

using LineJson = nlohmann::json;

// Bytes. The largest point has 32 attributes and a dozen strings of 4 KiB each. JSON may write a
// byte as six, which makes just over 1 MB. A longer line would only fill our memory.
constexpr size_t kLongestLine = size_t{2} * 1024 * 1024;
constexpr size_t kReadSize = size_t{64} * 1024;

// The lines of a descriptor, as soon as each is whole: a pipe may stay open for days.
class LineReader {
 public:
  explicit LineReader(int fd) : fd_(fd) {}

  // The next line, without its line feed; absent at the end, or after an error. Of a line that is
  // too long only the beginning is kept. Valid until the next call.
  std::optional<std::string_view> next() {
    line_.clear();
    ++number_;
    while (true) {
      const size_t end = buffer_.find('\n', read_);
      const bool whole = end != std::string::npos;
      const std::string_view part = std::string_view(buffer_).substr(read_, end - read_);
      // One byte more than a line may have: by that the caller sees that it is too long.
      line_ += part.substr(0, kLongestLine + 1 - std::min(line_.size(), kLongestLine + 1));
      read_ = whole ? end + 1 : buffer_.size();
      if (whole) return line_;
      if (!fill()) return line_.empty() ? std::nullopt : std::optional<std::string_view>(line_);
    }
  }
  uint64_t number() const { return number_; }  // of the last line, from 1 on
  int error() const { return error_; }         // errno value of the read that failed; 0: none

 private:
  bool fill() {
    buffer_.resize(kReadSize);
    ssize_t got = 0;
    do {
      got = ::read(fd_, buffer_.data(), buffer_.size());
    } while (got < 0 && errno == EINTR);
    if (got < 0) error_ = errno;
    buffer_.resize(got > 0 ? static_cast<size_t>(got) : 0);
    read_ = 0;
    return got > 0;
  }

  int fd_;
  int error_ = 0;
  uint64_t number_ = 0;
  size_t read_ = 0;  // bytes of `buffer_` that were given out
  std::string buffer_;
  std::string line_;
};

// Reads one value of a JSON object into a point. The answer is what the value should have been, or
// null where it is that.
using TakeValue = const char* (*)(RecordedPoint&, const LineJson&);

template <auto Member>
const char* takeText(RecordedPoint& point, const LineJson& value) {
  if (!value.is_string()) return "a string";
  point.*Member = value.get<std::string>();
  return nullptr;
}

// As the recording header writes numbers: a double has 15 digits or, where those do not read back
// as the same double, 17, and is never taken for an integer.
std::string decimalOf(const LineJson& number) {
  if (!number.is_number_float()) return number.dump();
  const double value = number.get<double>();
  std::array<char, 40> text{};
  for (const int digits : {15, 17}) {
    const auto written =
        std::to_chars(text.begin(), text.end(), value, std::chars_format::general, digits);
    double readBack = 0;
    std::from_chars(text.begin(), written.ptr, readBack);
    if (readBack != value && digits == 15) continue;
    std::string decimal(text.begin(), written.ptr);
    return decimal.find_first_of(".e") == std::string::npos ? decimal + ".0" : decimal;
  }
  return {};
}

template <auto Member>
const char* takeNumber(RecordedPoint& point, const LineJson& value) {
  if (!value.is_number()) return "a number";
  point.*Member = decimalOf(value);
  return nullptr;
}

// An id is text to the journal. Programs keep it as a number as often, and its digits are the same
// text.
const char* takeId(RecordedPoint& point, const LineJson& value) {
  if (!value.is_string() && !value.is_number_integer()) return "a string or an integer";
  point.id = value.is_string() ? value.get<std::string>() : value.dump();
  return nullptr;
}

// Only a boolean: "0" and "false" as texts would be true to one reader and false to another, and
// the mark decides what leaves the machine.
const char* takeTelemetry(RecordedPoint& point, const LineJson& value) {
  if (!value.is_boolean()) return "true or false";
  point.telemetry = value.get<bool>();
  return nullptr;
}

template <size_t Slot>
const char* takeString(RecordedPoint& point, const LineJson& value) {
  if (!value.is_object() || value.size() != 1 || !value.front().is_string())
    return "{\"LABEL\": \"VALUE\"}";
  point.strings[Slot] = {value.begin().key(), value.front().get<std::string>()};
  return nullptr;
}

template <size_t Slot>
const char* takeLabelledNumber(RecordedPoint& point, const LineJson& value) {
  if (!value.is_object() || value.size() != 1 || !value.front().is_number())
    return "{\"LABEL\": NUMBER}";
  point.numbers[Slot] = {value.begin().key(), decimalOf(value.front())};
  return nullptr;
}

// An object of texts. No key holds '=', because that ends a key in the journal.
template <auto Member>
const char* takePairs(RecordedPoint& point, const LineJson& value) {
  constexpr const char* kExpected = "an object of strings, without '=' in its keys";
  if (!value.is_object()) return kExpected;
  for (const auto& [key, text] : value.items()) {
    if (!text.is_string() || key.find('=') != std::string::npos) return kExpected;
    (point.*Member).push_back(key + '=' + text.template get<std::string>());
  }
  return nullptr;
}

// A key that nobody knows is an error and not passed over: a misspelt one would lose its value
// without a word.
struct JsonKey {
  std::string_view name;
  TakeValue take;
};
// The keys are the options of the command line.
constexpr JsonKey kKeys[] = {
    {"kind", takeText<&RecordedPoint::kind>},
    {"subsystem", takeText<&RecordedPoint::subsystem>},
    {"category", takeText<&RecordedPoint::category>},
    {"name", takeText<&RecordedPoint::name>},
    {"telemetry", takeTelemetry},
    {"string1", takeString<0>},
    {"string2", takeString<1>},
    {"number1", takeLabelledNumber<0>},
    {"number2", takeLabelledNumber<1>},
    {"id", takeId},
    {"scope", takeText<&RecordedPoint::scope>},
    {"duration", takeNumber<&RecordedPoint::duration>},
    {"frame_rate", takeNumber<&RecordedPoint::frameRate>},
    {"attributes", takePairs<&RecordedPoint::attributes>},
    {"fields", takePairs<&RecordedPoint::fields>},
    {"message", takeText<&RecordedPoint::message>},
};

}  // namespace

std::variant<RecordedPoint, std::string> pointFrom(std::string_view line,
                                                   const RecordedPoint& defaults) {
  // The parser throws, also for a number that no double can hold. No exception may leave this room,
  // and the place in the line is all that helps to find the mistake.
  LineJson object;
  try {
    object = LineJson::parse(line);
  } catch (const LineJson::parse_error& error) {
    return "no JSON at byte " + std::to_string(error.byte);
  } catch (const LineJson::exception&) {
    return "a number is beyond all doubles";
  }
  if (!object.is_object()) return "no JSON object";
  RecordedPoint point = defaults;
  for (const auto& [name, value] : object.items()) {
    const auto* key = std::ranges::find(kKeys, name, &JsonKey::name);
    if (key == std::end(kKeys)) return "a trace point has no key " + inQuotes(name);
    if (const char* expected = key->take(point, value)) {
      return inQuotes(name) + " must be " + expected;
    }
  }
  return point;
}

ExitStatus recordLines(int fd, const RecordedPoint& defaults, const RecordPoint& record) {
  LineReader lines(fd);
  uint64_t points = 0;
  uint64_t missing = 0;
  // A line that is wrong outranks one that was lost: it will be wrong again when it is sent again.
  ExitStatus status = kDone;
  std::string lastFailure;
  while (const auto line = lines.next()) {
    // Off, we still read: a closed pipe would end the program that feeds us.
    if (!recordingEnabled()) continue;
    if (line->find_first_not_of(" \t\r") == std::string_view::npos) continue;
    ++points;
    std::optional<Failure> failure;
    if (line->size() > kLongestLine) {
      failure = {kUsage, "over " + std::to_string(kLongestLine) + " bytes"};
    } else {
      auto point = pointFrom(*line, defaults);
      const auto* complaint = std::get_if<std::string>(&point);
      failure = complaint ? Failure{kUsage, *complaint} : record(std::get<RecordedPoint>(point));
    }
    if (!failure) continue;
    ++missing;
    if (status != kUsage) status = failure->status;
    // A journal that is away fails each line in the same words. Once is enough until they change.
    if (failure->status == kUsage || failure->message != lastFailure) {
      fail(failure->status, "line " + std::to_string(lines.number()) + ": " + failure->message);
    }
    if (failure->status != kUsage) lastFailure = failure->message;
  }
  if (missing > 0) {
    fail(status, std::to_string(missing) + " of " + counted(points, "line was", "lines were") +
                     " not recorded");
  }
  if (lines.error() != 0)
    return static_cast<ExitStatus>(fail(kBad, fileError("standard input", lines.error()).words));
  return status;
}

}  // namespace tessel::ctl
