/* Another unit of the same program, in C: shares socket and switch with the others. */
#include "tessel/trace.h"

int record_from_second_unit(void);

int record_from_second_unit(void) {
  return TESSEL_EVENT(.subsystem = "com.vantor.Calendar", .category = "View", .name = "Second",
                      .number1 = tessel_int("count", -3));
}
