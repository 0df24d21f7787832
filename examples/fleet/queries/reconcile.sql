-- Compares what the health records tell with what the store holds, and names what is missing or double. There is no row
-- where both agree.
--
-- First the runs, by machine and day: each told how many rows it stored, and all rows of a run have a time within it. A
-- run that two records tell counts once. Then the whole spool of each machine, from its last health record: this holds the
-- rows of runs that died, too. Health records are left out of the first and belong to the second. One that a newer one
-- replaced may have arrived before, if the answer to it was lost.
SELECT machine, day, told, held, if(told > held, told - held, 0) AS missing, if(held > most, held - most, 0) AS double
FROM (
  SELECT machine, day, toInt64(sum(stored)) AS told, toInt64(sum(stored)) AS most, toInt64(sum(found)) AS held
  FROM (
    SELECT machine, start, toString(toDate(intDiv(start, 1000000))) AS day, any(told_stored) AS stored,
           sum(microseconds >= start AND microseconds <= finish) AS found
    FROM (
      SELECT `service.instance.id` AS machine, visitParamExtractUInt(run, 'start') AS start,
             any(visitParamExtractUInt(run, 'end')) AS finish, any(visitParamExtractUInt(run, 'stored')) AS told_stored
      FROM events FINAL ARRAY JOIN extractAll(Runs, '\\{[^}]*\\}') AS run
      WHERE `event.name` = 'tessel.health' AND visitParamExtractRaw(run, 'end') != 'null'
      GROUP BY machine, start)
    ALL LEFT JOIN (
      SELECT `service.instance.id` AS machine, microseconds FROM events FINAL WHERE `event.name` != 'tessel.health')
    USING machine
    GROUP BY machine, start)
  GROUP BY machine, day
  UNION ALL
  SELECT machine, 'all' AS day, toInt64(any(stored) - any(gone)) AS told, toInt64(any(stored) - any(gone) + any(withdrawn)) AS most,
         toInt64(sum(microseconds < told_at)) AS held
  FROM (
    SELECT `service.instance.id` AS machine, max(microseconds) AS told_at, argMax(RowsStored, microseconds) AS stored,
           argMax(RowsWithdrawn, microseconds) AS withdrawn,
           argMax(RowsSetAside + RowsExpired + RowsWithdrawn, microseconds) AS gone
    FROM events FINAL WHERE `event.name` = 'tessel.health' GROUP BY machine)
  ALL LEFT JOIN (
    SELECT `service.instance.id` AS machine, microseconds FROM events FINAL)
  USING machine
  GROUP BY machine)
WHERE missing > 0 OR double > 0
ORDER BY machine, day
