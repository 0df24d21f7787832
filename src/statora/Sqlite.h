// SQLite with its errors as values.
//
// Threads: one thread at a time uses a database and its statements. Destroy the statements before
// their database is closed.

#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

struct sqlite3;
struct sqlite3_stmt;

namespace tessel {

// How an operation ended: SQLite's extended result code, 0 for success, and the reason of a failure
// in words.
struct SqliteStatus {
  int code = 0;
  std::string reason;

  bool ok() const { return code == 0; }
  // The code without its extension.
  int primaryCode() const { return code & 0xff; }
};

class SqliteStatement {
 public:
  enum class Step { row, done, failed };

  SqliteStatement() = default;
  bool prepared() const { return statement_ != nullptr; }

  // Parameters count from 1. Text is borrowed until reset(), not copied.
  SqliteStatement& bind(int parameter, int64_t value);
  SqliteStatement& bind(int parameter, std::string_view text);
  Step step();
  // Ends the execution. Bind every parameter anew before the next one.
  void reset();
  // Executes the statement from beginning to end and drops its rows. False if it failed.
  bool run();
  // Executes the statement and answers a column of its first row; 0 if there is none.
  int64_t value(int column = 0);

  // Columns count from 0. Text is valid until the next step() or reset().
  int64_t integer(int column) const;
  std::string_view text(int column) const;

 private:
  friend class SqliteDatabase;
  struct Finalize {
    void operator()(sqlite3_stmt* statement) const;
  };
  std::unique_ptr<sqlite3_stmt, Finalize> statement_;
};

class SqliteDatabase {
 public:
  // `immutable` reads the file as it stands, without its write-ahead log, and makes no files beside
  // it. It serves a user without write permission, and is right only while nobody writes.
  enum class Mode { readOnly, readWrite, create, immutable };

  SqliteDatabase() = default;
  SqliteDatabase(const SqliteDatabase&) = delete;
  SqliteDatabase& operator=(const SqliteDatabase&) = delete;
  ~SqliteDatabase() { close(); }

  // Opens without waiting for anybody. Fails with SQLITE_PERM if one of the files under these names
  // is no regular file or belongs to a stranger; the reason names the file. A stranger is any user
  // but root, this process' own and the owner of the directory. The write-ahead log and its index
  // may also belong to a member of the group that may write to the directory.
  //
  // A trigger or a view in the database never runs, and nothing in its schema is trusted.
  SqliteStatus open(const std::string& path, Mode mode);
  bool isOpen() const { return handle_ != nullptr; }
  void close();
  // Closes without a checkpoint, so that every file stays as it is.
  void abandon();

  // Runs several statements and drops their rows.
  SqliteStatus execute(const std::string& statements);
  // prepared() is false if this fails; status() then says why. `keptForLong` tells SQLite that the
  // statement will run many times.
  SqliteStatement prepare(std::string_view text, bool keptForLong = false);
  // The first column of the first row. Absent if there is no row or the query failed.
  std::optional<int64_t> integer(std::string_view query);
  std::optional<std::string> text(std::string_view query);

  // Makes every commit that this database has seen survive a power cut, whoever made it: one
  // fdatasync of the write-ahead log. Without it, synchronous=NORMAL leaves commits to the kernel.
  // REQUIRES: this database has read or written since it was opened, which opens its log.
  SqliteStatus flushLog();

  // How the last operation on this database ended.
  SqliteStatus status() const;
  // How long an operation may wait for another client's lock.
  void setBusyTimeout(int milliseconds);
  // How many rows the last INSERT or DELETE changed.
  int64_t changes() const;
  sqlite3* handle() const { return handle_; }

 private:
  sqlite3* handle_ = nullptr;
};

}  // namespace tessel
