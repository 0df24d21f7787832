-- A column for each member of a line, and for each member of a payload that the queries ask for; the insert skips the
-- others. A record that arrives again has the same identifier, and FINAL shows one of the two.
CREATE TABLE events (
  `log.record.uid` String,
  `event.name` String,
  `service.instance.id` String,
  `service.version` String,
  `os.version` String,
  timestamp String,
  Subsystem String,
  Category String,
  Name String,
  DurationInSeconds Nullable(Float64),
  Classification String,
  Count UInt64,
  LogObjectsProcessed UInt64,
  WasInterrupted UInt8,
  Good Nullable(UInt8),
  Problems String,
  Runs String,
  RowsStored UInt64,
  RowsSetAside UInt64,
  RowsRejected UInt64,
  RowsExpired UInt64,
  RowsWithdrawn UInt64,
  RowsRefused UInt64,
  RowsWaiting UInt64,
  at DateTime MATERIALIZED parseDateTimeBestEffort(timestamp),
  microseconds UInt64 MATERIALIZED toUInt64(parseDateTimeBestEffort(timestamp)) * 1000000 + toUInt64(substring(timestamp, 21, 6))
) ENGINE = ReplacingMergeTree
PARTITION BY toYYYYMM(at)
ORDER BY `log.record.uid`
