// Reading, acknowledging and setting aside rows of the spool.
//
// Delivery is at least once. A row leaves `events` only after a collector has taken or refused it,
// in the same transaction that moves the counters and copies the row to where delivered rows stay.
// So after a kill at any moment a row stands in one table, and only in one. If the forwarder dies
// between the collector's answer and that transaction, the next forwarder sends the row again under
// the same identifier (spool id and row id), and the backend keeps one of the two. Exactly once
// would need a collector that remembers identifiers in a transaction with us, and none does.
//
// A collector may refuse a row for ever, and all later rows would wait behind it. So such a row
// moves to `forwarder_set_aside`, together with the collector's words. It stays there until
// somebody puts it back (requeue) or newer refused rows push it out.
//
// Our commits do not flush the disk (synchronous=NORMAL). A power cut may undo an acknowledgement.
// The row is then delivered again, which delivery at least once allows. So a flush for each commit
// would buy nothing.

#include "statora/ForwarderState.h"

#include <sqlite3.h>
#include <sys/stat.h>

#include <algorithm>
#include <utility>

#include "platform/Invariant.h"
#include "statora/ForwarderLock.h"
#include "statora/Spool.h"

namespace tessel {

namespace {

// The service waits for the lock for two seconds at the end of a run, and then gives its rows up.
// The forwarder loses nothing by waiting, so it waits longer.
constexpr int kForwardersPatience = 5000;  // milliseconds

// Rows that one transaction moves. The service may wait for the lock at any moment. A full batch
// of 512 rows would hold it four times as long. Large rows are counted by their bytes: the log of
// the smallest spool may have 128 KiB between two checkpoints.
constexpr size_t kRowsMovedAtOnce = 128;
constexpr uint64_t kBytesMovedAtOnce = uint64_t{96} << 10;

// Acknowledgements make the log grow. The service empties it at 4000 pages, in the middle of a run.
// The forwarder does so much earlier, to spare the service the work.
constexpr int64_t kForwardersCheckpointPages = 500;

// Pages that an acknowledgement of a batch writes: of the rows that leave `events`, and of the
// copies.
constexpr int64_t kPagesOfAcknowledgement = 128;

// While a reader holds the log, each delivery makes it longer, and nobody can shorten it. Copies
// stop at twice its usual length. At three times we send nothing until the reader has ended.
constexpr int64_t kHeldLogOfCopies = 2;
constexpr int64_t kHeldLog = 3;

// Rows that a look for expired rows reads. A look comes every 30 seconds and must cost nothing.
constexpr int64_t kRowsLookedAt = 32;

constexpr char kTables[] =
    "BEGIN IMMEDIATE;"
    "CREATE TABLE IF NOT EXISTS forwarder(name TEXT PRIMARY KEY, value INTEGER NOT NULL) WITHOUT "
    "ROWID;"
    "CREATE TABLE IF NOT EXISTS forwarder_set_aside(id INTEGER PRIMARY KEY, time INTEGER NOT NULL,"
    " name TEXT NOT NULL, payload TEXT NOT NULL, at INTEGER NOT NULL, status INTEGER NOT NULL,"
    " words TEXT NOT NULL);"
    "COMMIT";

}  // namespace

ForwarderState::ForwarderState(std::string stateDirectory, uint64_t maxSetAside)
    : directory_(std::move(stateDirectory)),
      path_(directory_ + "/" + kSpoolFileName),
      maxSetAside_(maxSetAside) {}

bool ForwarderState::exists() const {
  struct stat facts {};
  return ::lstat(path_.c_str(), &facts) == 0;
}

SqliteStatus ForwarderState::open() {
  // The service renames a damaged spool and begins a new one under the old name.
  if (database_.isOpen() && isStillThere()) return {};
  SqliteStatus status = lock();
  if (status.ok()) status = openAndPrepare();
  // abandon() and not close(): a checkpoint would write into a spool that we cannot use.
  if (!status.ok()) database_.abandon();
  return status;
}

// Two forwarders would send every row twice and count it twice.
SqliteStatus ForwarderState::lock() {
  if (lock_.valid()) return {};
  auto taken = takeForwarderLock(directory_);
  if (auto* refused = std::get_if<SqliteStatus>(&taken)) return std::move(*refused);
  lock_ = std::move(std::get<UniqueFd>(taken));
  return {};
}

SqliteStatus ForwarderState::openAndPrepare() {
  SqliteStatus status = openFresh(SqliteDatabase::Mode::readWrite);
  // The pages of moved rows are used again in the same transaction, or given back soon. To clear
  // each of them first would nearly double what is written.
  if (status.ok())
    status = database_.execute("PRAGMA synchronous=NORMAL; PRAGMA secure_delete=FAST");
  if (status.ok() &&
      !database_.integer("SELECT 1 FROM sqlite_schema WHERE name='forwarder_set_aside'")) {
    status = database_.execute(kTables);
  }
  if (status.ok()) status = prepareStatements();
  if (!status.ok()) return status;
  // Delivery goes on without the table, on a full disk for example.
  delivered_.make();
  readLimits();
  sqlite3_wal_hook(database_.handle(), &ForwarderState::afterCommit, this);
  counters_ = readForwarderCounters(database_).value_or(ForwarderCounters{});
  return {};
}

SqliteStatus ForwarderState::openReadOnly() {
  SqliteStatus status = openFresh(SqliteDatabase::Mode::readOnly);
  if (!status.ok()) return status;
  select_ = database_.prepare(kSelectEvents, true);
  return select_.prepared() ? SqliteStatus{} : database_.status();
}

bool ForwarderState::isStillThere() const {
  struct stat facts {};
  return ::lstat(path_.c_str(), &facts) == 0 && facts.st_dev == device_ && facts.st_ino == inode_;
}

SqliteStatus ForwarderState::openFresh(SqliteDatabase::Mode mode) {
  delivered_.close();
  for (SqliteStatement* statement : {&select_, &remove_, &keep_, &count_, &pageCount_, &freePages_})
    *statement = {};
  ++generation_;
  // close() would empty and delete the log by its name, and that may by now be the new spool's log.
  database_.abandon();
  struct stat facts {};
  if (::lstat(path_.c_str(), &facts) == 0) {
    device_ = facts.st_dev;
    inode_ = facts.st_ino;
  }
  SqliteStatus status = database_.open(path_, mode);
  if (!status.ok()) return status;
  database_.setBusyTimeout(kForwardersPatience);
  const auto version = database_.integer("PRAGMA user_version");
  if (!version) return database_.status();
  if (!isUnderstoodSpool(database_, *version)) {
    return {SQLITE_SCHEMA,
            "the spool was made by another version (schema " + std::to_string(*version) + ")"};
  }
  const auto id = database_.text("SELECT value FROM meta WHERE key='spool_id'");
  if (!id) return {SQLITE_CORRUPT, "the spool has no identifier"};
  spoolId_ = *id;
  return {};
}

SqliteStatus ForwarderState::prepareStatements() {
  const auto prepare = [this](SqliteStatement& statement, std::string_view text) {
    statement = database_.prepare(text, true);
    return statement.prepared();
  };
  const bool good =
      prepare(select_, kSelectEvents) && prepare(remove_, "DELETE FROM events WHERE id=?1") &&
      // A row that was put back into another spool may have the id of one that stands here already.
      // Both stay: without an id SQLite chooses a free one.
      prepare(keep_,
              "INSERT INTO forwarder_set_aside SELECT"
              " CASE WHEN EXISTS (SELECT 1 FROM forwarder_set_aside WHERE id=?1) THEN NULL"
              " ELSE ?1 END, ?2, ?3, ?4, ?5, ?6, ?7") &&
      prepare(pageCount_, "PRAGMA page_count") && prepare(freePages_, "PRAGMA freelist_count") &&
      prepare(count_, kInsertCounter);
  return good ? SqliteStatus{} : database_.status();
}

std::vector<SpooledEvent> ForwarderState::oldest(size_t maxRows, size_t maxBytes, int64_t after) {
  return readEvents(select_, after, maxRows, maxBytes);
}

std::vector<SpooledEvent> ForwarderState::someEvent(int64_t after, double chance) {
  const int64_t last = database_.integer("SELECT max(id) FROM events").value_or(after);
  if (last <= after) return {};
  // At most last - 1, so that there is a row above it.
  const auto beyond = static_cast<int64_t>(chance * static_cast<double>(last - after));
  return oldest(1, 1, std::min(after + beyond, last - 1));
}

uint64_t ForwarderState::waiting() {
  const auto span = database_.integer(
      "SELECT coalesce((SELECT max(id) FROM events) - (SELECT min(id) FROM events) + 1, 0)");
  return static_cast<uint64_t>(std::max<int64_t>(span.value_or(0), 0));
}

// Ends a transaction: commits it if all went well, and takes all of it back otherwise.
SqliteStatus ForwarderState::finish(bool good) {
  SqliteStatus status = good ? database_.execute("COMMIT") : database_.status();
  if (!status.ok()) database_.execute("ROLLBACK");
  return status;
}

// The service may get other limits at any time, so they are read again at each look.
void ForwarderState::readLimits() {
  limits_ = readSpoolLimits(database_);
  checkpointPages_ = checkpointPages(limits_.bytes);
}

// SQLite calls this after each commit, with the number of pages in the log. Like SQLite's own
// automatic checkpoint, it waits for nobody.
int ForwarderState::afterCommit(void* self, sqlite3* handle, const char* schema, int logPages) {
  auto& state = *static_cast<ForwarderState*>(self);
  state.logPages_ = logPages;
  if (logPages >= std::min(kForwardersCheckpointPages, state.checkpointPages_))
    sqlite3_wal_checkpoint_v2(handle, schema, SQLITE_CHECKPOINT_PASSIVE, nullptr, nullptr);
  return SQLITE_OK;
}

// Whether the log has more than `pages` pages because a reader keeps it from beginning anew. The
// checkpoint tells: it succeeds if the next commit begins the log anew.
bool ForwarderState::logIsHeld(int64_t pages) {
  if (logPages_ <= pages) return false;
  database_.setBusyTimeout(0);
  const int code = sqlite3_wal_checkpoint_v2(database_.handle(), nullptr, SQLITE_CHECKPOINT_RESTART,
                                             nullptr, nullptr);
  database_.setBusyTimeout(kForwardersPatience);
  if (code == SQLITE_OK) logPages_ = 0;
  return code != SQLITE_OK;
}

SqliteStatus ForwarderState::proveWritable(bool asMuchAsABatch) {
  if (asMuchAsABatch) {
    // A full disk often has room for a page or two. So this writes about what an acknowledgement
    // writes, and gives the pages back.
    const std::string bytes =
        std::to_string(kSpoolPageBytes * std::min(kPagesOfAcknowledgement, checkpointPages_));
    SqliteStatus written =
        database_.execute("INSERT OR REPLACE INTO forwarder VALUES('proof', zeroblob(" + bytes +
                          "));"
                          "DELETE FROM forwarder WHERE name='proof'");
    if (!written.ok()) return written;
  }
  if (SqliteStatus stored = storeCounters(); !stored.ok()) return stored;
  if (logIsHeld(kHeldLog * checkpointPages_))
    return {SQLITE_BUSY_SNAPSHOT, "a reader that does not end keeps its log growing"};
  return {};
}

// One row at least.
ForwarderState::Rows ForwarderState::firstStep(Rows rows) const {
  size_t count = 0;
  uint64_t bytes = 0;
  do {
    bytes += spaceOfRow(rows[count]->name.size() + rows[count]->payload.size());
    ++count;
  } while (count < std::min(rows.size(), kRowsMovedAtOnce) && bytes < kBytesMovedAtOnce);
  return rows.first(count);
}

SqliteStatus ForwarderState::acknowledge(Rows& rows, uint64_t& rejected,
                                         std::string_view destination, Date now) {
  const uint64_t deliveredBefore = counters_.delivered;
  const size_t acknowledged = rows.size();
  counters_.lastSuccess = microsecondsSince1970(now);
  while (!rows.empty()) {
    const Rows step = firstStep(rows);
    // A step counts no more of the rejected rows than it has, and the last steps count the rest.
    const uint64_t rejectedHere = std::min<uint64_t>(rejected, step.size());
    if (SqliteStatus status = move(step, rejectedHere, destination, now); !status.ok())
      return status;
    rows = rows.subspan(step.size());
    rejected -= rejectedHere;
  }
  // Each row was counted in one transaction, and in one only.
  TESSEL_INVARIANT(counters_.delivered == deliveredBefore + acknowledged);
  return {};
}

// Copies are for people, and no event that waits is to wait for them. So none is kept where a
// reader holds the log, which each copy would make longer, nor where keeping it fails: on a full
// disk, or with a table that somebody has changed.
SqliteStatus ForwarderState::move(Rows rows, uint64_t rejected, std::string_view destination,
                                  Date now) {
  if (!delivered_.isOpen() || logIsHeld(kHeldLogOfCopies * checkpointPages_))
    return moveOnce(rows, rejected, destination, now, Delivered::dropped);
  SqliteStatus status = moveOnce(rows, rejected, destination, now, Delivered::kept);
  // With these errors the disk or another client is at fault, and not the copy.
  const int code = status.primaryCode();
  if (status.ok() || code == SQLITE_BUSY || code == SQLITE_IOERR) return status;
  delivered_.close();  // until the next look
  return moveOnce(rows, rejected, destination, now, Delivered::dropped);
}

SqliteStatus ForwarderState::moveOnce(Rows rows, uint64_t rejected, std::string_view destination,
                                      Date now, Delivered fate) {
  if (SqliteStatus begun = database_.execute("BEGIN IMMEDIATE"); !begun.ok()) return begun;
  const ForwarderCounters before = counters_;
  counters_.delivered += rows.size();
  counters_.rejected += rejected;
  // Requeued rows have ids below the position. The maximum keeps it from going back.
  counters_.position =
      std::max(counters_.position, static_cast<uint64_t>(std::max<int64_t>(rows.back()->id, 0)));
  std::vector<const SpooledEvent*> removed;
  bool good = std::all_of(rows.begin(), rows.end(), [&](const SpooledEvent* row) {
    const bool done = remove_.bind(1, row->id).run();
    // The service removes rows that are past their days, also while they are on their way.
    if (database_.changes() == 1) removed.push_back(row);
    return done;
  });
  if (good && fate == Delivered::kept) good = keep(removed, destination, now);
  SqliteStatus status = finish(good && writeForwarderCounters(count_, counters_));
  // The rollback has kept the rows, so they must not count as delivered.
  if (!status.ok()) counters_ = before;
  return status;
}

bool ForwarderState::keep(Rows rows, std::string_view destination, Date now) {
  const uint64_t before = delivered_.bytes();
  return delivered_.add(rows, destination, now) && shortenBy(delivered_.bytes() - before);
}

// Removes what is over the limits, but not much more than what was added: the lock is held for as
// long as it takes, and each later transaction does its part.
bool ForwarderState::shortenBy(uint64_t added) {
  const uint64_t bytes = delivered_.bytes();
  const auto used =
      static_cast<uint64_t>((pageCount_.value() - freePages_.value()) * kSpoolPageBytes);
  const uint64_t allowed = DeliveredRows::allowance(limits_, used - std::min(used, bytes));
  if (bytes <= allowed) return true;
  return delivered_.removeOldest(std::min(bytes - allowed, added + kBytesMovedAtOnce)).has_value();
}

void ForwarderState::shortenDelivered(Date now) {
  // Whoever may write to the spool can change the table, so it is looked at again.
  delivered_.close();
  if (!delivered_.open()) return;
  readLimits();
  DeliveredRows::Search search = DeliveredRows::searchAt(now, limits_, kRowsLookedAt);
  while (delivered_.removeExpired(search)) continue;
  for (uint64_t before = delivered_.bytes(); shortenBy(0) && delivered_.bytes() < before;)
    before = delivered_.bytes();
}

bool ForwarderState::hasRoomToSetAside() {
  const auto rows = database_.integer("SELECT count(*) FROM forwarder_set_aside");
  return rows && static_cast<uint64_t>(*rows) < maxSetAside_;
}

SqliteStatus ForwarderState::setAside(const SpooledEvent& event, int64_t collectorStatus,
                                      std::string_view words, Date now) {
  if (SqliteStatus begun = database_.execute("BEGIN IMMEDIATE"); !begun.ok()) return begun;
  const ForwarderCounters before = counters_;
  keep_.bind(1, event.id).bind(2, event.time).bind(3, event.name).bind(4, event.payload);
  keep_.bind(5, int64_t{now.time_since_epoch().count()}).bind(6, collectorStatus).bind(7, words);
  ++counters_.setAside;
  SqliteStatus status = finish(keep_.run() && remove_.bind(1, event.id).run() &&
                               writeForwarderCounters(count_, counters_));
  if (!status.ok()) counters_ = before;
  return status;
}

SqliteStatus ForwarderState::storeCounters() {
  if (SqliteStatus begun = database_.execute("BEGIN IMMEDIATE"); !begun.ok()) return begun;
  return finish(writeForwarderCounters(count_, counters_));
}

// The rows keep their ids, so the collector sees the same identifiers again. Their ids are mostly
// lower than those of the rows that wait, so they mostly go out first. In a spool that was restored
// from a copy an id may have been given again; such a row gets a new one.
std::optional<int64_t> ForwarderState::requeue() {
  SqliteStatus status = database_.execute("BEGIN IMMEDIATE");
  if (!status.ok()) return {};
  int64_t rows = 0;
  for (const char* step :
       {"INSERT INTO events SELECT id, time, name, payload FROM forwarder_set_aside"
        " WHERE id NOT IN (SELECT id FROM events)",
        "INSERT INTO events(time, name, payload) SELECT s.time, s.name, s.payload"
        " FROM forwarder_set_aside s JOIN events e ON e.id = s.id"
        " WHERE (e.time, e.name, e.payload) <> (s.time, s.name, s.payload)"}) {
    if (status.ok()) status = database_.execute(step);
    if (status.ok()) rows += database_.changes();
  }
  const bool good = status.ok() && database_.execute("DELETE FROM forwarder_set_aside").ok();
  if (!finish(good).ok()) return {};
  return rows;
}

// SQLite reuses the pages of removed rows, but in this mode it shortens the file only when asked. A
// VACUUM would copy the whole file under the lock. An incremental one moves only a few pages.
bool ForwarderState::shrink(int pages) {
  if (database_.integer("PRAGMA freelist_count").value_or(0) == 0) return false;
  SqliteStatement vacuum =
      database_.prepare("PRAGMA incremental_vacuum(" + std::to_string(pages) + ")");
  return vacuum.prepared() && vacuum.run();
}

}  // namespace tessel
