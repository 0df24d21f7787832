// Verdicts, waits and pace.
//
// The verdicts follow OTLP's list of statuses that a client may repeat, with one addition: 401,
// 403, 404, 405, 407 and redirects speak of the way to the collector and not of the records. To
// take them for refusals would set good records aside after a wrong password.

#include "forwarder/Policy.h"

#include <algorithm>
#include <cmath>

#include "platform/Text.h"

namespace tessel {

namespace {

// A collector may ask for a longer wait by mistake. After an hour it is asked again.
constexpr std::chrono::seconds kLongestAsked{3600};
// Of a collector's words: enough for a sentence, and short in a log line.
constexpr size_t kMaxWords = 300;

}  // namespace

Verdict verdictOn(const CollectorAnswer& answer) {
  switch (answer.status) {
    case 0:
    case 429:
    case 502:
    case 503:
    case 504:
      return Verdict::later;
    case 401:
    case 403:
    case 404:
    case 405:
    case 407:
      return Verdict::hold;
    default:
      break;
  }
  if (answer.status / 100 == 2) return Verdict::accepted;
  return answer.status / 100 == 3 ? Verdict::hold : Verdict::refused;
}

std::string answerWords(const CollectorAnswer& answer) {
  if (answer.status == 0) return plainText(answer.error, " ");
  std::string words = std::to_string(answer.status);
  if (!answer.body.empty())
    words += ": " + plainText(std::string_view(answer.body).substr(0, kMaxWords), " ");
  return words;
}

std::chrono::milliseconds Backoff::wait(uint32_t failures, double chance,
                                        std::optional<std::chrono::seconds> asked) const {
  // 30 doublings of any wait are over the longest one, and 2^30 is still exact.
  const double doublings = std::min(failures - 1, uint32_t{30});
  const double full = std::min(static_cast<double>(first_.count()) * std::exp2(doublings),
                               static_cast<double>(most_.count()));
  const std::chrono::milliseconds own{static_cast<int64_t>(full * (0.5 + chance / 2))};
  if (!asked) return own;
  const std::chrono::milliseconds wanted = std::min(*asked, kLongestAsked);
  const auto spread = static_cast<double>(std::max(first_, wanted / 2).count());
  return wanted + std::chrono::milliseconds{static_cast<int64_t>(chance * spread)};
}

std::chrono::nanoseconds Pace::waitAt(std::chrono::nanoseconds now) const {
  return std::max(next_ - now, std::chrono::nanoseconds{0});
}

void Pace::sent(uint64_t records, std::chrono::nanoseconds now) {
  if (recordsPerSecond_ == 0) return;
  // A request is paid for after it was sent, so the first one of a day goes out at once.
  next_ = now + std::chrono::nanoseconds{std::chrono::seconds{1}} * records / recordsPerSecond_;
}

}  // namespace tessel
