// SQLite with its errors as values.
//
// A thin layer: it owns handles and statements and turns result codes into SqliteStatus. It knows
// no SQL of the spool. Those statements are few, and their order matters, so they stand in their
// users.
//
// The file comes from a directory in which other programs may write, so open() trusts neither its
// names nor its content. It looks at the names before SQLite opens them, because opening a pipe for
// reading waits for a writer, and because a device may act on being opened. What remains: whoever
// may write to the directory can swap a file between our look and the opening. That can still make
// a reader wait on a pipe. It cannot lead us to another file, because SQLite follows no link.
// Looking at the open file would close that gap, but SQLite does not give its descriptor away, and
// with a second one of our own we would drop SQLite's locks on closing it.

#include "statora/Sqlite.h"

#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <system_error>
#include <utility>

namespace tessel {

void SqliteStatement::Finalize::operator()(sqlite3_stmt* statement) const {
  sqlite3_finalize(statement);
}

SqliteStatement& SqliteStatement::bind(int parameter, int64_t value) {
  sqlite3_bind_int64(statement_.get(), parameter, value);
  return *this;
}

SqliteStatement& SqliteStatement::bind(int parameter, std::string_view text) {
  // An empty view may hold a null pointer, which SQLite would bind as NULL instead of as ''.
  const char* bytes = text.empty() ? "" : text.data();
  sqlite3_bind_text64(statement_.get(), parameter, bytes, text.size(), SQLITE_STATIC, SQLITE_UTF8);
  return *this;
}

SqliteStatement::Step SqliteStatement::step() {
  switch (sqlite3_step(statement_.get())) {
    case SQLITE_ROW:
      return Step::row;
    case SQLITE_DONE:
      return Step::done;
    default:
      return Step::failed;
  }
}

void SqliteStatement::reset() { sqlite3_reset(statement_.get()); }

bool SqliteStatement::run() {
  Step result = step();
  while (result == Step::row) result = step();
  // A statement that is not reset would keep its transaction, and with it the lock. The reset
  // reports the failure of the step again, so status() still has the reason.
  reset();
  return result == Step::done;
}

int64_t SqliteStatement::value(int column) {
  const int64_t found = step() == Step::row ? integer(column) : 0;
  reset();
  return found;
}

int64_t SqliteStatement::integer(int column) const {
  return sqlite3_column_int64(statement_.get(), column);
}

std::string_view SqliteStatement::text(int column) const {
  const auto* bytes = reinterpret_cast<const char*>(sqlite3_column_text(statement_.get(), column));
  if (bytes == nullptr) return {};
  return {bytes, static_cast<size_t>(sqlite3_column_bytes(statement_.get(), column))};
}

namespace {

// SQLite takes "immutable" only from a URI. The characters %, ? and # have a meaning in a URI, so
// those of the path are escaped.
std::string immutableUri(const std::string& path) {
  std::string uri = "file:";
  for (const char character : path) {
    if (character == '%') {
      uri += "%25";
    } else if (character == '?') {
      uri += "%3f";
    } else if (character == '#') {
      uri += "%23";
    } else {
      uri += character;
    }
  }
  return uri + "?immutable=1";
}

const char* kindWords(mode_t mode) {
  if (S_ISDIR(mode)) return "a directory";
  if (S_ISLNK(mode)) return "a link";
  if (S_ISFIFO(mode)) return "a named pipe";
  return S_ISSOCK(mode) ? "a socket" : "a device";
}

// Why we do not open the database; absent if nothing speaks against it. A missing file is no
// reason: SQLite makes it or says so itself.
std::optional<std::string> refusal(const std::filesystem::path& path) {
  struct stat directory {};
  if (::stat(path.parent_path().c_str(), &directory) != 0) return {};
  // A journal under that name would be played back into the database, so it counts as well.
  for (const char* suffix : {"", "-wal", "-shm", "-journal"}) {
    const std::string name = path.string() + suffix;
    struct stat facts {};
    if (::lstat(name.c_str(), &facts) != 0) continue;
    if (!S_ISREG(facts.st_mode))
      return name + " is " + kindWords(facts.st_mode) + " and not a regular file";
    // The forwarder shares the directory with the service through its group. Whoever opens the
    // database first makes the log and its index, so both may be the forwarder's. In a user
    // namespace its number is hidden from the service, but the group of a file is not.
    const bool shared =
        *suffix != '\0' && (directory.st_mode & S_IWGRP) != 0 && facts.st_gid == directory.st_gid;
    if (facts.st_uid != directory.st_uid && facts.st_uid != 0 && facts.st_uid != ::geteuid() &&
        !shared) {
      return name + " belongs to user " + std::to_string(facts.st_uid) +
             ", who owns neither its directory nor this process";
    }
  }
  return {};
}

// Nothing that a client of the database has put into its schema may act here. Each setting that
// turns something off is there because the schema could otherwise run code of a stranger (triggers,
// views, functions that SQLite calls unsafe) or make us trust a damaged page.
void distrustSchema(sqlite3* handle) {
  constexpr int kOff[] = {SQLITE_DBCONFIG_ENABLE_TRIGGER, SQLITE_DBCONFIG_ENABLE_VIEW,
                          SQLITE_DBCONFIG_TRUSTED_SCHEMA};
  for (const int setting : kOff) sqlite3_db_config(handle, setting, 0, nullptr);
  sqlite3_db_config(handle, SQLITE_DBCONFIG_DEFENSIVE, 1, nullptr);
  sqlite3_exec(handle, "PRAGMA cell_size_check=ON", nullptr, nullptr, nullptr);
  // Far above what our own statements and rows need, far below what could take long or much memory.
  // The longest rows are a few megabytes.
  constexpr struct {
    int limit, value;
  } kLimits[] = {{SQLITE_LIMIT_LENGTH, 64 << 20},  {SQLITE_LIMIT_SQL_LENGTH, 100'000},
                 {SQLITE_LIMIT_COLUMN, 100},       {SQLITE_LIMIT_EXPR_DEPTH, 50},
                 {SQLITE_LIMIT_VDBE_OP, 25'000},   {SQLITE_LIMIT_COMPOUND_SELECT, 10},
                 {SQLITE_LIMIT_FUNCTION_ARG, 10},  {SQLITE_LIMIT_ATTACHED, 0},
                 {SQLITE_LIMIT_TRIGGER_DEPTH, 1},  {SQLITE_LIMIT_VARIABLE_NUMBER, 100},
                 {SQLITE_LIMIT_WORKER_THREADS, 0}, {SQLITE_LIMIT_LIKE_PATTERN_LENGTH, 100}};
  for (const auto& [limit, value] : kLimits) sqlite3_limit(handle, limit, value);
}

}  // namespace

SqliteStatus SqliteDatabase::open(const std::string& path, Mode mode) {
  close();
  // NOFOLLOW refuses a link anywhere in the path. The state directory may well be one, so we
  // resolve the directory, and only the file's own name must be no link.
  std::error_code error;
  std::filesystem::path resolved = std::filesystem::absolute(path, error);
  if (auto directory = std::filesystem::canonical(resolved.parent_path(), error); !error)
    resolved = directory / resolved.filename();
  if (auto reason = refusal(resolved)) return {SQLITE_PERM, std::move(*reason)};
  // No mutex: one thread at a time uses a database.
  int flags = SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE | SQLITE_OPEN_NOFOLLOW;
  if (mode == Mode::readOnly) flags |= SQLITE_OPEN_READONLY;
  if (mode == Mode::readWrite) flags |= SQLITE_OPEN_READWRITE;
  if (mode == Mode::create) flags |= SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE;
  const bool immutable = mode == Mode::immutable;
  if (immutable) flags |= SQLITE_OPEN_READONLY | SQLITE_OPEN_URI;
  const std::string name = immutable ? immutableUri(resolved) : resolved.string();
  const int code = sqlite3_open_v2(name.c_str(), &handle_, flags, nullptr);
  if (code == SQLITE_OK) {
    distrustSchema(handle_);
    return {};
  }
  // A failed open leaves a handle, which holds the reason and must be closed all the same.
  SqliteStatus failure = status();
  failure.code = code;
  close();
  return failure;
}

void SqliteDatabase::close() { sqlite3_close_v2(std::exchange(handle_, nullptr)); }

void SqliteDatabase::abandon() {
  if (handle_ != nullptr) sqlite3_db_config(handle_, SQLITE_DBCONFIG_NO_CKPT_ON_CLOSE, 1, nullptr);
  close();
}

SqliteStatus SqliteDatabase::execute(const std::string& statements) {
  if (sqlite3_exec(handle_, statements.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK) return {};
  return status();
}

SqliteStatement SqliteDatabase::prepare(std::string_view text, bool keptForLong) {
  SqliteStatement prepared;
  sqlite3_stmt* raw = nullptr;
  sqlite3_prepare_v3(handle_, text.data(), static_cast<int>(text.size()),
                     keptForLong ? SQLITE_PREPARE_PERSISTENT : 0, &raw, nullptr);
  prepared.statement_.reset(raw);
  return prepared;
}

std::optional<int64_t> SqliteDatabase::integer(std::string_view query) {
  SqliteStatement statement = prepare(query);
  if (!statement.prepared() || statement.step() != SqliteStatement::Step::row) return {};
  return statement.integer(0);
}

std::optional<std::string> SqliteDatabase::text(std::string_view query) {
  SqliteStatement statement = prepare(query);
  if (!statement.prepared() || statement.step() != SqliteStatement::Step::row) return {};
  return std::string(statement.text(0));
}

// SQLite has no call for this, and a descriptor of our own would not do: closing it would drop the
// locks that SQLite holds on the log's file. So the flush goes through the file that SQLite has
// open. The commits need no more than the log: before SQLite reuses the log from its beginning, a
// checkpoint has moved its pages into the database and has flushed the database.
SqliteStatus SqliteDatabase::flushLog() {
  sqlite3_file* log = nullptr;
  const int asked = sqlite3_file_control(handle_, "main", SQLITE_FCNTL_JOURNAL_POINTER, &log);
  if (asked != SQLITE_OK) return {asked, "the write-ahead log cannot be found"};
  // Without methods the file is not open. Then there is a rollback journal instead of a log, and
  // its commits are on disk already.
  if (log == nullptr || log->pMethods == nullptr) return {};
  const int flushed = log->pMethods->xSync(log, SQLITE_SYNC_NORMAL | SQLITE_SYNC_DATAONLY);
  if (flushed == SQLITE_OK) return {};
  return {flushed, std::string("the write-ahead log cannot be flushed: ") + std::strerror(errno)};
}

SqliteStatus SqliteDatabase::status() const {
  // Opening gives a handle even if it fails, unless there is no memory for the handle.
  if (handle_ == nullptr) return {SQLITE_NOMEM, "out of memory"};
  const int code = sqlite3_extended_errcode(handle_);
  if (code == SQLITE_OK || code == SQLITE_ROW || code == SQLITE_DONE) return {};
  // "disk I/O error" alone helps nobody, so the system's own words follow.
  std::string reason = sqlite3_errmsg(handle_);
  if (const int systemError = sqlite3_system_errno(handle_); systemError != 0) {
    reason.append(" (").append(std::strerror(systemError)).append(")");
  }
  return {code, std::move(reason)};
}

void SqliteDatabase::setBusyTimeout(int milliseconds) {
  sqlite3_busy_timeout(handle_, milliseconds);
}

int64_t SqliteDatabase::changes() const { return sqlite3_changes64(handle_); }

}  // namespace tessel
