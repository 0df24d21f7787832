-- How long opening the calendar takes, by version of the system.
SELECT `os.version` AS version, count() AS records,
       quantileExact(0.5)(assumeNotNull(DurationInSeconds)) AS p50, quantileExact(0.95)(assumeNotNull(DurationInSeconds)) AS p95
FROM events FINAL
WHERE `event.name` = 'ts__com.vantor.Calendar__View__Open' AND DurationInSeconds > 0
GROUP BY version
