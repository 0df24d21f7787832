// SQLite with its errors as values.
//
// A thin layer: it owns handles and statements and turns result codes into SqliteStatus. It knows
// no SQL of the spool. Those statements are few, and their order matters, so they stand in their
// users.

#include "statora/Sqlite.h"

#include <sqlite3.h>

#include <cerrno>
#include <cstring>
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

}  // namespace

SqliteStatus SqliteDatabase::open(const std::string& path, Mode mode) {
  close();
  // No mutex: one thread at a time uses a database.
  int flags = SQLITE_OPEN_NOMUTEX | SQLITE_OPEN_EXRESCODE;
  if (mode == Mode::readOnly) flags |= SQLITE_OPEN_READONLY;
  if (mode == Mode::readWrite) flags |= SQLITE_OPEN_READWRITE;
  if (mode == Mode::create) flags |= SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE;
  const bool immutable = mode == Mode::immutable;
  if (immutable) flags |= SQLITE_OPEN_READONLY | SQLITE_OPEN_URI;
  const std::string name = immutable ? immutableUri(path) : path;
  const int code = sqlite3_open_v2(name.c_str(), &handle_, flags, nullptr);
  if (code == SQLITE_OK) return {};
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
