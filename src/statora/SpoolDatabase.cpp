// Writing the spool's database: how rows become safe, and how its size stays within the limit.
//
// The choice. SQLite's write-ahead log with synchronous=NORMAL: a commit appends to the log and
// flushes nothing. flush() flushes the log's file through SQLite's own handle, and its caller does
// that once a second.
//  - A kill at any moment loses no inserted row. The kernel keeps the written pages, and SQLite
//    drops an unfinished transaction when the spool is next opened.
//  - A power cut loses at most what was inserted since the last flush. SQLite reads the log up to
//    the first page whose checksum is wrong. So an end of the log is lost, never a row between two.
//  - The database itself is always sound. A checkpoint flushes the log before it changes a page of
//    the database, and the database before the log may begin anew. So no page in the database is
//    newer than the log on the disk.
// The price: the ids of lost rows are given again, to other events. Nobody else may have seen the
// lost rows as delivered, so the forwarder flushes the log before it sends. And a failed flush puts
// all rows since the last flush at risk. They are counted as failed, for the kernel forgets which
// pages it could not write, and a second flush would succeed without writing them.
//
// What was discarded. synchronous=FULL flushes for each transaction: on a disk that needs 40 ms for
// a flush, 80 rows a second do not get through. One transaction a second would need no flush of our
// own, but readers would see rows late, and a kill would lose a second. SQLite's rollback journal
// flushes several times a transaction, and a reader makes the writer wait.

#include "statora/SpoolDatabase.h"

#include <sqlite3.h>

#include <algorithm>
#include <filesystem>
#include <limits>
#include <utility>

#include "statora/SpoolShares.h"

namespace tessel {

namespace {

// The patience of one insert. The rows wait in memory and are tried again each second, so a long
// wait would win nothing.
constexpr std::chrono::milliseconds kPatience{250};

// A step of removing holds the lock for as long as it takes to clear these rows, at most 130 KiB
// each.
constexpr int64_t kRowsExpiredAtOnce = 32;
constexpr int kPagesVacuumedAtOnce = 256;
// Pages of delivered rows that are cleared at once: some more than a transaction of usual rows
// needs, so that few transactions have to clear any, and few enough for a log that cannot grow.
constexpr int64_t kPagesClearedAtOnce = 32;
// A disk with less than this to spare is low: a few transactions of the longest rows.
constexpr uint64_t kLowDisk = uint64_t{4} << 20;
// Rows stand in the order of sending. Where the clock was set, old rows may stand behind newer
// ones, so the search goes on for so many rows. To read the whole spool would take seconds.
constexpr int64_t kNewerRowsLookedAt = 16384;

}  // namespace

SpoolDatabase::SpoolDatabase(std::string stateDirectory, SpoolLimits limits)
    : directory_(std::move(stateDirectory)),
      path_(directory_ + "/" + kSpoolFileName),
      limits_(limits),
      maxPages_(static_cast<int64_t>(limits.bytes) / kSpoolPageBytes),
      checkpointPages_(checkpointPages(limits.bytes)),
      patience_(kPatience) {}

bool SpoolDatabase::exists() const {
  std::error_code ignored;  // a path that cannot be looked at holds nothing for us
  return std::filesystem::exists(path_, ignored);
}

void SpoolDatabase::setPatience(std::chrono::milliseconds patience) {
  patience_ = patience;
  if (database_.isOpen()) database_.setBusyTimeout(static_cast<int>(patience_.count()));
}

void SpoolDatabase::endRun() {
  firstIdOfRun_ = 0;
  pagesOfRun_ = 0;
  takenByRun_ = 0;
  refusedForLog_ = false;
  setPatience(kPatience);
}

// A database that cannot be opened counts as empty: it may be damaged, and is then set aside. If it
// is not, refusal() still keeps it within the limit.
int64_t SpoolDatabase::pagesOfRun() {
  if (pagesOfRun_ != 0) return pagesOfRun_;
  if (exists()) ensureOpen();
  const int64_t waiting = isOpen() ? usedPages() - deliveredPages() : 0;
  pagesOfRun_ = shareOf(maxPages_ - 2 * checkpointPages_ - waiting);
  return pagesOfRun_;
}

// What is divided among the writers must be more than nothing. In a full spool they divide what an
// empty one would offer, and each of their rows is then refused with the reason that it is full.
uint64_t SpoolDatabase::bytesForObjects() {
  const int64_t pages = pagesForObjects(pagesOfRun());
  const int64_t ofEmpty = pagesForObjects(shareOf(maxPages_ - 2 * checkpointPages_));
  return static_cast<uint64_t>((pages > 0 ? pages : ofEmpty) * kSpoolPageBytes);
}

SqliteStatus SpoolDatabase::ensureOpen() {
  if (isOpen()) return {};
  SqliteStatus status = open();
  if (!status.ok()) {
    forgetStatements();
    database_.abandon();
  }
  return status;
}

SqliteStatus SpoolDatabase::open() {
  std::error_code ignored;  // opening the database fails next, with a better reason
  std::filesystem::create_directories(directory_, ignored);
  SqliteStatus status = openSpoolDatabase(database_, path_, static_cast<int>(patience_.count()));
  if (!status.ok()) return status;
  // journal_size_limit cuts the log's file down after a reader let it grow. secure_delete=FAST
  // does not write a page only to clear it; the page is soon used again or given back.
  status = database_.execute(
      "PRAGMA synchronous=NORMAL; PRAGMA secure_delete=FAST; PRAGMA journal_size_limit=" +
      std::to_string(checkpointPages_ * kSpoolPageBytes));
  if (!status.ok()) return status;
  logPages_ = 0;
  nextCheckpoint_ = checkpointPages_;
  sqlite3_wal_hook(database_.handle(), &SpoolDatabase::afterCommit, this);
  if (firstIdOfRun_ == 0) {
    const auto last = database_.integer("SELECT seq FROM sqlite_sequence WHERE name='events'");
    firstIdOfRun_ = last.value_or(0) + 1;
  }
  pageCount_ = database_.prepare("PRAGMA page_count", true);
  freePages_ = database_.prepare("PRAGMA freelist_count", true);
  insert_ = database_.prepare("INSERT INTO events(time, name, payload) VALUES(?1, ?2, ?3)", true);
  delivered_.open();
  // If this fails, the forwarder keeps to the limits that stand there, or to the least ones.
  writeSpoolLimits(database_, limits_);
  const bool good = pageCount_.prepared() && freePages_.prepared() && insert_.prepared();
  return good ? SqliteStatus{} : database_.status();
}

void SpoolDatabase::forgetStatements() {
  delivered_.close();
  for (SqliteStatement* statement : {&insert_, &pageCount_, &freePages_}) *statement = {};
}

void SpoolDatabase::close() {
  forgetStatements();
  database_.close();
  unflushed_ = false;
  unflushedRows_ = 0;
}

int64_t SpoolDatabase::usedPages() { return pageCount_.value() - freePages_.value(); }

int64_t SpoolDatabase::deliveredPages() {
  return static_cast<int64_t>(delivered_.bytes()) / kSpoolPageBytes;
}

// Whether the disk could not take the log as new pages of the database, or little more. A file
// system that does not say is not low.
bool SpoolDatabase::diskIsLow() {
  std::error_code unknown;
  const auto space = std::filesystem::space(directory_, unknown);
  return !unknown &&
         space.available < kLowDisk + static_cast<uint64_t>(logPages_) * kSpoolPageBytes;
}

// On a full disk the delivered rows go first. That must begin before it is full: a removal is
// written into the log, and the log can neither grow then nor move into a database that grows. So
// on a disk that is low, new rows get the pages of delivered ones, and the log is emptied after
// each transaction. Then neither file grows.
SqliteStatus SpoolDatabase::insert(std::span<PendingRow> rows) {
  if (isOpen() && delivered_.bytes() != 0 && diskIsLow()) {
    clearPages(rows);
    nextCheckpoint_ = 0;
  }
  SqliteStatus status = insertOnce(rows);
  // It may be full for us alone, by a quota.
  while (status.primaryCode() == SQLITE_FULL && clearPages(rows)) status = insertOnce(rows);
  return status;
}

// Makes as many free pages as the rows need. False if it has removed nothing for that.
bool SpoolDatabase::clearPages(std::span<const PendingRow> rows) {
  if (!isOpen() || !delivered_.open()) return false;
  int64_t needed = kPagesClearedAtOnce;
  for (const PendingRow& row : rows)
    needed +=
        static_cast<int64_t>(spaceOfRow(row.textBytes()) + kSpoolPageBytes - 1) / kSpoolPageBytes;
  bool removed = false;
  while (freePages_.value() < needed) {
    checkpoint();
    if (delivered_.removeOldest(kPagesClearedAtOnce * kSpoolPageBytes).value_or(0) == 0) break;
    removed = true;
  }
  return removed;
}

SqliteStatus SpoolDatabase::insertOnce(std::span<PendingRow> rows) {
  if (SqliteStatus opened = ensureOpen(); !opened.ok()) return opened;
  if (SqliteStatus begun = database_.execute("BEGIN IMMEDIATE"); !begun.ok()) return begun;
  const uint64_t takenBefore = takenByRun_;
  pagesOfInsert_ = 0;
  SqliteStatus status = insertEach(rows);
  if (status.ok()) status = database_.execute("COMMIT");
  if (!status.ok()) {
    database_.execute("ROLLBACK");
    takenByRun_ = takenBefore;
    return status;
  }
  unflushedRows_ += static_cast<uint64_t>(
      std::count_if(rows.begin(), rows.end(), [](const PendingRow& row) { return !row.refused; }));
  if (logPages_ >= nextCheckpoint_) checkpoint();
  return {};
}

SqliteStatus SpoolDatabase::insertEach(std::span<PendingRow> rows) {
  for (PendingRow& row : rows) {
    row.refused = overShare(row);
    if (row.refused) continue;
    if (SqliteStatus made = makeRoom(row); !made.ok()) return made;
    row.refused = overLimit(row);
    if (row.refused) continue;
    insert_.bind(1, row.time).bind(2, row.name).bind(3, *row.payload);
    if (!insert_.run()) return database_.status();
    takenByRun_ += spaceOfRow(row.textBytes());
  }
  return {};
}

std::optional<SpoolFailure> SpoolDatabase::overShare(const PendingRow& row) {
  const int64_t kept = pagesKeptFrom(row.rank, pagesOfRun());
  if (row.rank == EventRank::object && pagesForObjects(pagesOfRun()) == 0)
    return SpoolFailure::limit;
  if (row.rank != EventRank::statistics &&
      takenByRun_ + spaceOfRow(row.textBytes()) >
          static_cast<uint64_t>((pagesOfRun() - kept) * kSpoolPageBytes)) {
    return SpoolFailure::runShare;
  }
  return {};
}

// The limit holds for the pages in use and the log together. A reader that stays makes the log grow
// although its pages will also go into the database, so both are counted. Twice the usual log is
// never given to rows: the log needs it between two checkpoints.
SpoolDatabase::Room SpoolDatabase::roomFor(const PendingRow& row) {
  Room room;
  room.row = static_cast<int64_t>(spaceOfRow(row.textBytes())) / kSpoolPageBytes + kPagesBesideRow;
  room.left = maxPages_ - usedPages() - pagesKeptFrom(row.rank, pagesOfRun()) - room.row;
  room.log = 2 * checkpointPages_;
  if (logIsHeld()) room.log = std::max(room.log, logPages_ + pagesOfInsert_ + room.row);
  return room;
}

// Delivered rows give way to a new one. The pages that they leave are cleared in the log.
SqliteStatus SpoolDatabase::makeRoom(const PendingRow& row) {
  for (Room room = roomFor(row); room.left < room.log && delivered_.open(); room = roomFor(row)) {
    const int64_t pages = std::max(room.log - room.left, kPagesClearedAtOnce);
    const auto removed = delivered_.removeOldest(static_cast<uint64_t>(pages * kSpoolPageBytes));
    if (!removed) return database_.status();
    if (*removed == 0) break;
    pagesOfInsert_ += pages;
  }
  return {};
}

std::optional<SpoolFailure> SpoolDatabase::overLimit(const PendingRow& row) {
  const Room room = roomFor(row);
  if (room.left < 2 * checkpointPages_) return SpoolFailure::limit;
  if (room.left < room.log) {
    refusedForLog_ = true;
    return SpoolFailure::heldByReader;
  }
  pagesOfInsert_ += room.row;
  return {};
}

// SQLite calls this after each commit, with the number of pages in the log. It takes the place of
// SQLite's own automatic checkpoint.
int SpoolDatabase::afterCommit(void* self, sqlite3* /*handle*/, const char* /*schema*/,
                               int logPages) {
  auto& database = *static_cast<SpoolDatabase*>(self);
  database.logPages_ = logPages;
  database.unflushed_ = true;
  return SQLITE_OK;
}

// RESTART without a wait moves the pages that no reader needs. It succeeds if the next commit will
// begin the log anew. Otherwise a reader has kept some pages, and the next checkpoint comes after
// as many pages again: one at each commit would flush each time.
void SpoolDatabase::checkpoint() {
  database_.setBusyTimeout(0);
  const int code = sqlite3_wal_checkpoint_v2(database_.handle(), nullptr, SQLITE_CHECKPOINT_RESTART,
                                             nullptr, nullptr);
  database_.setBusyTimeout(static_cast<int>(patience_.count()));
  if (code == SQLITE_IOERR_FSYNC) rowsAtRisk_ += std::exchange(unflushedRows_, 0);
  if (code == SQLITE_OK) {
    logPages_ = 0;
    // To move the pages, the checkpoint has flushed the log.
    unflushed_ = false;
    unflushedRows_ = 0;
  }
  nextCheckpoint_ = logPages_ + checkpointPages_;
}

void SpoolDatabase::retryHeldLog() {
  if (isOpen() && std::exchange(refusedForLog_, false)) checkpoint();
}

SqliteStatus SpoolDatabase::flush() {
  if (!isOpen() || !std::exchange(unflushed_, false)) return {};
  SqliteStatus status = database_.flushLog();
  const uint64_t rows = std::exchange(unflushedRows_, 0);
  if (!status.ok()) rowsAtRisk_ += rows;
  return status;
}

uint64_t SpoolDatabase::takeRowsAtRisk() { return std::exchange(rowsAtRisk_, 0); }

bool SpoolDatabase::mayGrowLog() {
  return !logIsHeld() || pageCount_.value() + logPages_ + 2 * checkpointPages_ < maxPages_;
}

uint64_t SpoolDatabase::expire(Date now, const std::function<void()>& progress) {
  if (!exists() || !ensureOpen().ok()) return 0;
  const auto repeat = [&](const auto& removeSome) {
    while (mayGrowLog() && removeSome()) {
      if (logPages_ >= nextCheckpoint_) checkpoint();
      progress();
    }
  };
  uint64_t removed = 0;
  if (limits_.days.count() != 0) {
    Search search{.oldest = (now - limits_.days).time_since_epoch().count()};
    repeat([&] { return expireNext(search); });
    removed = search.removed;
  }
  DeliveredRows::Search search = DeliveredRows::searchAt(now, limits_, -1);
  repeat([&] { return delivered_.removeExpired(search); });
  repeat([&] {
    return deliveredTooMuch() && delivered_.removeOldest(kPagesClearedAtOnce * kSpoolPageBytes);
  });
  giveSpaceBack(progress);
  return removed;
}

bool SpoolDatabase::deliveredTooMuch() {
  const auto others = static_cast<uint64_t>((usedPages() - deliveredPages()) * kSpoolPageBytes);
  return delivered_.bytes() > DeliveredRows::allowance(limits_, others);
}

// SQLite uses free pages again, but shortens the file only when asked. A VACUUM would copy the
// whole file under the lock. Some databases cannot give back a page, so the number must shrink each
// time.
void SpoolDatabase::giveSpaceBack(const std::function<void()>& progress) {
  const std::string step =
      "PRAGMA incremental_vacuum(" + std::to_string(kPagesVacuumedAtOnce) + ")";
  int64_t before = std::numeric_limits<int64_t>::max();
  for (int64_t free = freePages_.value(); free > 0 && free < before && mayGrowLog();
       free = freePages_.value()) {
    before = free;
    if (!database_.execute(step).ok()) return;
    if (logPages_ >= nextCheckpoint_) checkpoint();
    progress();
  }
}

// False if there are no more old rows, or if it fails.
bool SpoolDatabase::expireNext(Search& search) {
  SqliteStatement find = database_.prepare(
      "SELECT id FROM (SELECT id, time FROM events WHERE id >= ?1 AND id < ?2 ORDER BY id LIMIT ?3)"
      " WHERE time < ?4 LIMIT 1");
  SqliteStatement remove =
      database_.prepare("DELETE FROM events WHERE id BETWEEN ?1 AND ?2 AND time < ?3");
  if (!find.prepared() || !remove.prepared()) return false;
  find.bind(1, search.from).bind(2, firstIdOfRun_).bind(3, kNewerRowsLookedAt);
  const int64_t found = find.bind(4, search.oldest).value();
  if (found == 0) return false;
  search.from = std::min(found + kRowsExpiredAtOnce, firstIdOfRun_);
  if (!remove.bind(1, found).bind(2, search.from - 1).bind(3, search.oldest).run()) return false;
  // The forwarder may have removed some of them meanwhile.
  search.removed += static_cast<uint64_t>(database_.changes());
  return true;
}

// abandon() and not close(): a checkpoint would write into the damaged file.
std::optional<std::string> SpoolDatabase::setAside(Date now) {
  forgetStatements();
  database_.abandon();
  firstIdOfRun_ = 0;  // the new one begins with 1
  return setSpoolAside(directory_, now);
}

}  // namespace tessel
