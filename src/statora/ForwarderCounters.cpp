// Reading and writing the counters: one row each in the table `forwarder`.

#include "statora/ForwarderCounters.h"

#include <algorithm>
#include <iterator>
#include <string_view>

namespace tessel {

namespace {

struct Counter {
  const char* name;
  uint64_t ForwarderCounters::*value;
};
constexpr Counter kCounters[] = {
    {"delivered", &ForwarderCounters::delivered},
    {"rejected", &ForwarderCounters::rejected},
    {"set_aside", &ForwarderCounters::setAside},
    {"requests", &ForwarderCounters::requests},
    {"refused_requests", &ForwarderCounters::refusedRequests},
    {"failed_requests", &ForwarderCounters::failedRequests},
    {"retries", &ForwarderCounters::retries},
    {"bytes_sent", &ForwarderCounters::bytesSent},
    {"position", &ForwarderCounters::position},
    {"last_success", &ForwarderCounters::lastSuccess},
    {"last_error_at", &ForwarderCounters::lastErrorAt},
    {"ordered_until", &ForwarderCounters::orderedUntil},
    {"rests_since", &ForwarderCounters::restsSince},
    {"next_attempt", &ForwarderCounters::nextAttempt},
};
// Stands in the same table, because a column of SQLite takes a text as well as a number.
constexpr std::string_view kLastError = "last_error";

// Whoever may write to the spool can put any number there. Up to this one, sums cannot overflow.
constexpr int64_t kMostCounted = int64_t{1} << 60;

}  // namespace

std::optional<ForwarderCounters> readForwarderCounters(SqliteDatabase& database) {
  SqliteStatement select = database.prepare("SELECT name, value FROM forwarder");
  if (!select.prepared()) return {};
  ForwarderCounters counters;
  while (select.step() == SqliteStatement::Step::row) {
    const auto* const known =
        std::find_if(std::begin(kCounters), std::end(kCounters),
                     [&](const Counter& counter) { return select.text(0) == counter.name; });
    if (known != std::end(kCounters))
      counters.*known->value =
          static_cast<uint64_t>(std::clamp<int64_t>(select.integer(1), 0, kMostCounted));
    if (select.text(0) == kLastError) counters.lastError = select.text(1);
  }
  return counters;
}

bool writeForwarderCounters(SqliteStatement& insert, const ForwarderCounters& counters) {
  if (!counters.lastError.empty() && !insert.bind(1, kLastError).bind(2, counters.lastError).run())
    return false;
  return std::all_of(std::begin(kCounters), std::end(kCounters), [&](const Counter& counter) {
    return insert.bind(1, std::string_view(counter.name))
        .bind(2, static_cast<int64_t>(counters.*counter.value))
        .run();
  });
}

// A short wait ends a longer one that was noted and lies ahead. Otherwise a forwarder that fails in
// the middle of its rest would seem to rest on.
bool ForwarderCounters::rest(Date now, std::chrono::nanoseconds time) {
  const uint64_t begin = microsecondsSince1970(now);
  if (time < kLongRest && nextAttempt <= begin) return false;
  const auto wait = std::chrono::duration_cast<std::chrono::microseconds>(time);
  restsSince = begin;
  nextAttempt = begin + static_cast<uint64_t>(wait.count());
  return true;
}

uint64_t microsecondsSince1970(Date date) {
  return static_cast<uint64_t>(std::max<int64_t>(date.time_since_epoch().count(), 0));
}

}  // namespace tessel
