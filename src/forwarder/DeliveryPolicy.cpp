// Verdicts, waits and pace.
//
// OTLP lists the statuses after which a client may send again. We read more of them as "later" or
// "hold", because the price of a mistake differs: a row that waits is late, and a row that is taken
// for bad leaves the queue. So a status speaks against a record only if it is one of the four with
// which receivers refuse content: 400, 413, 422, and 500, which many send for what they cannot
// store. The statuses above 511 are those of proxies whose origin is away.
//
// A success must be an answer of the protocol. The page on which a hotel's network asks for a room
// number has status 200, too.

#include "forwarder/DeliveryPolicy.h"

#include <algorithm>
#include <cmath>

#include "platform/Text.h"

namespace tessel {

namespace {

// A collector may ask for a longer wait by mistake. After an hour it is asked again.
constexpr std::chrono::seconds kLongestAsked{3600};
// Bytes of a collector's answer that we quote: enough for a sentence, short enough for a log line.
constexpr size_t kMaxWords = 300;
// Where a limit stays, one request in so many is sent in vain to find that out.
constexpr uint32_t kMostPatience = 64;

}  // namespace

Verdict verdictOn(const CollectorAnswer& answer, const Encoder& encoder) {
  if (answer.status / 100 == 2) {
    const bool understood = encoder.readSuccess(answer.mediaType, answer.body).has_value();
    return understood ? Verdict::accepted : Verdict::hold;
  }
  switch (answer.status) {
    case 0:
    case 408:
    case 425:
    case 429:
    case 502:
    case 503:
    case 504:
    case 507:
      return Verdict::later;
    case 500:
      return Verdict::refused;
    default:
      if (isAboutContent(answer)) return Verdict::refused;
      return answer.status > 511 ? Verdict::later : Verdict::hold;
  }
}

bool isAboutContent(const CollectorAnswer& answer) {
  return answer.status == 400 || answer.status == kContentTooLarge || answer.status == 422;
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
  // 30 doublings bring any wait above the longest one. More could overflow to infinity.
  const double doublings = std::min(failures - 1, uint32_t{30});
  const double full = std::min(static_cast<double>(first_.count()) * std::exp2(doublings),
                               static_cast<double>(most_.count()));
  const std::chrono::milliseconds own{static_cast<int64_t>(full * (0.5 + chance / 2))};
  if (!asked) return own;
  const std::chrono::milliseconds wanted = std::min(*asked, kLongestAsked);
  const auto spread = static_cast<double>(std::max(first_, wanted / 2).count());
  return wanted + std::chrono::milliseconds{static_cast<int64_t>(chance * spread)};
}

void BatchSize::tooMuch(size_t bytes) {
  // A record that is alone cannot be made smaller. It is sent however few bytes are left.
  bytes_ = std::min(bytes_, std::max(bytes / 2, size_t{1}));
  taken_ = 0;
  // A larger size that failed at once would be tried again and again, so the next try waits twice
  // as long as the last one: taken() has halved the patience before it.
  patience_ = std::min(patience_ * 4, kMostPatience);
}

void BatchSize::taken(size_t bytes) {
  // A request that had room left says nothing about a larger one.
  if (bytes_ == most_ || bytes < bytes_ / 2 || ++taken_ < patience_) return;
  bytes_ = std::min(most_, bytes_ * 2);
  taken_ = 0;
  patience_ = std::max(patience_ / 2, uint32_t{1});
}

std::chrono::nanoseconds Pace::waitAt(std::chrono::nanoseconds now) const {
  return std::max(next_ - now, std::chrono::nanoseconds{0});
}

void Pace::sent(uint64_t records, std::chrono::nanoseconds now) {
  if (recordsPerSecond_ == 0) return;
  // The wait comes after the request that causes it, so the first one of a day goes out at once.
  next_ = now + std::chrono::nanoseconds{std::chrono::seconds{1}} * records / recordsPerSecond_;
}

}  // namespace tessel
