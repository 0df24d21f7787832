// The sending side of the spool: a buffer, and a queue that empties it into the database.
//
// The choice. A send must not wait for the disk, because the reading of the journal waits for it in
// turn: on a disk that needs 40 ms for a flush, a run would take hours, or its events would pile up
// in memory. So a send only encodes the event and puts it into a bounded buffer. The queue inserts
// whatever is there in one transaction, so that a slow disk gets fewer and longer transactions. How
// rows become safe stands in SpoolDatabase.cpp.
//
// The price: a row in the buffer is lost if the process is killed or interrupted, and what became
// of a send is known only at the end of the run. On a disk that keeps up, a row is in the buffer
// for about a millisecond. A timer lives as long as the process, so a process that stays wakes up
// once a second, finds nothing to flush, and sleeps again.
//
// What was discarded. A transaction and a flush for each send tie the run to the slowest disk. A
// buffer without bound ends in a kill for memory. A file of our own between buffer and database
// would have to be flushed as well.

#include "statora/Spool.h"

#include <sqlite3.h>

#include <deque>
#include <mutex>
#include <numeric>
#include <span>
#include <utility>

#include "platform/Invariant.h"
#include "platform/Log.h"
#include "platform/Text.h"

namespace tessel {

namespace {

// The buffer may hold so much text. A run sends at most 80 rows a second, usually of 410 bytes: a
// buffer for eight minutes. With the longest rows it lasts for 1.6 seconds.
constexpr size_t kBufferBytes = size_t{16} << 20;
// A transaction takes at most so many rows, and ends with the row that exceeds so many bytes. Other
// clients wait for the lock meanwhile, and what fails with it is tried again row by row.
constexpr size_t kRowsOfTransaction = 64;
constexpr size_t kBytesOfTransaction = size_t{256} << 10;

constexpr std::chrono::seconds kFlushInterval{1};
constexpr std::string_view kCheckpointFailed = "a checkpoint could not be flushed";

// The end of a run waits so long for another client's lock. The forwarder holds its locks for a
// small part of that.
constexpr std::chrono::seconds kLastPatience{2};

uint64_t ticksOf(std::chrono::nanoseconds time, Timebase base) {
  return static_cast<uint64_t>(time.count()) * base.denominator / base.numerator;
}

bool isLocked(const SqliteStatus& status) {
  return status.primaryCode() == SQLITE_BUSY || status.primaryCode() == SQLITE_LOCKED;
}

bool isDamage(const SqliteStatus& status) {
  return status.primaryCode() == SQLITE_CORRUPT || status.primaryCode() == SQLITE_NOTADB;
}

// After these errors the file may have changed below SQLite, which would still answer from its
// cache. So the next transaction opens the database anew.
bool needsReopening(const SqliteStatus& status) {
  return status.primaryCode() == SQLITE_IOERR || status.primaryCode() == SQLITE_READONLY ||
         status.primaryCode() == SQLITE_CANTOPEN;
}

SpoolFailure classify(const SqliteStatus& status) {
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
      return SpoolFailure::diskFull;
    default:
      return SpoolFailure::other;
  }
}

// Why a row was refused before SQLite was asked.
std::string_view refusalWords(SpoolFailure failure) {
  switch (failure) {
    case SpoolFailure::bufferFull:
      return "the disk is too slow, and the buffer is full";
    case SpoolFailure::runShare:
      return "this run has stored as much as one run may";
    case SpoolFailure::heldByReader:
      return "a reader keeps the write-ahead log from being emptied";
    default:
      return "it holds as much as it may";
  }
}

}  // namespace

// What the sending thread and the writer's queue share. sendEvent() and endRun() of the spool call
// it on the reporting queue; everything else runs on the writer's queue.
class Spool::Writer : public std::enable_shared_from_this<Writer> {
 public:
  Writer(std::string stateDirectory, SpoolLimits limits, Clock& clock, ServiceStatus& status,
         std::shared_ptr<SerialQueue> queue)
      : database_(std::move(stateDirectory), limits),
        clock_(clock),
        status_(status),
        queue_(std::move(queue)),
        flushTicks_(ticksOf(kFlushInterval, clock.timebase())),
        flushedAt_(clock.continuousTicks()) {}

  // On the reporting queue.
  uint64_t beginRun();
  bool take(PendingRow row);
  SpoolFigures endRun();
  // On the writer's queue, once a second.
  void tick();

 private:
  void insertNew();
  bool insertAll();
  bool takeBatch();
  bool insertBatch();
  SqliteStatus insert(std::span<PendingRow> rows);
  void settle(const PendingRow& row);
  void fail(const PendingRow& row, SpoolFailure failure, std::string_view reason);
  void count(SpoolFailure failure, uint64_t rows, std::string_view reason);
  void flush();
  void countRowsAtRisk(std::string_view reason);
  void giveUp();
  void finishRun();

  SpoolDatabase database_;
  Clock& clock_;
  ServiceStatus& status_;
  const std::shared_ptr<SerialQueue> queue_;
  const uint64_t flushTicks_;  // ticks of the clock between two flushes

  std::mutex mutex_;  // for the members up to the blank line
  std::deque<PendingRow> buffer_;
  size_t bufferedBytes_ = 0;  // of the buffer and of the batch
  bool awaited_ = false;      // insertNew() is queued, or the rows wait for tick()
  bool gathering_ = false;    // they wait until they fill a transaction, if that is sooner
  uint64_t sent_ = 0;
  uint64_t bufferFull_ = 0;

  std::vector<PendingRow> batch_;  // rows of the buffer that are being inserted
  uint64_t flushedAt_ = 0;         // in ticks of the clock
  SpoolFigures figures_;
};

bool Spool::Writer::take(PendingRow row) {
  const std::lock_guard lock(mutex_);
  ++sent_;
  // The rows of the summary are few, and they may exceed the bound.
  if (row.rank == EventRank::object && bufferedBytes_ + row.textBytes() > kBufferBytes) {
    if (bufferFull_++ == 0) {
      tesselReporterLog().debug("Spool %@ does not take events: %@", database_.path(),
                                refusalWords(SpoolFailure::bufferFull));
    }
    return false;
  }
  bufferedBytes_ += row.textBytes();
  if (!buffer_.empty() && *buffer_.back().payload == *row.payload)
    row.payload = buffer_.back().payload;
  buffer_.push_back(std::move(row));
  const bool gathered = gathering_ && bufferedBytes_ >= kBytesOfTransaction;
  if (gathered) gathering_ = false;
  if (!std::exchange(awaited_, true) || gathered)
    queue_->async([self = shared_from_this()] { self->insertNew(); });
  return true;
}

void Spool::Writer::insertNew() {
  {
    const std::lock_guard lock(mutex_);
    // Each transaction makes a log that is held longer by a few pages, so there are fewer. Rows
    // that fill a transaction would gain nothing by waiting.
    gathering_ = database_.logIsHeld() && bufferedBytes_ < kBytesOfTransaction;
    if (gathering_) return;
    awaited_ = false;
  }
  insertAll();
}

// Inserts what waits. False if another client has the database locked; the rest then waits for the
// next tick. While rows come as fast as they are inserted, the loop does not end and no tick gets
// its turn. So the loop flushes, too.
bool Spool::Writer::insertAll() {
  while (takeBatch()) {
    if (insertBatch()) {
      if (clock_.continuousTicks() - flushedAt_ >= flushTicks_) flush();
      continue;
    }
    const std::lock_guard lock(mutex_);
    awaited_ = true;
    return false;
  }
  return true;
}

// False if there is nothing to insert.
bool Spool::Writer::takeBatch() {
  const std::lock_guard lock(mutex_);
  size_t bytes = 0;
  // Rows that a lock has kept out are first.
  while (!buffer_.empty() && batch_.size() < kRowsOfTransaction && bytes < kBytesOfTransaction) {
    bytes += buffer_.front().textBytes();
    batch_.push_back(std::move(buffer_.front()));
    buffer_.pop_front();
  }
  return !batch_.empty();
}

// Deals with all rows of the batch, except where another client has the database locked.
bool Spool::Writer::insertBatch() {
  SqliteStatus status = insert(batch_);
  if (isLocked(status)) return false;
  if (status.ok()) {
    for (const PendingRow& row : batch_) settle(row);
    batch_.clear();
    countRowsAtRisk(kCheckpointFailed);
    return true;
  }
  // One row may fail where the others do not, so each gets a transaction of its own.
  while (!batch_.empty()) {
    status = insert({batch_.data(), 1});
    if (isLocked(status)) return false;
    if (status.ok()) {
      settle(batch_.front());
      countRowsAtRisk(kCheckpointFailed);
    } else {
      fail(batch_.front(), classify(status), status.reason);
    }
    batch_.erase(batch_.begin());
  }
  return true;
}

SqliteStatus Spool::Writer::insert(std::span<PendingRow> rows) {
  SqliteStatus status = database_.insert(rows);
  if (isDamage(status) && figures_.setAside.empty()) {
    flush();
    if (const auto name = database_.setAside(clock_.now())) {
      tesselReporterLog().debug("Spool %@ is damaged: set aside as %@", database_.path(), *name);
      figures_.setAside.push_back(*name);
      status = database_.insert(rows);
    }
  }
  if (needsReopening(status)) {
    flush();
    database_.close();
  }
  return status;
}

void Spool::Writer::settle(const PendingRow& row) {
  if (row.refused) {
    fail(row, *row.refused, refusalWords(*row.refused));
    return;
  }
  ++figures_.stored;
  status_.progress();
  const std::lock_guard lock(mutex_);
  bufferedBytes_ -= row.textBytes();
}

void Spool::Writer::fail(const PendingRow& row, SpoolFailure failure, std::string_view reason) {
  count(failure, 1, reason);
  status_.progress();
  const std::lock_guard lock(mutex_);
  bufferedBytes_ -= row.textBytes();
}

void Spool::Writer::count(SpoolFailure failure, uint64_t rows, std::string_view reason) {
  const auto kind = static_cast<size_t>(failure);
  if (figures_.failed[kind] == 0) {
    tesselReporterLog().debug("Spool %@ does not take events: %@", database_.path(), reason);
  }
  figures_.failed[kind] += rows;
}

void Spool::Writer::flush() {
  const SqliteStatus status = database_.flush();
  flushedAt_ = clock_.continuousTicks();
  countRowsAtRisk(status.reason);
}

void Spool::Writer::countRowsAtRisk(std::string_view reason) {
  const uint64_t rows = database_.takeRowsAtRisk();
  if (rows == 0) return;
  // They were counted as stored when they were inserted. The rows of a transaction may be among
  // them if its own checkpoint failed, so the caller has settled these first.
  TESSEL_INVARIANT(figures_.stored >= rows);
  figures_.stored -= rows;
  count(SpoolFailure::other, rows, reason);
}

void Spool::Writer::tick() {
  {
    const std::lock_guard lock(mutex_);
    awaited_ = false;
  }
  database_.retryHeldLog();
  insertAll();
  flush();
}

uint64_t Spool::Writer::beginRun() {
  uint64_t bytes = 0;
  queue_->sync([this, &bytes] { bytes = database_.bytesForObjects(); });
  return bytes;
}

SpoolFigures Spool::Writer::endRun() {
  SpoolFigures ended;
  queue_->sync([this, &ended] {
    finishRun();
    ended = std::exchange(figures_, {});
  });
  // The run's record accounts for every send, so none may be missing or counted twice.
  TESSEL_INVARIANT(ended.stored +
                       std::accumulate(ended.failed.begin(), ended.failed.end(), uint64_t{0}) ==
                   ended.sent);
  return ended;
}

void Spool::Writer::finishRun() {
  database_.setPatience(kLastPatience);
  if (!insertAll()) giveUp();
  {
    const std::lock_guard lock(mutex_);
    constexpr auto kKind = static_cast<size_t>(SpoolFailure::bufferFull);
    figures_.sent = std::exchange(sent_, 0);
    figures_.failed[kKind] = std::exchange(bufferFull_, 0);
    awaited_ = false;
  }
  figures_.expired = database_.expire(clock_.now(), [this] { status_.progress(); });
  flush();
  database_.close();
  database_.endRun();
}

void Spool::Writer::giveUp() {
  database_.setPatience(std::chrono::milliseconds{0});  // nor does what follows wait once more
  do {
    for (const PendingRow& row : batch_) fail(row, SpoolFailure::locked, "database is locked");
    batch_.clear();
  } while (takeBatch());
}

Spool::Spool(std::string stateDirectory, SpoolLimits limits, Clock& clock, ServiceStatus& status,
             std::shared_ptr<SerialQueue> writer, QueueFactory& timers)
    : clock_(clock),
      writer_(std::make_shared<Writer>(std::move(stateDirectory), limits, clock, status, writer)),
      flushTimer_(timers.makeRepeatingTimer(
          std::move(writer), kFlushInterval, std::chrono::nanoseconds{0},
          // The timer goes on for as long as the process lives, and the spool may not.
          [weak = std::weak_ptr(writer_)] {
            if (const auto alive = weak.lock()) alive->tick();
          })) {}

bool Spool::sendEvent(std::string_view name, const Payload& payload, EventRank rank) {
  // A process that sends nothing needs no timer. Resuming it again does nothing.
  flushTimer_->resume();
  const std::string text = payloadJson(payload);
  // A copy has no spare room behind its text, which the encoder's string has.
  return writer_->take({.time = clock_.now().time_since_epoch().count(),
                        .name = replaceInvalidUtf8(name),
                        .payload = std::make_shared<const std::string>(text),
                        .rank = rank,
                        .refused = {}});
}

uint64_t Spool::beginRun() { return writer_->beginRun(); }

SpoolFigures Spool::endRun() { return writer_->endRun(); }

}  // namespace tessel
