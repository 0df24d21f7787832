// SqliteDatabase and SqliteStatement: SQLite with its errors as values.
//
// Threads: a database and its statements are used by one thread at a time. Statements must be gone
// before their database is closed.

#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

struct sqlite3;
struct sqlite3_stmt;

namespace tessel {

// What an operation came to: SQLite's extended result code, and where it failed the reason in
// words.
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

  // Parameters count from 1. Text and blobs are borrowed until reset().
  SqliteStatement& bind(int parameter, int64_t value);
  SqliteStatement& bind(int parameter, std::string_view text);
  Step step();
  // Ends the execution; the parameters stay bound and must be bound anew before the next one.
  void reset();
  // One whole execution of a statement that yields no rows of interest.
  bool run();

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
  // immutable: read as it stands, with no look at a write-ahead log and without the files that
  // other modes make beside it; for one who may only read, while nobody writes.
  enum class Mode { readOnly, readWrite, create, immutable };

  SqliteDatabase() = default;
  SqliteDatabase(const SqliteDatabase&) = delete;
  SqliteDatabase& operator=(const SqliteDatabase&) = delete;
  ~SqliteDatabase() { close(); }

  SqliteStatus open(const std::string& path, Mode mode);
  bool isOpen() const { return handle_ != nullptr; }
  void close();
  // Closes and leaves every file as it is: nothing is moved from the write-ahead log.
  void abandon();

  // Runs statements that yield no rows of interest.
  SqliteStatus execute(const std::string& statements);
  // Not prepared() where it failed: see status().
  SqliteStatement prepare(std::string_view text, bool keptForLong = false);
  // The first column of the first row; nothing where there is none or it failed.
  std::optional<int64_t> integer(std::string_view query);
  std::optional<std::string> text(std::string_view query);

  // How the last operation on this database ended.
  SqliteStatus status() const;
  // How long an operation may wait for another client's lock.
  void setBusyTimeout(int milliseconds);
  int64_t changes() const;
  sqlite3* handle() const { return handle_; }

 private:
  sqlite3* handle_ = nullptr;
};

}  // namespace tessel
