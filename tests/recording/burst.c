/* burst COUNT [no_wait]: records COUNT events as fast as it goes, and two more while it ends.
 * Prints how many calls failed, the longest call in microseconds, and all calls together in
 * milliseconds.
 *
 * The two at the end come from an exit handler and from a destructor: what they lose must be told
 * as well. */
#include <stdio.h>

#include "tessel/trace.h"

static tessel_point point = {
    .subsystem = "com.vantor.Calendar", .category = "Burst", .string1 = {"period", "week"}};

static void record_at_exit(void) { tessel_event(&point); }

__attribute__((destructor)) static void record_in_destructor(void) { tessel_event(&point); }

int main(int argc, char** argv) {
  const long count = argc > 1 ? atol(argv[1]) : 1;
  long failed = 0;
  uint64_t longest = 0;
  const uint64_t start = tessel_now_ns_();
  uint64_t before = start;
  point.no_wait = argc > 2;
  atexit(record_at_exit);
  for (long i = 0; i < count; ++i) {
    failed += tessel_event(&point) != 0;
    const uint64_t now = tessel_now_ns_();
    if (now - before > longest) longest = now - before;
    before = now;
  }
  printf("%ld %lu %lu\n", failed, (unsigned long)(longest / 1000u),
         (unsigned long)((before - start) / 1000000u));
  return 0;
}
