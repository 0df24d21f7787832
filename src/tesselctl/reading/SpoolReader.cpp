// Reading the spool beside the service.
//
// A database with a write-ahead log needs an index file beside it, which even a reader must be able
// to make. A user who may only read would therefore see nothing. For such a user we open the
// database as immutable, which needs no index. An immutable database ignores the log, and rows in
// it would be missing without a word. So we do this only if the log is empty or absent.

#include "tesselctl/reading/SpoolReader.h"

#include <sqlite3.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>

#include "os/Files.h"
#include "statora/Spool.h"

namespace tessel::ctl {

namespace {

// The service holds its lock for milliseconds. After two seconds something is wrong.
constexpr int kBusyMilliseconds = 2000;

uint64_t sizeOf(const std::string& path) {
  struct stat facts {};
  return ::stat(path.c_str(), &facts) == 0 ? static_cast<uint64_t>(facts.st_size) : 0;
}

// SQLite says "cannot open" if it may not make its files, so that code means a refusal as well.
bool forbids(const SqliteStatus& status) {
  return status.primaryCode() == SQLITE_CANTOPEN || status.primaryCode() == SQLITE_READONLY;
}

// How much of the spool is in memory at a time. A page ends with the row that reaches the bytes.
constexpr size_t kRowsOfAPage = 512;
constexpr size_t kBytesOfAPage = size_t{1} << 20;

}  // namespace

SpoolReader::SpoolReader(const std::string& stateDirectory)
    : path_(stateDirectory + "/" + kSpoolFileName) {}

// The service sets a damaged spool aside by renaming it. Our database would still be the old one.
bool SpoolReader::sameFile() const {
  struct stat facts {};
  return ::lstat(path_.c_str(), &facts) == 0 && facts.st_dev == device_ && facts.st_ino == inode_;
}

SpoolReader::State SpoolReader::open() {
  if (database_.isOpen() && sameFile()) return State::open;
  database_.close();
  lastId_ = 0;
  lastNumber_ = 0;
  failure_ = {};
  struct stat facts {};
  if (::lstat(path_.c_str(), &facts) != 0) {
    const PlatformError error = fileError(path_, errno);
    reason_ = error.words;
    return error.code == ErrorCode::notFound   ? State::absent
           : error.code == ErrorCode::noAccess ? State::noAccess
                                               : State::damaged;
  }
  device_ = facts.st_dev;
  inode_ = facts.st_ino;
  return openDatabase();
}

SqliteStatus SpoolReader::openAs(SqliteDatabase::Mode mode) {
  SqliteStatus status = database_.open(path_, mode);
  if (!status.ok()) return status;
  database_.setBusyTimeout(kBusyMilliseconds);
  // Opening reads nothing yet. Only a query shows whether this is a spool.
  return database_.integer("SELECT count(*) FROM (SELECT 1 FROM events LIMIT 1)")
             ? SqliteStatus{}
             : database_.status();
}

SpoolReader::State SpoolReader::openDatabase() {
  failure_ = openAs(SqliteDatabase::Mode::readOnly);
  // An empty log, or none, means that the database itself holds every row.
  if (forbids(failure_) && sizeOf(path_ + "-wal") == 0)
    failure_ = openAs(SqliteDatabase::Mode::immutable);
  if (failure_.ok()) return State::open;
  // The service makes the file first and its tables a moment later. A file without any table is no
  // spool yet.
  const bool empty = failure_.primaryCode() == SQLITE_ERROR &&
                     database_.integer("SELECT count(*) FROM sqlite_schema") == 0;
  database_.close();
  reason_ = path_ + ": " + failure_.reason;
  if (empty) return State::absent;
  return forbids(failure_) ? State::noAccess : State::damaged;
}

bool SpoolReader::damaged() const {
  return failure_.primaryCode() == SQLITE_CORRUPT || failure_.primaryCode() == SQLITE_NOTADB;
}

bool SpoolReader::locked() const { return failure_.primaryCode() == SQLITE_BUSY; }

// Without the table no forwarder has kept a row yet.
std::vector<DeliveredEvent> SpoolReader::deliveredRows(const std::string& select, int64_t bound,
                                                       size_t rows) {
  SqliteStatement statement = database_.prepare(select);
  std::vector<DeliveredEvent> page;
  if (statement.prepared()) page = readDelivered(statement, bound, rows, kBytesOfAPage);
  failure_ = database_.status();
  if (!statement.prepared() && failure_.primaryCode() == SQLITE_ERROR) failure_ = {};
  return page;
}

// The next rows that were not visited. Absent at the end, and where reading fails. Both tables are
// read in one transaction: a row that is delivered between two would be seen in neither.
std::optional<std::vector<SpoolRow>> SpoolReader::nextPage(SpoolRows wanted) {
  std::vector<SpoolRow> rows;
  if (wanted != SpoolRows::waiting) {
    const auto page = deliveredRows(kSelectDelivered, lastNumber_, kRowsOfAPage);
    for (const DeliveredEvent& row : page) {
      lastNumber_ = row.number;
      const bool visited = row.event.id != 0 && row.event.id <= lastId_;
      if (wanted == SpoolRows::delivered || !visited)
        rows.push_back({row.event, SpoolRow::Delivery{row.at, row.destination}});
    }
    if (!page.empty()) return rows;
    if (wanted == SpoolRows::delivered || !failure_.ok()) return {};
  }
  SqliteStatement select = database_.prepare(kSelectEvents);
  if (select.prepared()) {
    for (SpooledEvent& event : readEvents(select, lastId_, kRowsOfAPage, kBytesOfAPage)) {
      lastId_ = event.id;
      rows.push_back({std::move(event), {}});
    }
  }
  failure_ = database_.status();
  return rows.empty() ? std::nullopt : std::optional(std::move(rows));
}

bool SpoolReader::readNew(SpoolRows wanted, const std::function<void(const SpoolRow&)>& visit) {
  for (;;) {
    failure_ = database_.execute("BEGIN");
    const auto page = failure_.ok() ? nextPage(wanted) : std::nullopt;
    database_.execute("COMMIT");
    // The visitor is no client of this database, and the transaction is at its end.
    for (const SpoolRow& row : page.value_or(std::vector<SpoolRow>{})) visit(row);
    if (!failure_.ok()) break;
    if (!page) return true;
  }
  reason_ = path_ + ": " + failure_.reason;
  return false;
}

std::optional<SpoolRow> SpoolReader::row(int64_t id) {
  SqliteStatement select = database_.prepare(kSelectEvents);
  std::vector<SpooledEvent> page;
  if (select.prepared()) page = readEvents(select, id - 1, 1, kBytesOfAPage);
  failure_ = database_.status();
  if (!page.empty() && page.front().id == id) return SpoolRow{std::move(page.front()), {}};
  if (failure_.ok()) {
    auto delivered = deliveredRows(
        "SELECT number, id, time, name, payload, delivered, destination FROM forwarder_delivered"
        " WHERE id = ?1 ORDER BY number DESC LIMIT ?2",
        id, 1);
    if (!delivered.empty()) {
      DeliveredEvent& found = delivered.front();
      return SpoolRow{std::move(found.event),
                      SpoolRow::Delivery{found.at, std::move(found.destination)}};
    }
  }
  reason_ = path_ + ": " + failure_.reason;
  return {};
}

std::optional<std::pair<int64_t, int64_t>> SpoolReader::ids() {
  std::optional<std::pair<int64_t, int64_t>> ids;
  for (const char* table : {"events", "forwarder_delivered"}) {
    const std::string rows = std::string(" FROM ") + table + " WHERE id IS NOT NULL";
    const auto first = database_.integer("SELECT min(id)" + rows + " HAVING count(*) > 0");
    const auto last = database_.integer("SELECT max(id)" + rows);
    if (!first || !last) continue;
    ids = ids ? std::pair(std::min(ids->first, *first), std::max(ids->second, *last))
              : std::pair(*first, *last);
  }
  return ids;
}

std::vector<Delivered> SpoolReader::deliveries() {
  SqliteStatement select = database_.prepare(
      "SELECT destination, count(*), max(delivered) FROM forwarder_delivered GROUP BY destination"
      " ORDER BY max(delivered) DESC LIMIT 8");
  std::vector<Delivered> all;
  while (select.prepared() && select.step() == SqliteStatement::Step::row)
    all.push_back({std::string(select.text(0)), select.integer(1), select.integer(2)});
  return all;
}

std::optional<SpoolContents> SpoolReader::contents() {
  const auto count = database_.integer("SELECT count(*) FROM events");
  if (!count) {
    reason_ = path_ + ": " + database_.status().reason;
    return {};
  }
  SpoolContents contents;
  contents.rows = *count;
  contents.bytes = sizeOf(path_) + sizeOf(path_ + "-wal");
  // Rows are in the order of their ids, so the first and the last id give the times without a look
  // at the rows between.
  if (*count != 0) {
    contents.oldest = database_.integer("SELECT time FROM events ORDER BY id LIMIT 1");
    contents.newest = database_.integer("SELECT time FROM events ORDER BY id DESC LIMIT 1");
  }
  contents.forwarder = readForwarderCounters(database_);
  DeliveredRows delivered(database_);
  delivered.open();
  const int64_t pages = database_.integer("PRAGMA page_count").value_or(0) -
                        database_.integer("PRAGMA freelist_count").value_or(0);
  const auto used = static_cast<uint64_t>(pages * kSpoolPageBytes);
  contents.bytesOfWaiting = used - std::min(used, delivered.bytes());
  contents.delivered = database_.integer("SELECT count(*) FROM forwarder_delivered").value_or(0);
  contents.setAside = database_.integer("SELECT count(*) FROM forwarder_set_aside").value_or(0);
  if (const auto limit = database_.integer("SELECT value FROM meta WHERE key='limit_bytes'"))
    contents.limit = static_cast<uint64_t>(*limit);
  return contents;
}

}  // namespace tessel::ctl
