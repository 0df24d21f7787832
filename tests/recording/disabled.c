/* A unit that was built with recording off, beside units that record. */
#define TESSEL_TRACE_DISABLED
#include "tessel/trace.h"

int record_while_disabled(void);
bool enabled_while_disabled(void);

bool enabled_while_disabled(void) { return tessel_enabled(); }

int record_while_disabled(void) {
  const tessel_point point = {.subsystem = "com.vantor.Calendar", .category = "View"};
  tessel_interval token;
  const int begun = tessel_interval_begin(&point, &token);
  return begun + tessel_event(&point) + tessel_interval_end(&token, &point) +
         TESSEL_EVENT(.subsystem = "com.vantor.Calendar", .category = "View");
}
