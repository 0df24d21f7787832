// Reading rows of the spool, and the table of delivered rows.
//
// Whoever adds a delivered row must know how many bytes the table takes, and so must the service,
// which counts these bytes as free. To count the rows each time would read 64 MiB, and a sum in
// another table would be wrong as soon as one program forgot it. So each row has the running total:
// the bytes of all rows that were ever added, this one included. The difference between the last
// and the first row is what the table takes, whoever removed rows in the meantime.

#include "statora/SpoolRows.h"

#include <algorithm>
#include <limits>

namespace tessel {

namespace {

// What SQLite stores beside the text of a row: id, time, lengths, and the row's place in its page.
constexpr uint64_t kBytesBesideText = 24;
// The same of a delivered row: number and id, two times, the running total.
constexpr uint64_t kBytesBesideDelivered = 24;
// Bytes of rows in a page of a table, and in a page that continues a long row.
constexpr uint64_t kRowBytesInPage = kSpoolPageBytes - 12;
constexpr uint64_t kRowBytesInOverflowPage = kSpoolPageBytes - 4;

// A checkpoint costs three flushes, so it comes once in 16 MiB of log. Every reader looks through
// the log, so a much longer one would slow the readers down.
constexpr int64_t kCheckpointPages = 4000;
// A spool with a small limit must not spend all of it on the log.
constexpr int64_t kLeastCheckpointPages = 16;
constexpr int64_t kLogShare = 32;

// The service takes no smaller limit.
constexpr uint64_t kLeastLimit = uint64_t{4} << 20;
constexpr int64_t kMostDays = 36'500;

// Delivered rows take a quarter of a small spool at most. What they take must be cleared before a
// new row can have it, and a run should not have to clear all of its room first.
constexpr uint64_t kShareOfLimit = 4;

// Numbers that one step of removing looks at. It holds the lock for as long as it takes to clear
// these rows, at most 130 KiB each.
constexpr int64_t kNumbersAtOnce = 32;

constexpr char kDeliveredTable[] =
    "CREATE TABLE forwarder_delivered(number INTEGER PRIMARY KEY, id INTEGER,"
    " time INTEGER NOT NULL, delivered INTEGER NOT NULL, running_bytes INTEGER NOT NULL,"
    " destination TEXT NOT NULL, name TEXT NOT NULL, payload TEXT NOT NULL)";

// Whoever may write to the spool can change the table, and an index over an expression of his would
// make each of our removals as slow as he likes. See kIsOurs of SpoolFile.cpp.
constexpr char kIsOurDeliveredTable[] =
    "SELECT 1 FROM sqlite_schema WHERE type='table' AND name='forwarder_delivered' AND sql=?1"
    " AND NOT EXISTS (SELECT 1 FROM sqlite_schema WHERE type='index' AND sql IS NOT NULL"
    "  AND tbl_name='forwarder_delivered')";

// Whatever the totals are, the oldest row goes. So no loop over this is endless.
constexpr char kRemoveOldest[] =
    "DELETE FROM forwarder_delivered WHERE number <"
    " max(1 + (SELECT min(number) FROM forwarder_delivered),"
    " coalesce((SELECT number FROM forwarder_delivered WHERE running_bytes >= ?1"
    "  ORDER BY number LIMIT 1), 1 << 62))";

int64_t microsecondsOf(Date date) { return date.time_since_epoch().count(); }

// Whoever may write to the spool can put any number there. Up to this one, sums cannot overflow.
int64_t bounded(int64_t number) { return std::clamp<int64_t>(number, 0, int64_t{1} << 60); }

// The pages of the row, and its part of the pages that lead to them: one in 64 at the most.
uint64_t spaceOfDelivered(size_t textBytes) {
  const uint64_t space = spaceOfRow(textBytes + kBytesBesideDelivered);
  return space + space / 64;
}

uint64_t spaceOfDelivered(const SpooledEvent& event, std::string_view destination) {
  return spaceOfDelivered(event.name.size() + event.payload.size() + destination.size());
}

// `row` makes a row of its event, which stands in four columns from `first` on.
template <typename Row, typename MakeRow>
std::vector<Row> readRows(SqliteStatement& select, int64_t after, size_t maxRows, size_t maxBytes,
                          int first, MakeRow&& row) {
  std::vector<Row> rows;
  size_t bytes = 0;
  select.bind(1, after).bind(2, static_cast<int64_t>(maxRows));
  while (bytes < maxBytes && select.step() == SqliteStatement::Step::row) {
    SpooledEvent event{select.integer(first), select.integer(first + 1),
                       std::string(select.text(first + 2)), std::string(select.text(first + 3))};
    bytes += event.name.size() + event.payload.size();
    rows.push_back(row(std::move(event)));
  }
  select.reset();
  return rows;
}

}  // namespace

uint64_t spaceOfRow(size_t textBytes) {
  const uint64_t bytes = textBytes + kBytesBesideText;
  if (bytes <= kRowBytesInPage) return kSpoolPageBytes / (kRowBytesInPage / bytes);
  return (bytes / kRowBytesInOverflowPage + 1) * kSpoolPageBytes;
}

int64_t checkpointPages(uint64_t limitBytes) {
  return std::clamp<int64_t>(static_cast<int64_t>(limitBytes) / kSpoolPageBytes / kLogShare,
                             kLeastCheckpointPages, kCheckpointPages);
}

SpoolLimits readSpoolLimits(SqliteDatabase& database) {
  const auto bytes = database.integer("SELECT value FROM meta WHERE key='limit_bytes'");
  const auto days = database.integer("SELECT value FROM meta WHERE key='limit_days'");
  // Anything may stand there, so what makes no sense is brought to what does.
  return {.bytes =
              std::max(static_cast<uint64_t>(std::max<int64_t>(bytes.value_or(0), 0)), kLeastLimit),
          .days = std::chrono::days{std::clamp<int64_t>(days.value_or(kMostDays), 0, kMostDays)}};
}

SqliteStatus writeSpoolLimits(SqliteDatabase& database, const SpoolLimits& limits) {
  const std::string bytes = std::to_string(limits.bytes);
  const std::string days = std::to_string(limits.days.count());
  // A transaction that changes nothing would take the lock all the same.
  if (database.text("SELECT value FROM meta WHERE key='limit_bytes'") == bytes &&
      database.text("SELECT value FROM meta WHERE key='limit_days'") == days) {
    return {};
  }
  return database.execute("INSERT OR REPLACE INTO meta VALUES('limit_bytes','" + bytes +
                          "'), ('limit_days','" + days + "')");
}

std::vector<SpooledEvent> readEvents(SqliteStatement& select, int64_t after, size_t maxRows,
                                     size_t maxBytes) {
  return readRows<SpooledEvent>(select, after, maxRows, maxBytes, 0,
                                [](SpooledEvent event) { return event; });
}

std::vector<DeliveredEvent> readDelivered(SqliteStatement& select, int64_t after, size_t maxRows,
                                          size_t maxBytes) {
  return readRows<DeliveredEvent>(select, after, maxRows, maxBytes, 1, [&](SpooledEvent event) {
    return DeliveredEvent{.number = select.integer(0),
                          .at = select.integer(5),
                          .destination = std::string(select.text(6)),
                          .event = std::move(event)};
  });
}

SqliteStatus DeliveredRows::make() {
  if (open()) return {};
  SqliteStatus made = database_.execute(kDeliveredTable);
  return made.ok() && !open() ? database_.status() : made;
}

bool DeliveredRows::open() {
  if (isOpen()) return true;
  SqliteStatement ours = database_.prepare(kIsOurDeliveredTable);
  if (!ours.prepared() ||
      ours.bind(1, std::string_view(kDeliveredTable)).step() != SqliteStatement::Step::row) {
    return false;
  }
  const auto prepare = [this](SqliteStatement& statement, std::string_view text) {
    statement = database_.prepare(text, true);
    return statement.prepared();
  };
  const bool good =
      prepare(
          insert_,
          "INSERT INTO forwarder_delivered VALUES(?1, nullif(?2, 0), ?3, ?4, ?5, ?6, ?7, ?8)") &&
      prepare(first_,
              "SELECT running_bytes, name, payload, destination FROM forwarder_delivered"
              " ORDER BY number LIMIT 1") &&
      prepare(
          last_,
          "SELECT running_bytes, number FROM forwarder_delivered ORDER BY number DESC LIMIT 1") &&
      prepare(removeOldest_, kRemoveOldest) &&
      prepare(findExpired_,
              "SELECT number FROM (SELECT number, delivered, time FROM forwarder_delivered"
              " WHERE number >= ?1 ORDER BY number LIMIT ?2)"
              " WHERE delivered < ?3 OR time < ?4 LIMIT 1") &&
      prepare(removeExpired_,
              "DELETE FROM forwarder_delivered WHERE number BETWEEN ?1 AND ?2"
              " AND (delivered < ?3 OR time < ?4)");
  if (!good) close();
  return good;
}

void DeliveredRows::close() {
  for (SqliteStatement* statement :
       {&insert_, &first_, &last_, &removeOldest_, &findExpired_, &removeExpired_})
    *statement = {};
}

uint64_t DeliveredRows::bytes() {
  if (!isOpen()) return 0;
  int64_t before = 0;
  if (first_.step() == SqliteStatement::Step::row) {
    const size_t text = first_.text(1).size() + first_.text(2).size() + first_.text(3).size();
    before = bounded(first_.integer(0)) - static_cast<int64_t>(spaceOfDelivered(text));
  }
  first_.reset();
  return static_cast<uint64_t>(bounded(bounded(last_.value()) - before));
}

uint64_t DeliveredRows::allowance(const SpoolLimits& limits, uint64_t othersBytes) {
  // As for new rows, twice the usual log belongs to the log.
  const uint64_t taken =
      othersBytes + 2 * static_cast<uint64_t>(checkpointPages(limits.bytes) * kSpoolPageBytes);
  return std::min(
      {kMostBytes, limits.bytes / kShareOfLimit, limits.bytes > taken ? limits.bytes - taken : 0});
}

bool DeliveredRows::add(std::span<const SpooledEvent* const> rows, std::string_view destination,
                        Date at) {
  int64_t total = bounded(last_.value());
  int64_t number = std::max(bounded(last_.value(1)), microsecondsOf(at) - 1);
  return std::all_of(rows.begin(), rows.end(), [&](const SpooledEvent* row) {
    total += static_cast<int64_t>(spaceOfDelivered(*row, destination));
    insert_.bind(1, ++number).bind(2, row->id).bind(3, row->time).bind(4, microsecondsOf(at));
    insert_.bind(5, total).bind(6, destination).bind(7, row->name).bind(8, row->payload);
    return insert_.run();
  });
}

std::optional<int64_t> DeliveredRows::removeOldest(uint64_t bytes) {
  if (!isOpen()) return 0;
  const int64_t upTo = bounded(first_.value()) + bounded(static_cast<int64_t>(bytes) - 1) + 1;
  if (!removeOldest_.bind(1, upTo).run()) return {};
  return database_.changes();
}

DeliveredRows::Search DeliveredRows::searchAt(Date now, const SpoolLimits& limits, int64_t rows) {
  const bool forEver = limits.days.count() == 0;
  return {.delivered = microsecondsOf(now - kDays),
          .time = forEver ? std::numeric_limits<int64_t>::min() : microsecondsOf(now - limits.days),
          .rows = rows};
}

bool DeliveredRows::removeExpired(Search& search) {
  if (!isOpen()) return false;
  const auto bind = [&search](SqliteStatement& statement, int64_t from, int64_t second) {
    statement.bind(1, from).bind(2, second).bind(3, search.delivered).bind(4, search.time);
  };
  bind(findExpired_, search.from, search.rows);
  const int64_t found = bounded(findExpired_.value());
  if (found == 0) return false;
  search.from = found + kNumbersAtOnce;
  bind(removeExpired_, found, search.from - 1);
  // A number that is out of bounds is found again and again.
  return removeExpired_.run() && database_.changes() != 0;
}

}  // namespace tessel
