-- What was held back, by the rule that did it, and what was lost on the way: refused by the spool, set aside, expired,
-- thrown away by the store. The sums of rows are those of each machine's last health record.
SELECT Classification AS what, sum(Count) AS how_many FROM events FINAL
WHERE `event.name` = 'com.vantor.performance.tessel_counts' AND endsWith(Classification, 'Filtered')
GROUP BY what
UNION ALL
SELECT arrayJoin([('rows refused', refused), ('rows set aside', aside), ('rows expired', expired), ('rows rejected', rejected)]).1 AS what,
       toUInt64(arrayJoin([('rows refused', refused), ('rows set aside', aside), ('rows expired', expired), ('rows rejected', rejected)]).2) AS how_many
FROM (
  SELECT sum(a) AS refused, sum(b) AS aside, sum(c) AS expired, sum(d) AS rejected FROM (
    SELECT `service.instance.id` AS machine, argMax(RowsRefused, microseconds) AS a, argMax(RowsSetAside, microseconds) AS b,
           argMax(RowsExpired, microseconds) AS c, argMax(RowsRejected, microseconds) AS d
    FROM events FINAL WHERE `event.name` = 'tessel.health' GROUP BY machine))
