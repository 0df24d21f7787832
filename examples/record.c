/* Records an event, an interval and an animation from C.
 *
 *   cc -std=c11 record.c $(pkg-config --cflags tessel-trace) && ./a.out
 */
#include <stdio.h>
#include <string.h>
#include <tessel/trace.h>

/* A trace point that was not recorded is no reason to stop; here it is said, to be seen. */
static void check(const char* what, int error) {
  if (error != 0) fprintf(stderr, "%s: %s\n", what, strerror(error));
}

static tessel_point calendar(const char* name) {
  const tessel_point point = {
      .subsystem = "com.vantor.Calendar", .category = "View", .name = name, .telemetry = true};
  return point;
}

static void open_view(void) {
  check("open", TESSEL_EVENT(.subsystem = "com.vantor.Calendar", .category = "View", .name = "Open",
                             .telemetry = true, .string1 = {"period", "week"},
                             .number1 = tessel_int("events", 12)));
}

static void load_month(void) {
  tessel_point load = calendar("Load");
  tessel_interval token;
  check("load begins", tessel_interval_begin(&load, &token));
  /* ... the work that is measured ... */
  load.number1 = tessel_uint("bytes", 18446744073709551615u); /* known only now */
  check("load ends", tessel_interval_end(&token, &load));
}

static void scroll_down(void) {
  const tessel_point scroll = calendar("Scroll");
  tessel_interval token;
  check("scroll begins", tessel_interval_begin(&scroll, &token));
  check("scroll ends", tessel_animation_end(&token, &scroll, 59.94));
}

int main(void) {
  open_view();
  load_month();
  scroll_down();
  return 0;
}
