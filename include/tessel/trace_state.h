/* What a program keeps for its trace points: the switch, and the count of what it lost. For trace.h
 * alone; names that end in an underscore are not for users.
 */
#ifndef TESSEL_TRACE_STATE_H
#define TESSEL_TRACE_STATE_H

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/auxv.h>
#include <time.h>
#include <unistd.h>

#ifdef __cplusplus
extern "C" {
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wold-style-cast"
#pragma GCC diagnostic ignored "-Wzero-as-null-pointer-constant"
#endif

#define TESSEL_INNER_ static __attribute__((unused))
#define TESSEL_SLOW_ static __attribute__((unused, noinline))

/* Strict C11 hides these. */
#if !defined(__cplusplus) && !defined(CLOCK_MONOTONIC)
#define CLOCK_REALTIME 0
#define CLOCK_MONOTONIC 1
extern int clock_gettime(int clock, struct timespec* time);
extern int nanosleep(const struct timespec* time, struct timespec* left);
#endif

enum {
  TESSEL_UNKNOWN_ = 0,
  TESSEL_ON_ = 1,
  TESSEL_OFF_ = 2,
  TESSEL_CHECK_ = 3, /* on, and mistakes are told */
  /* A process number has at most 22 bits, which leaves 42 for a count: 4.4 million million. */
  TESSEL_COUNT_BITS_ = 42,
  TESSEL_SINCE_BITS_ = 12
};

/* One per program or library, however many of its files include this header. The version in its
 * name changes with its members, because files that were built with two versions may meet. */
struct tessel_state_v2_ {
  uint64_t socket; /* the descriptor, and above it the low half of its inode number; 0: none */
  uint64_t intervals;
  uint64_t lost;  /* process << TESSEL_COUNT_BITS_ | points that it lost */
  uint64_t told;  /* the greatest such total that the socket took */
  uint64_t since; /* microseconds of the first loss << TESSEL_SINCE_BITS_ | low bits of process */
  uint64_t taken; /* points that the socket took, of all threads */
  uint64_t stuck; /* by tessel_now_ns_(): when a wait began that ended without room; 0: none */
  int mode;
  int wait; /* milliseconds + 1; 0: the environment was not asked yet */
};
extern struct tessel_state_v2_ tessel_state_v2_;
/* NOLINTNEXTLINE(misc-definitions-in-headers): weak */
__attribute__((weak, visibility("hidden"))) struct tessel_state_v2_ tessel_state_v2_ = {
    0, 0, 0, 0, 0, 0, 0, 0, 0};

TESSEL_INNER_ uint64_t tessel_now_ns_(void) {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return (uint64_t)now.tv_sec * 1000000000u + (uint64_t)now.tv_nsec;
}

/* A program with more rights than its caller may have put a file under the number of standard
 * error, so it tells no mistakes there. */
TESSEL_SLOW_ int tessel_mode_when_on_(void) {
  const char* value = getenv("TESSEL_TRACE");
  const bool check = value && strcmp(value, "check") == 0 && !getauxval(AT_SECURE);
  return check ? TESSEL_CHECK_ : TESSEL_ON_;
}

/* Asks the environment, once. */
TESSEL_SLOW_ bool tessel_resolve_mode_(void) {
  const char* value = getenv("TESSEL_TRACE");
  const int mode = value && strcmp(value, "0") == 0 ? TESSEL_OFF_ : tessel_mode_when_on_();
  int before = TESSEL_UNKNOWN_;
  const bool first = __atomic_compare_exchange_n(&tessel_state_v2_.mode, &before, mode, false,
                                                 __ATOMIC_RELAXED, __ATOMIC_RELAXED);
  return (first ? mode : before) != TESSEL_OFF_;
}

/* The word of state.lost where it counts for this process, else 0. A forked child inherits the word
 * of its parent. We compare the process rather than ask for a call at each fork: a child that was
 * made without the C library's fork() is told apart too, and nothing has to be linked. */
TESSEL_INNER_ uint64_t tessel_total_(void) {
  const uint64_t word = __atomic_load_n(&tessel_state_v2_.lost, __ATOMIC_ACQUIRE);
  if (__builtin_expect(word == 0, 1)) return 0;
  return word >> TESSEL_COUNT_BITS_ == (uint64_t)getpid() ? word : 0;
}

/* Counts one lost point. The time goes in before the count, so whoever sees a count sees the time,
 * and the low bits of the process let only the first of several threads set it. One child in 4,096
 * has the bits of its parent and keeps the parent's time, which a reader may find too early. */
TESSEL_SLOW_ void tessel_count_lost_(void) {
  const uint64_t process = (uint64_t)getpid();
  const uint64_t low = process & ((1u << TESSEL_SINCE_BITS_) - 1);
  uint64_t since = __atomic_load_n(&tessel_state_v2_.since, __ATOMIC_RELAXED);
  if (since == 0 || (since & ((1u << TESSEL_SINCE_BITS_) - 1)) != low) {
    struct timespec now;
    clock_gettime(CLOCK_REALTIME, &now);
    const uint64_t microseconds = (uint64_t)now.tv_sec * 1000000u + (uint64_t)now.tv_nsec / 1000u;
    __atomic_compare_exchange_n(&tessel_state_v2_.since, &since,
                                microseconds << TESSEL_SINCE_BITS_ | low, false, __ATOMIC_RELAXED,
                                __ATOMIC_RELAXED);
  }
  const uint64_t most = ((uint64_t)1 << TESSEL_COUNT_BITS_) - 1;
  uint64_t word = __atomic_load_n(&tessel_state_v2_.lost, __ATOMIC_RELAXED);
  uint64_t next = 0;
  do {
    next = process << TESSEL_COUNT_BITS_ | 1;
    if (word >> TESSEL_COUNT_BITS_ == process) next = word + ((word & most) != most);
  } while (!__atomic_compare_exchange_n(&tessel_state_v2_.lost, &word, next, true, __ATOMIC_RELEASE,
                                        __ATOMIC_RELAXED));
}

/* Notes that the socket took `total`. Of one process the greater total is the greater word. */
TESSEL_SLOW_ void tessel_note_told_(uint64_t total) {
  uint64_t told = __atomic_load_n(&tessel_state_v2_.told, __ATOMIC_RELAXED);
  while (told >> TESSEL_COUNT_BITS_ != total >> TESSEL_COUNT_BITS_ || told < total) {
    if (__atomic_compare_exchange_n(&tessel_state_v2_.told, &told, total, true, __ATOMIC_RELAXED,
                                    __ATOMIC_RELAXED)) {
      return;
    }
  }
}

#ifdef __cplusplus
#pragma GCC diagnostic pop
}
#endif

#endif
