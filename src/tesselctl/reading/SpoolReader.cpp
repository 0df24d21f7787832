// Reading the spool beside the service.
//
// A database with a write-ahead log needs an index file beside it, which even a reader must be able
// to make. A user who may only read would therefore see nothing. For such a user we open the
// database as immutable, which needs no index. An immutable database ignores the log, and rows in
// it would be missing without a word. So we do this only if the log is empty or absent.

#include "tesselctl/reading/SpoolReader.h"

#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>

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
  const int code = status.primaryCode();
  return code == SQLITE_CANTOPEN || code == SQLITE_PERM || code == SQLITE_READONLY;
}

}  // namespace

SpoolReader::SpoolReader(const std::string& stateDirectory)
    : path_(stateDirectory + "/" + kSpoolFileName) {}

// The service sets a damaged spool aside by renaming it. Our database would still be the old one.
bool SpoolReader::sameFile() const {
  struct stat facts {};
  return ::stat(path_.c_str(), &facts) == 0 && facts.st_dev == device_ && facts.st_ino == inode_;
}

SpoolReader::State SpoolReader::open() {
  if (database_.isOpen() && sameFile()) return State::open;
  database_.close();
  lastId_ = 0;
  const UniqueFd file(::open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  struct stat facts {};
  if (!file.valid() || ::fstat(file.get(), &facts) != 0) {
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

SpoolReader::State SpoolReader::openDatabase() {
  SqliteStatus status = database_.open(path_, SqliteDatabase::Mode::readOnly);
  if (status.ok()) {
    database_.setBusyTimeout(kBusyMilliseconds);
    // Opening reads nothing yet. Only a query shows whether this is a spool.
    if (database_.integer("SELECT count(*) FROM (SELECT 1 FROM events LIMIT 1)"))
      return State::open;
    status = database_.status();
    database_.close();
  }
  // An empty log, or none, means that the database itself holds every row.
  if (forbids(status) && sizeOf(path_ + "-wal") == 0) {
    status = database_.open(path_, SqliteDatabase::Mode::immutable);
    if (status.ok() && database_.integer("SELECT count(*) FROM (SELECT 1 FROM events LIMIT 1)"))
      return State::open;
    if (status.ok()) status = database_.status();
    database_.close();
  }
  reason_ = path_ + ": " + status.reason;
  return forbids(status) ? State::noAccess : State::damaged;
}

bool SpoolReader::readNew(const std::function<bool(const SpoolRow&)>& visit) {
  SqliteStatement rows =
      database_.prepare("SELECT id, time, name, payload FROM events WHERE id > ?1 ORDER BY id");
  if (rows.prepared()) {
    rows.bind(1, lastId_);
    for (;;) {
      const SqliteStatement::Step step = rows.step();
      if (step == SqliteStatement::Step::done) return true;
      if (step == SqliteStatement::Step::failed) break;
      const SpoolRow row{rows.integer(0), rows.integer(1), rows.text(2), rows.text(3)};
      // We note the row before the visitor sees it. A visitor that ends the reading has had this
      // row, so the next call starts behind it.
      lastId_ = row.id;
      if (!visit(row)) return true;
    }
  }
  reason_ = path_ + ": " + database_.status().reason;
  return false;
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
  return contents;
}

}  // namespace tessel::ctl
