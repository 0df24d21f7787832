-- What each machine has sent.
SELECT `service.instance.id` AS machine, count() AS records, uniqExact(`log.record.uid`) AS identifiers
FROM events FINAL GROUP BY machine
