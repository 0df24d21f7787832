// The rows of the spool: those that wait for delivery and those that a collector has taken.
//
//   events               what waits, in the order of sending
//   forwarder_delivered  what was delivered, in the order of delivery. It stays readable for a
//                        while, so that people can see what has left the machine.
//
// A delivered row is a copy for people; nobody sends it again. So it gives way first: to new rows,
// to the limit of the spool, and to a full disk.

#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/System.h"
#include "statora/Sqlite.h"

namespace tessel {

struct SpoolLimits {
  uint64_t bytes = uint64_t{1} << 30;  // of the database and its write-ahead log together
  std::chrono::days days{30};          // how long a row may stay; zero: for ever
};

// The limits that the service last worked with. It writes them into the spool, because the
// forwarder has settings of its own and must keep to the same limits. Without them the answer is
// the least limit that the service takes.
SpoolLimits readSpoolLimits(SqliteDatabase& database);
// Writes them if others stand there.
SqliteStatus writeSpoolLimits(SqliteDatabase& database, const SpoolLimits& limits);

inline constexpr int64_t kSpoolPageBytes = 4096;
// Pages of the log after which it is moved into the database.
int64_t checkpointPages(uint64_t limitBytes);

// Bytes of pages that rows of this length take one after another. A page holds as many short rows
// as fit; a long row has pages of its own.
uint64_t spaceOfRow(size_t textBytes);

struct SpooledEvent {
  int64_t id = 0;
  int64_t time = 0;  // microseconds since 1970
  std::string name;
  std::string payload;  // a JSON object, unless somebody tampered with the spool
};

// The oldest rows with an id above `after`: up to `maxRows` rows, or until they hold `maxBytes`,
// but one row at least. `select` is a prepared kSelectEvents. It is closed again before this
// returns, because no checkpoint can empty the log while a statement stands open. So whoever prints
// or sends rows does that between two calls. After an error the rows before it are answered, and
// the status of the database has the reason.
std::vector<SpooledEvent> readEvents(SqliteStatement& select, int64_t after, size_t maxRows,
                                     size_t maxBytes);
inline constexpr char kSelectEvents[] =
    "SELECT id, time, name, payload FROM events WHERE id > ?1 ORDER BY id LIMIT ?2";

// A delivered row. The id of the event is 0 for a record that the forwarder itself has made.
struct DeliveredEvent {
  int64_t number = 0;  // in the order of delivery; never given twice
  int64_t at = 0;      // when the collector took it, in microseconds since 1970
  std::string destination;
  SpooledEvent event;
};

// Like readEvents(), for delivered rows with a number above `after`.
std::vector<DeliveredEvent> readDelivered(SqliteStatement& select, int64_t after, size_t maxRows,
                                          size_t maxBytes);
inline constexpr char kSelectDelivered[] =
    "SELECT number, id, time, name, payload, delivered, destination FROM forwarder_delivered"
    " WHERE number > ?1 ORDER BY number LIMIT ?2";

// The table of delivered rows, as the forwarder fills it and both programs shorten it.
//
// Threads: one at a time.
class DeliveredRows {
 public:
  // How long a row stays after its delivery.
  static constexpr std::chrono::days kDays{7};
  static constexpr uint64_t kMostBytes = uint64_t{64} << 20;

  explicit DeliveredRows(SqliteDatabase& database) : database_(database) {}

  // Makes the table if it is missing, and opens it.
  SqliteStatus make();
  // False if there is no such table, or if it is not the one that make() makes. Then nothing is
  // kept, and the operations below do nothing.
  bool open();
  bool isOpen() const { return removeExpired_.prepared(); }
  void close();

  // Bytes of the pages that the rows take, by spaceOfRow().
  uint64_t bytes();
  // Bytes that the rows may take where the rest of the database has `othersBytes`.
  static uint64_t allowance(const SpoolLimits& limits, uint64_t othersBytes);

  // Adds rows as delivered at `at`. REQUIRES: a transaction. False if it failed.
  bool add(std::span<const SpooledEvent* const> rows, std::string_view destination, Date at);
  // Removes the oldest rows, about `bytes` bytes of pages and one row at least. Answers how many;
  // absent if it failed.
  std::optional<int64_t> removeOldest(uint64_t bytes);

  // A search for rows past their days.
  struct Search {
    int64_t delivered = 0;  // microseconds since 1970; a row that was delivered before is removed
    int64_t time = 0;       // the same for the time of the event
    int64_t rows = 0;       // to look at behind the last expired one; negative: all
    int64_t from = 0;       // number of the next row to look at
  };
  static Search searchAt(Date now, const SpoolLimits& limits, int64_t rows);
  // Removes the next expired rows, in a transaction of its own. False if there are no more.
  bool removeExpired(Search& search);

 private:
  SqliteDatabase& database_;
  SqliteStatement insert_, first_, last_, removeOldest_, findExpired_, removeExpired_;
};

}  // namespace tessel
