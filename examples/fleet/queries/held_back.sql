-- Pairs of which most was held back because of unknown values. The values themselves never leave the machines.
SELECT Subsystem, Category, sum(Count) AS held_back, uniqExact(`service.instance.id`) AS machines
FROM events FINAL
WHERE `event.name` = 'com.vantor.performance.tessel_counts' AND Classification = 'StringWhitelistFiltered'
GROUP BY Subsystem, Category ORDER BY held_back DESC, Subsystem, Category LIMIT 3
