// The rows of health records.
//
// Discarded: a table of its own for the records that wait. The forwarder would need a second way to
// deliver, with identifiers, waits and acknowledgements of its own, and each fault would have to be
// found twice.

#include "statora/HealthLedger.h"

#include <algorithm>

namespace tessel {

namespace {

// Names in the table `forwarder`, beside its counters.
constexpr std::string_view kRow = "health_row";          // id of the last record
constexpr std::string_view kMade = "health_made";        // microseconds since 1970
constexpr std::string_view kFacts = "health_facts";      // a text
constexpr std::string_view kFirst = "health_run_first";  // numbers of the runs that it tells
constexpr std::string_view kRun = "health_run";
constexpr std::string_view kTaken = "health_run_taken";  // the last run of the last one taken
constexpr std::string_view kWithdrawn = "health_withdrawn";

}  // namespace

int64_t HealthLedger::number(std::string_view name) {
  SqliteStatement select = database_.prepare("SELECT value FROM forwarder WHERE name=?1");
  return select.prepared() ? select.bind(1, name).value() : 0;
}

bool HealthLedger::remember(std::string_view name, int64_t value) {
  SqliteStatement insert = database_.prepare("INSERT OR REPLACE INTO forwarder VALUES(?1, ?2)");
  return insert.prepared() && insert.bind(1, name).bind(2, value).run();
}

SqliteStatus HealthLedger::finish(bool good) {
  SqliteStatus status = good ? database_.execute("COMMIT") : database_.status();
  if (!status.ok()) database_.execute("ROLLBACK");
  return status;
}

LastHealth HealthLedger::last() {
  LastHealth last;
  const auto count = [this](std::string_view name) {
    return static_cast<uint64_t>(std::max<int64_t>(number(name), 0));
  };
  last.made = Date{std::chrono::microseconds{std::max<int64_t>(number(kMade), 0)}};
  last.facts = database_.text("SELECT value FROM forwarder WHERE name='health_facts'").value_or("");
  // The row left `events` in the transaction that moved the position to it or beyond. A record that
  // was refused stands among the rows that were set aside: its runs are told again.
  const auto taken = database_.integer(
      "SELECT 1 FROM forwarder AS row, forwarder AS position"
      " WHERE row.name='health_row' AND position.name='position' AND position.value >= row.value"
      " AND NOT EXISTS (SELECT 1 FROM events WHERE id=row.value)"
      " AND NOT EXISTS (SELECT 1 FROM forwarder_set_aside WHERE id=row.value)");
  last.runTaken = count(taken ? kRun : kTaken);
  const bool waits = database_
                         .integer(
                             "SELECT 1 FROM forwarder JOIN events ON events.id=forwarder.value"
                             " WHERE forwarder.name='health_row' AND events.name='tessel.health'")
                         .has_value();
  if (waits) last.waiting = RunRange{count(kFirst), count(kRun)};
  return last;
}

// Counting reads the whole table, at most once an hour. It happens in a transaction that only
// reads, so that the service need not wait for it.
std::optional<SpoolBooks> HealthLedger::books() {
  if (!database_.execute("BEGIN").ok()) return {};
  const auto count = [this](std::string_view query) {
    return static_cast<uint64_t>(std::max<int64_t>(database_.integer(query).value_or(0), 0));
  };
  SpoolBooks books;
  books.waiting = count("SELECT count(*) FROM events");
  const bool good = database_.status().ok();
  books.stored = count("SELECT seq FROM sqlite_sequence WHERE name='events'");
  books.setAside = count("SELECT count(*) FROM forwarder_set_aside");
  books.withdrawn = count("SELECT value FROM forwarder WHERE name='health_withdrawn'");
  database_.execute("COMMIT");
  if (!good) return {};
  return books;
}

SqliteStatus HealthLedger::put(std::string_view payload, std::string_view facts, RunRange runs,
                               Before before, Date now) {
  if (SqliteStatus begun = database_.execute("BEGIN IMMEDIATE"); !begun.ok()) return begun;
  // What a kept record tells will arrive, so it counts as taken.
  const LastHealth was = last();
  const bool kept = before == Before::kept && was.waiting;
  const uint64_t runTaken = kept ? was.waiting->last : was.runTaken;
  const int64_t time = now.time_since_epoch().count();
  int64_t withdrawn = number(kWithdrawn);
  bool good = true;
  if (!kept) {
    SqliteStatement remove = database_.prepare("DELETE FROM events WHERE id=?1 AND name=?2");
    good = remove.prepared() && remove.bind(1, number(kRow)).bind(2, kHealthEvent).run();
    withdrawn += good ? database_.changes() : 0;
  }
  SqliteStatement insert =
      database_.prepare("INSERT INTO events(time, name, payload) VALUES(?1, ?2, ?3)");
  good = good && insert.prepared() &&
         insert.bind(1, time).bind(2, kHealthEvent).bind(3, payload).run();
  const int64_t row = database_.integer("SELECT last_insert_rowid()").value_or(0);
  SqliteStatement text = database_.prepare("INSERT OR REPLACE INTO forwarder VALUES(?1, ?2)");
  good = good && text.prepared() && text.bind(1, kFacts).bind(2, facts).run() &&
         remember(kRow, row) && remember(kMade, time) && remember(kWithdrawn, withdrawn) &&
         remember(kFirst, static_cast<int64_t>(runs.first)) &&
         remember(kRun, static_cast<int64_t>(runs.last)) &&
         remember(kTaken, static_cast<int64_t>(runTaken));
  return finish(good);
}

// A record that was set aside may wait again since, under an id below the last one. So all rows are
// searched, once: the names are gone afterwards.
SqliteStatus HealthLedger::withdrawAll() {
  if (number(kRow) == 0) return {};
  if (SqliteStatus begun = database_.execute("BEGIN IMMEDIATE"); !begun.ok()) return begun;
  const int64_t before = number(kWithdrawn);
  int64_t removed = 0;
  bool good = true;
  for (const char* table : {"events", "forwarder_set_aside"}) {
    SqliteStatement remove =
        database_.prepare(std::string("DELETE FROM ") + table + " WHERE name=?1");
    good = good && remove.prepared() && remove.bind(1, kHealthEvent).run();
    if (good) removed += database_.changes();
  }
  good = good && database_
                     .execute(
                         "DELETE FROM forwarder WHERE name IN"
                         " ('health_row', 'health_made', 'health_facts')")
                     .ok();
  return finish(good && remember(kWithdrawn, before + removed));
}

}  // namespace tessel
