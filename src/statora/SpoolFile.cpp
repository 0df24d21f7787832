// The spool as a file: its schema, and renaming a damaged one.

#include "statora/SpoolFile.h"

#include <sqlite3.h>

#include <ctime>
#include <filesystem>
#include <iterator>

#include "os/Files.h"

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

// Whether the tables are those that the service made. Whoever may write to the spool can change
// them. A further column that must not be null, a CHECK, a unique index, or a count of ids that is
// at its end would then refuse every row, run after run. SQLite keeps the text of each statement
// that made something, so we compare that text, without its spaces. Nothing else that stands in the
// schema acts on our rows: triggers and views are turned off.
constexpr char kIsOurs[] =
    "SELECT count(*) = 2"
    " AND NOT EXISTS (SELECT 1 FROM sqlite_schema WHERE type='index' AND sql IS NOT NULL"
    "  AND tbl_name IN ('events', 'meta'))"
    " AND EXISTS (SELECT 1 FROM meta WHERE key='spool_id' AND length(value) = 32)"
    " AND (SELECT coalesce(max(id), 0) FROM events) < (1 << 62)"
    " AND (SELECT coalesce(max(seq), 0) FROM sqlite_sequence WHERE name='events') < (1 << 62)"
    " FROM sqlite_schema WHERE type='table' AND name IN ('events', 'meta')"
    " AND instr(replace(?1, ' ', ''), replace(replace(sql, ' ', ''), char(10), '') || ';') <> 0";

SqliteStatus checkShape(SqliteDatabase& database) {
  SqliteStatement query = database.prepare(kIsOurs);
  if (query.prepared() &&
      query.bind(1, std::string_view(kUpgrades[0])).step() == SqliteStatement::Step::row &&
      query.integer(0) == 1) {
    return {};
  }
  const SqliteStatus failed = database.status();
  // The query is right, so an error of the plain kind means that a table it names is missing or is
  // no table.
  if (!failed.ok() && failed.primaryCode() != SQLITE_ERROR) return failed;
  return {SQLITE_CORRUPT, "its tables are not those that the service made"};
}

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
  // Another client may have turned the write-ahead log off. For a spool that has one this does
  // nothing.
  if (*version == kSpoolSchemaVersion) {
    SqliteStatus status = database.execute("PRAGMA journal_mode=WAL");
    return status.ok() ? checkShape(database) : status;
  }
  if (*version > kSpoolSchemaVersion || *version < 0) {
    return {SQLITE_SCHEMA, "made by another version (schema " + std::to_string(*version) + ")"};
  }
  // auto_vacuum lets the forwarder give the space of delivered rows back in small steps. It can
  // only be set before the first table exists, so it comes first.
  SqliteStatus status = database.execute("PRAGMA auto_vacuum=INCREMENTAL; PRAGMA journal_mode=WAL");
  return status.ok() ? upgrade(database) : status;
}

}  // namespace

// A newer service may only have added to the spool. It then says in `compatible_from` the oldest
// version that still finds its way. Without that word a newer spool may mean anything, and sending
// rows that we do not understand cannot be taken back.
bool isUnderstoodSpool(SqliteDatabase& database, int64_t version) {
  if (version <= kSpoolSchemaVersion) return version == kSpoolSchemaVersion;
  const auto oldest = database.integer("SELECT value FROM meta WHERE key='compatible_from'");
  return oldest && *oldest >= 1 && *oldest <= kSpoolSchemaVersion;
}

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

std::string utcStamp(Date date) {
  const std::time_t seconds =
      std::chrono::duration_cast<std::chrono::seconds>(date.time_since_epoch()).count();
  std::tm parts{};
  gmtime_r(&seconds, &parts);
  char text[32];
  return {text, std::strftime(text, sizeof text, "%Y%m%dT%H%M%SZ", &parts)};
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

std::optional<std::string> setSpoolAside(const std::string& stateDirectory, Date now) {
  const std::string stem = std::string(kSpoolFileName) + ".damaged-" + utcStamp(now);
  std::string name = stem;
  std::error_code error;
  for (int again = 2; std::filesystem::exists(stateDirectory + "/" + name, error); ++again) {
    name = stem + "-" + std::to_string(again);  // an earlier damaged spool is evidence, too
  }
  const std::string path = stateDirectory + "/" + kSpoolFileName;
  if (error || !renameAll(path, stateDirectory + "/" + name)) return {};
  flushDirectory(stateDirectory);
  return name;
}

const char* spoolFailureName(SpoolFailure failure) {
  constexpr const char* kNames[kSpoolFailureKinds] = {
      "limit",   "disk_full", "read_only",   "locked",    "damaged",
      "version", "other",     "buffer_full", "run_share", "held_by_reader"};
  return kNames[static_cast<size_t>(failure)];
}

}  // namespace tessel
