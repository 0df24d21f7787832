// Spool: the event sender of the analytics service.

#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/Analytics.h"
#include "platform/Queues.h"
#include "platform/System.h"
#include "statora/SpoolDatabase.h"

namespace tessel {

// The results of the sends of a run. Each send was stored or failed for one reason.
struct SpoolFigures {
  uint64_t sent = 0;
  uint64_t stored = 0;
  SpoolFailures failed{};             // by SpoolFailure
  uint64_t expired = 0;               // rows of earlier runs, removed at the end of this one
  std::vector<std::string> setAside;  // file names of damaged spools
};

// Stores events in the spool.
//
// sendEvent() puts a row into a buffer and returns. A queue of its own inserts the rows as they
// come: any reader sees a row moments later, and it then outlives the process. Once a second a
// timer flushes what was inserted; from then on a row outlives a power cut, too. endRun() does both
// for whatever is left. If the process ends before, the rows in the buffer are lost.
//
// The buffer holds 16 MiB of text. If the disk is so slow that it fills up, further events are
// refused. While another client keeps the database locked, the rows wait in the buffer until the
// run ends.
//
// A run may take an eighth of what is free when it begins, so each flood leaves seven eighths of
// what it has found to the runs after it. The rows of its summary have a part of that for
// themselves.
//
// A run that sends nothing makes no database. Each run opens it by its path, so it does not write
// to a file that somebody has moved or removed.
//
// A row that cannot be stored is counted under its reason, and the run goes on. The log says each
// reason once a run. A damaged spool is renamed to `statora.db.damaged-<UTC date>`, at most once a
// run, and a new one is begun. The service never changes a stored row, and it removes only rows
// that have stood there longer than the limit.
//
// Threads: one at a time (the reporting queue).
class Spool final : public EventSender {
 public:
  // The database lies in `stateDirectory`, which the first row makes if it is missing. `writer` is
  // the queue on which the database is used; nothing else may run on it. `timers` makes the timer
  // of the flushes at the first send. Each row that is dealt with counts as progress.
  Spool(std::string stateDirectory, SpoolLimits limits, Clock& clock, ServiceStatus& status,
        std::shared_ptr<SerialQueue> writer, QueueFactory& timers);

  bool sendEvent(std::string_view name, const Payload& payload, EventRank rank) override;
  uint64_t spaceOf(size_t textBytes) const override { return spaceOfRow(textBytes); }

  // Begins a run. Answers how many bytes, by spaceOf(), the events of its objects may take
  // together.
  uint64_t beginRun();
  // Ends a run. Waits until each row is stored or has failed, removes rows that have stood there
  // too long, flushes and closes the database. Answers the figures of the run; those of the next
  // run begin at zero.
  SpoolFigures endRun();

 private:
  class Writer;

  Clock& clock_;
  // Shared with the closures on the queue.
  const std::shared_ptr<Writer> writer_;
  const std::shared_ptr<RepeatingTimer> flushTimer_;
};

}  // namespace tessel
