/* recorder COUNT: records COUNT events, then an interval with attributes that is too large for a
 * datagram; prints the sum of what the calls answered. */
#include <stdio.h>

#include "tessel/trace.h"

static int record_events(long count) {
  int sum = 0;
  for (long i = 0; i < count; ++i) {
    sum += TESSEL_EVENT(.subsystem = "com.vantor.Calendar", .category = "View", .name = "Open",
                        .telemetry = true, .string1 = {"period", "week"},
                        .number1 = tessel_int("index", i));
  }
  return sum;
}

static int record_large_interval(void) {
  static char text[4000];
  tessel_attribute attributes[TESSEL_ATTRIBUTES_MAX];
  const tessel_point point = {.subsystem = "com.vantor.Calendar",
                              .category = "View",
                              .name = "Large",
                              .attributes = attributes,
                              .attribute_count = TESSEL_ATTRIBUTES_MAX};
  tessel_interval token;
  memset(text, 'x', sizeof text - 1);
  text[1] = '\n';
  for (int i = 0; i < TESSEL_ATTRIBUTES_MAX; ++i) {
    attributes[i].key = "Filler";
    attributes[i].value = text;
  }
  const int begun = tessel_interval_begin(&point, &token);
  return begun + tessel_animation_end(&token, &point, 59.94);
}

int main(int argc, char** argv) {
  const int errors = record_events(argc > 1 ? atol(argv[1]) : 1) + record_large_interval();
  printf("%d\n", errors);
  return errors != 0;
}
