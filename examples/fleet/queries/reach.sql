-- The reach of a trace point: on how many machines it was reported, and how often.
SELECT Subsystem, Category, Name, uniqExact(`service.instance.id`) AS machines, count() AS records
FROM events FINAL WHERE `event.name` = 'com.vantor.performance.tessel'
GROUP BY Subsystem, Category, Name
