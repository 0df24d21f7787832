// Schema of the spool and its upgrades; storing events durably, and what to do where that fails.

#include "statora/Spool.h"

#include <fcntl.h>
#include <sqlite3.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <iterator>
#include <utility>

#include "os/DurableFile.h"
#include "os/UniqueFd.h"
#include "platform/Log.h"
#include "platform/Text.h"

namespace tessel {

namespace {

// Step N brings a spool of version N to version N + 1. Steps only add.
constexpr const char* kUpgrades[] = {
    "CREATE TABLE events(id INTEGER PRIMARY KEY AUTOINCREMENT, time INTEGER NOT NULL,"
    " name TEXT NOT NULL, payload TEXT NOT NULL);"
    "CREATE TABLE meta(key TEXT PRIMARY KEY, value TEXT NOT NULL) WITHOUT ROWID;"
    "INSERT INTO meta VALUES('spool_id', lower(hex(randomblob(16))));",
};
static_assert(std::size(kUpgrades) == kSpoolSchemaVersion);

SqliteStatus upgrade(SqliteDatabase& database) {
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

// SQLite makes files that the group cannot write, as which the forwarder comes; the files that it
// adds later have the mode of this one. Closed before SQLite opens it: closing a file gives up
// every lock that the process has on it.
void makeFile(const std::string& path) {
  const UniqueFd made(::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0660));
}

SqliteStatus prepareSchema(SqliteDatabase& database) {
  const auto version = database.integer("PRAGMA user_version");
  if (!version) return database.status();
  if (*version == kSpoolSchemaVersion) return {};
  if (*version > kSpoolSchemaVersion || *version < 0) {
    return {SQLITE_SCHEMA, "made by another version (schema " + std::to_string(*version) + ")"};
  }
  // Space of delivered rows can be given back in steps only where this is set before the first
  // table.
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
  if (!status.ok()) database.abandon();
  return status;
}

namespace {

// How long the reporting queue may be held for another client's lock. The forwarder and readers
// hold theirs for a fraction of it. Where it was not enough, nobody waits again until a send works.
constexpr int kPatienceMilliseconds = 250;
// Pages in the write-ahead log from which on its contents are moved into the database.
constexpr int kCheckpointPages = 1000;
constexpr uint64_t kLogShare = 16;

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

// Failures after which the connection itself is not trusted any more.
bool needsReopening(const SqliteStatus& status) {
  return status.primaryCode() == SQLITE_IOERR || status.primaryCode() == SQLITE_READONLY ||
         status.primaryCode() == SQLITE_CANTOPEN;
}

// Names the damaged database and its companions anew; the write-ahead log goes first, so that it
// is never found beside a database that it does not belong to.
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
  const int64_t time = clock_.now().time_since_epoch().count();
  const std::string text = payloadJson(payload);
  const std::string validName = replaceInvalidUtf8(name);
  SqliteStatus status = store(validName, text, time);
  if (isDamage(status) && figures_.setAside.empty() && setAside())
    status = store(validName, text, time);
  if (status.ok()) {
    ++figures_.stored;
    return true;
  }
  recordFailure(status, validName.size() + text.size());
  if (needsReopening(status)) close();
  return false;
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
  std::error_code ignored;  // opening the database says it better
  std::filesystem::create_directories(directory_, ignored);
  SqliteStatus status = openSpoolDatabase(database_, path_, impatient_ ? 0 : kPatienceMilliseconds);
  if (!status.ok()) return status;
  const int64_t pageSize = database_.integer("PRAGMA page_size").value_or(4096);
  maxLogPages_ = std::max<int64_t>(static_cast<int64_t>(maxBytes_ / kLogShare) / pageSize, 16);
  maxPages_ = std::max<int64_t>(static_cast<int64_t>(maxBytes_) / pageSize - maxLogPages_, 1);
  // A limit below what the database holds already has no effect in SQLite but to stop its growth.
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

// Called by SQLite after each commit, with what the write-ahead log then holds.
int Spool::afterCommit(void* spool, sqlite3* handle, const char* schema, int logPages) {
  static_cast<Spool*>(spool)->logPages_ = logPages;
  if (logPages >= std::min<int64_t>(kCheckpointPages, static_cast<Spool*>(spool)->maxLogPages_)) {
    sqlite3_wal_checkpoint_v2(handle, schema, SQLITE_CHECKPOINT_PASSIVE, nullptr, nullptr);
  }
  return SQLITE_OK;
}

// A client that never ends its read transaction keeps the log growing, several pages an event.
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
  database_.abandon();
  const std::string stem = std::string(kSpoolFileName) + ".damaged-" + utcStamp(clock_.now());
  std::string name = stem;
  std::error_code error;
  for (int again = 2; std::filesystem::exists(directory_ + "/" + name, error); ++again) {
    name = stem + "-" + std::to_string(again);
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
  if (maxPages_ == 0) return SpoolFailure::diskFull;  // while it is opened, no limit is set yet
  if (logPages_ > maxLogPages_) return SpoolFailure::limit;
  // SQLite says "full" of its own page limit and of the disk alike. The row, its overflow pages and
  // the tree above it would not have fitted: then it was the limit.
  const int64_t pages = database_.integer("PRAGMA page_count").value_or(0);
  const int64_t needed = static_cast<int64_t>(rowBytes / 4096) + 8;
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
