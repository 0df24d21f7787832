-- Machines that have sent nothing since yesterday. A machine sends once a day, at a time that moves by an hour.
SELECT `service.instance.id` AS machine FROM events FINAL
GROUP BY machine HAVING max(at) < now() - 36 * 3600
