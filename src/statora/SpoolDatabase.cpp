// Schema of the spool and its upgrades.

#include "statora/SpoolDatabase.h"

#include <fcntl.h>
#include <sqlite3.h>

#include <iterator>

#include "os/UniqueFd.h"

#include "os/UniqueFd.h"

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

// SQLite would give the group no leave to write, and the forwarder works as a member of it. Only a
// file that is new is opened: closing another descriptor of a database drops this process's locks.
void makeFileForGroup(const std::string& path) {
  const UniqueFd made(::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0660));
}

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
  makeFileForGroup(path);
  makeFile(path);
  SqliteStatus status = database.open(path, SqliteDatabase::Mode::create);
  if (!status.ok()) return status;
  database.setBusyTimeout(busyTimeoutMilliseconds);
  status = prepareSchema(database);
  if (!status.ok()) database.abandon();
  return status;
}

}  // namespace tessel
