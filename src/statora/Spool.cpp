// Storing events so that they survive, and what to do when that fails.
//
// The choice. Every send is one transaction in SQLite's write-ahead log mode with synchronous=FULL:
// the commit appends the row to the log and flushes the log before it returns.
//  - A kill at any moment loses nothing that was sent. The kernel keeps the written pages, and
//    SQLite drops an unfinished transaction when the spool is next opened.
//  - A power cut loses nothing that was sent, because of the flush. With synchronous=NORMAL it
//    could lose every row since the last checkpoint, though the file would stay sound.
// The price is one flush a send: about 0.1 ms on flash, half of it processor time. The service
// sends at most 80 events a second, so even a disk that needs 10 ms for a flush keeps up.
//
// What was discarded. The rollback journal (SQLite's default mode) flushes several times a commit,
// and a reader makes the writer wait. One flush for several sends would be cheaper, but "true" from
// a send would then not mean that its row is safe, and keeping track of the unsafe rows costs more
// than the flush. A plain file of lines could not give space back while the service appends to it.

#include "statora/Spool.h"

#include <fcntl.h>
#include <sqlite3.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <iterator>
#include <numeric>
#include <utility>

#include "os/Files.h"
#include "platform/Invariant.h"
#include "platform/Log.h"
#include "platform/Text.h"

namespace tessel {

namespace {

// Step N brings a spool of version N to version N + 1. A step only adds, so that a forwarder of the
// version before can still deliver the rows.
//
// AUTOINCREMENT never gives an id twice, even after the row was delivered and removed. The
// forwarder needs that, because spool_id and id together are the identifier of an event.
constexpr const char* kUpgrades[] = {
    "CREATE TABLE events(id INTEGER PRIMARY KEY AUTOINCREMENT, time INTEGER NOT NULL,"
    " name TEXT NOT NULL, payload TEXT NOT NULL);"
    "CREATE TABLE meta(key TEXT PRIMARY KEY, value TEXT NOT NULL) WITHOUT ROWID;"
    "INSERT INTO meta VALUES('spool_id', lower(hex(randomblob(16))));",
};
static_assert(std::size(kUpgrades) == kSpoolSchemaVersion);

SqliteStatus upgrade(SqliteDatabase& database) {
  // The version is read again under the lock, because two processes may find the same new spool.
  if (SqliteStatus begun = database.execute("BEGIN IMMEDIATE"); !begun.ok()) return begun;
  const auto version = database.integer("PRAGMA user_version");
  SqliteStatus status = version ? SqliteStatus{} : database.status();
  for (int64_t step = version.value_or(kSpoolSchemaVersion);
       status.ok() && step < kSpoolSchemaVersion; ++step) {
    status = database.execute(kUpgrades[step]);
  }
  if (status.ok())
    status = database.execute("PRAGMA user_version=" + std::to_string(kSpoolSchemaVersion));
  if (status.ok()) status = database.execute("COMMIT");
  if (!status.ok()) database.execute("ROLLBACK");
  return status;
}

// The forwarder is another user of the same group and must write to the spool. SQLite would make
// the file without write permission for the group, so we make it first. SQLite then gives the log
// and the index of the log the same mode.
//
// This never opens an existing file. When a process closes any descriptor of a file, POSIX drops
// all its locks on that file, and an open database would lose its locks in that way.
void makeFile(const std::string& path) { createNewFile(path, 0660); }

SqliteStatus prepareSchema(SqliteDatabase& database) {
  const auto version = database.integer("PRAGMA user_version");
  if (!version) return database.status();
  if (*version == kSpoolSchemaVersion) return {};
  if (*version > kSpoolSchemaVersion || *version < 0) {
    return {SQLITE_SCHEMA, "made by another version (schema " + std::to_string(*version) + ")"};
  }
  // auto_vacuum lets the forwarder give the space of delivered rows back in small steps. It can
  // only be set before the first table exists, so it comes first.
  SqliteStatus status = database.execute("PRAGMA auto_vacuum=INCREMENTAL; PRAGMA journal_mode=WAL");
  return status.ok() ? upgrade(database) : status;
}

}  // namespace

SqliteStatus openSpoolDatabase(SqliteDatabase& database, const std::string& path,
                               int busyTimeoutMilliseconds) {
  makeFile(path);
  SqliteStatus status = database.open(path, SqliteDatabase::Mode::create);
  if (!status.ok()) return status;
  database.setBusyTimeout(busyTimeoutMilliseconds);
  status = prepareSchema(database);
  // A spool of a newer version must stay as it is. A normal close would write its log back.
  if (!status.ok()) database.abandon();
  return status;
}

namespace {

// How long one send may wait for another client's lock. The forwarder holds its locks for a
// fraction of that. After one wait that failed, the next sends do not wait at all, until one of
// them succeeds. Otherwise a lock that stays would add this time to the run for each event.
constexpr int kPatienceMilliseconds = 250;
// The log is moved into the database whenever it has this many pages (4 MB). Every reader has to
// look through the log, so a longer one would slow all readers down.
constexpr int kCheckpointPages = 1000;
// The log may take one part in so many of the limit. It grows beyond kCheckpointPages only while a
// reader keeps it from being emptied.
constexpr uint64_t kLogShare = 16;
constexpr int64_t kUsualPageSize = 4096;

std::string utcStamp(Date date) {
  const std::time_t seconds =
      std::chrono::duration_cast<std::chrono::seconds>(date.time_since_epoch()).count();
  std::tm parts{};
  gmtime_r(&seconds, &parts);
  char text[32];
  return {text, std::strftime(text, sizeof text, "%Y%m%dT%H%M%SZ", &parts)};
}

bool isDamage(const SqliteStatus& status) {
  return status.primaryCode() == SQLITE_CORRUPT || status.primaryCode() == SQLITE_NOTADB;
}

// After these errors the file may have changed below SQLite, which would still answer from its
// cache. So the next send opens the database anew.
bool needsReopening(const SqliteStatus& status) {
  return status.primaryCode() == SQLITE_IOERR || status.primaryCode() == SQLITE_READONLY ||
         status.primaryCode() == SQLITE_CANTOPEN;
}

// The log is renamed first. If the database went first and the process died then, the log would
// stay alone under the old name, and SQLite would play it into the new database.
bool renameAll(const std::string& from, const std::string& to) {
  for (const char* suffix : {"-wal", "", "-shm"}) {
    std::error_code error;
    std::filesystem::rename(from + suffix, to + suffix, error);
    if (error && error != std::errc::no_such_file_or_directory) return false;
  }
  return true;
}

}  // namespace

const char* spoolFailureName(SpoolFailure failure) {
  constexpr const char* kNames[kSpoolFailureKinds] = {"limit",   "disk_full", "read_only", "locked",
                                                      "damaged", "version",   "other"};
  return kNames[static_cast<size_t>(failure)];
}

Spool::Spool(std::string stateDirectory, Clock& clock, uint64_t maxBytes)
    : directory_(std::move(stateDirectory)),
      path_(directory_ + "/" + kSpoolFileName),
      clock_(clock),
      maxBytes_(maxBytes) {}

void Spool::beginRun() { figures_ = {}; }

void Spool::endRun() { close(); }

bool Spool::sendEvent(std::string_view name, const Payload& payload) {
  ++figures_.sent;
  const int64_t time = clock_.now().time_since_epoch().count();
  const std::string text = payloadJson(payload);
  const std::string validName = replaceInvalidUtf8(name);
  SqliteStatus status = store(validName, text, time);
  if (isDamage(status) && figures_.setAside.empty() && setAside())
    status = store(validName, text, time);
  if (status.ok()) {
    ++figures_.stored;
  } else {
    recordFailure(status, validName.size() + text.size());
    if (needsReopening(status)) close();
  }
  // The run's record accounts for every send, so none may be missing or counted twice.
  TESSEL_INVARIANT(figures_.stored + std::accumulate(figures_.failed.begin(), figures_.failed.end(),
                                                     uint64_t{0}) ==
                   figures_.sent);
  return status.ok();
}

SqliteStatus Spool::store(std::string_view name, std::string_view payload, int64_t time) {
  if (SqliteStatus opened = ensureOpen(); !opened.ok()) return opened;
  if (logIsTooLong()) return {SQLITE_FULL, "a reader keeps the write-ahead log from being emptied"};
  if (!insert_.bind(1, time).bind(2, name).bind(3, payload).run()) {
    SqliteStatus status = database_.status();
    impatient_ = status.primaryCode() == SQLITE_BUSY;
    if (impatient_) database_.setBusyTimeout(0);
    return status;
  }
  if (std::exchange(impatient_, false)) database_.setBusyTimeout(kPatienceMilliseconds);
  return {};
}

SqliteStatus Spool::ensureOpen() {
  if (insert_.prepared()) return {};
  SqliteStatus status = open();
  impatient_ = status.primaryCode() == SQLITE_BUSY;
  if (!status.ok()) {
    insert_ = {};
    database_.abandon();
  }
  return status;
}

SqliteStatus Spool::open() {
  std::error_code ignored;  // opening the database fails next, with a better reason
  std::filesystem::create_directories(directory_, ignored);
  SqliteStatus status = openSpoolDatabase(database_, path_, impatient_ ? 0 : kPatienceMilliseconds);
  if (!status.ok()) return status;
  const int64_t pageSize = database_.integer("PRAGMA page_size").value_or(kUsualPageSize);
  maxLogPages_ = std::max<int64_t>(static_cast<int64_t>(maxBytes_ / kLogShare) / pageSize, 16);
  maxPages_ = std::max<int64_t>(static_cast<int64_t>(maxBytes_) / pageSize - maxLogPages_, 1);
  // A limit below the present size is safe: SQLite then only keeps the database from growing.
  // journal_size_limit cuts the log file down after a reader let it grow.
  status = database_.execute(
      "PRAGMA synchronous=FULL; PRAGMA max_page_count=" + std::to_string(maxPages_) +
      "; PRAGMA journal_size_limit=" + std::to_string(kCheckpointPages * pageSize));
  if (!status.ok()) return status;
  logPages_ = 0;
  sqlite3_wal_hook(database_.handle(), &Spool::afterCommit, this);
  insert_ = database_.prepare("INSERT INTO events(time, name, payload) VALUES(?1, ?2, ?3)", true);
  return insert_.prepared() ? SqliteStatus{} : database_.status();
}

void Spool::close() {
  insert_ = {};
  database_.close();
}

// SQLite calls this after each commit, with the number of pages in the log. It replaces SQLite's
// own automatic checkpoint. A PASSIVE checkpoint waits for no reader: it moves the pages that no
// reader needs, and the next commit tries the rest.
int Spool::afterCommit(void* spool, sqlite3* handle, const char* schema, int logPages) {
  static_cast<Spool*>(spool)->logPages_ = logPages;
  if (logPages >= std::min<int64_t>(kCheckpointPages, static_cast<Spool*>(spool)->maxLogPages_)) {
    sqlite3_wal_checkpoint_v2(handle, schema, SQLITE_CHECKPOINT_PASSIVE, nullptr, nullptr);
  }
  return SQLITE_OK;
}

// A client that never ends its read transaction keeps every checkpoint from finishing, and the log
// grows by several pages an event. Once the log has used up its share, each send is refused until a
// TRUNCATE checkpoint succeeds. That one needs the log for itself, so it fails while the reader
// stays.
bool Spool::logIsTooLong() {
  if (logPages_ <= maxLogPages_) return false;
  database_.setBusyTimeout(0);
  const int result = sqlite3_wal_checkpoint_v2(database_.handle(), nullptr,
                                               SQLITE_CHECKPOINT_TRUNCATE, nullptr, nullptr);
  if (!impatient_) database_.setBusyTimeout(kPatienceMilliseconds);
  if (result == SQLITE_OK) logPages_ = 0;
  return result != SQLITE_OK;
}

bool Spool::setAside() {
  insert_ = {};
  // abandon() and not close(): a checkpoint would write into the damaged file.
  database_.abandon();
  const std::string stem = std::string(kSpoolFileName) + ".damaged-" + utcStamp(clock_.now());
  std::string name = stem;
  std::error_code error;
  for (int again = 2; std::filesystem::exists(directory_ + "/" + name, error); ++again) {
    name = stem + "-" + std::to_string(again);  // an earlier damaged spool is evidence, too
  }
  if (error || !renameAll(path_, directory_ + "/" + name)) return false;
  flushDirectory(directory_);
  tesselReporterLog().debug("Spool %@ is damaged: set aside as %@", path_, name);
  figures_.setAside.push_back(name);
  return true;
}

SpoolFailure Spool::classify(const SqliteStatus& status, size_t rowBytes) {
  switch (status.primaryCode()) {
    case SQLITE_BUSY:
    case SQLITE_LOCKED:
      return SpoolFailure::locked;
    case SQLITE_CORRUPT:
    case SQLITE_NOTADB:
      return SpoolFailure::damaged;
    case SQLITE_SCHEMA:
      return SpoolFailure::version;
    case SQLITE_READONLY:
    case SQLITE_CANTOPEN:
    case SQLITE_PERM:
      return SpoolFailure::readOnly;
    case SQLITE_FULL:
      break;
    default:
      return SpoolFailure::other;
  }
  // If the database was never opened, no page limit is set, so the disk must be full.
  if (maxPages_ == 0) return SpoolFailure::diskFull;
  if (logPages_ > maxLogPages_) return SpoolFailure::limit;
  // SQLite has the same code for its page limit and for a full disk. It was the limit if the row
  // would not have fitted below it. A row needs its overflow pages, and up to 8 more where pages of
  // the tree split.
  const int64_t pages = database_.integer("PRAGMA page_count").value_or(0);
  const int64_t needed = static_cast<int64_t>(rowBytes) / kUsualPageSize + 8;
  return pages + needed > maxPages_ ? SpoolFailure::limit : SpoolFailure::diskFull;
}

void Spool::recordFailure(const SqliteStatus& status, size_t rowBytes) {
  const SpoolFailure failure = classify(status, rowBytes);
  if (figures_.failed[static_cast<size_t>(failure)]++ != 0) return;
  if (failure == SpoolFailure::limit) {
    tesselReporterLog().debug(
        "Spool %@ holds %llu bytes, as much as it may: new events are refused", path_, maxBytes_);
  } else {
    tesselReporterLog().debug("Spool %@ does not take events: %@", path_, status.reason);
  }
}

}  // namespace tessel
