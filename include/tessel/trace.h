/* Trace points: record events, intervals and animations for tessel_reporter.
 *
 * Header-only, C11 and C++17, for Linux with GCC or Clang; needs no library. A trace point is an
 * entry of the system journal and is sent as one datagram to the journal's socket. From
 * TESSEL_BUFFER_SIZE bytes on it travels in a sealed memory file instead.
 *
 * Every function returns 0 or an errno value and leaves errno alone. These are mistakes of the
 * caller, and nothing is recorded:
 *   EINVAL        subsystem or category missing or empty
 *   EBADMSG       a label without a value or the other way round; an attribute without a value
 *   EDOM          a number or frame rate that is not finite
 *   EMSGSIZE      a string longer than TESSEL_VALUE_MAX bytes
 *   ENOKEY        an attribute key that is missing or empty, or holds '=' or a line feed
 *   ENAMETOOLONG  an attribute key longer than TESSEL_KEY_MAX bytes
 *   E2BIG         more than TESSEL_ATTRIBUTES_MAX attributes
 *   ECANCELED     the end of an interval that was begun while recording was off, or ended before
 * Any other value means that the trace point is lost, and counted:
 *   EAGAIN        the journal had no room
 *   ENOENT, ECONNREFUSED   no journal is running
 *   or another error of the system
 *
 * Waiting: where the journal has no room, a call waits for it, at most 20 ms. After a wait that
 * ended in nothing, calls wait 1 ms in each second, until a trace point is taken again. A point
 * with no_wait never waits, and with TESSEL_TRACE_WAIT=0 in the environment no call does; another
 * number there is the longest wait in milliseconds, up to 1000.
 *
 * Losses: each later trace point says how many this program has lost so far. A program that ends by
 * exit() or by returning from main() says it once more where the number has grown since; for that
 * it may wait up to 1 s. Nobody can know what a program lost since its last trace point that ends
 * in another way: killed, by _exit(), by exec(). A forked child counts for itself, from zero.
 *
 * Mistakes are told on standard error, once for each place in the source, with TESSEL_TRACE=check
 * in the environment when recording starts.
 *
 * Threads: any function from any thread; a token is its interval's alone. A forked child goes on
 * recording. Not for signal handlers. Strings are read during the call only. A program that closes
 * descriptors it does not know costs a new socket, nothing else.
 *
 * Off: TESSEL_TRACE=0 in the environment when recording starts, tessel_enable(false), or
 * TESSEL_TRACE_DISABLED defined before this header, which leaves nothing in the program. Off,
 * everything returns 0 after one branch.
 *
 * TESSEL_JOURNAL_SOCKET, in the environment or as a macro, names another socket, for tests; the
 * environment is not asked in a program that runs with more rights than its caller.
 */
#ifndef TESSEL_TRACE_H
#define TESSEL_TRACE_H

#if defined(__cplusplus) ? __cplusplus < 201703L : __STDC_VERSION__ + 0 < 201112L
#error "tessel/trace.h needs C11 or C++17: compile with -std=c11, -std=c++17 or a later standard"
#else /* what follows would only add errors that explain nothing */

#include <errno.h>
#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>
#include <unistd.h>

#include "trace_journal.h"

#define TESSEL_KEY_MAX 64        /* bytes of an attribute key */
#define TESSEL_ATTRIBUTES_MAX 32 /* attributes of one trace point */

#ifdef __cplusplus
extern "C" {
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wold-style-cast"
#pragma GCC diagnostic ignored "-Wzero-as-null-pointer-constant"
#endif

/* ---- What a trace point says ---------------------------------------------------------------- */

/* A labelled string; absent where both are null. */
typedef struct tessel_string {
  const char* label;
  const char* value;
} tessel_string;

typedef enum tessel_number_kind {
  TESSEL_NUMBER_SIGNED,
  TESSEL_NUMBER_UNSIGNED,
  TESSEL_NUMBER_DOUBLE
} tessel_number_kind;

/* A labelled number, made by tessel_int(), tessel_uint() or tessel_double(); absent without label.
 */
typedef struct tessel_number {
  const char* label;
  tessel_number_kind kind;
  union {
    int64_t as_signed;
    uint64_t as_unsigned;
    double as_double;
  } value;
} tessel_number;

/* The key is not empty and holds neither '=' nor a line feed. */
typedef struct tessel_attribute {
  const char* key;
  const char* value;
} tessel_attribute;

/* One trace point. What is zero is absent; subsystem and category are required. */
typedef struct tessel_point {
  const char* subsystem; /* reverse-DNS, such as "com.vantor.Calendar" */
  const char* category;
  const char* name;
  tessel_string string1, string2;
  tessel_number number1, number2;
  const tessel_attribute* attributes;
  size_t attribute_count;
  const char* interval_id; /* pairs begin and end; absent: an id of the token's own */
  bool system_scope;       /* begin and end may come from different processes */
  /* May be reported. Without it the trace point stays on the machine, but its subsystem and
   * category are counted, and the count may be sent. */
  bool telemetry;
  bool no_wait; /* rather lost than waited for */
} tessel_point;

/* Links the end of an interval to its begin. The members are the header's own. */
typedef struct tessel_interval {
  uint64_t start_ns;
  uint64_t id;
  int error; /* what its end answers while it is not open */
  bool open;
  bool lost; /* the begin, and the end was not counted yet */
} tessel_interval;

static inline tessel_number tessel_int(const char* label, int64_t value) {
  tessel_number number;
  number.label = label;
  number.kind = TESSEL_NUMBER_SIGNED;
  number.value.as_signed = value;
  return number;
}

static inline tessel_number tessel_uint(const char* label, uint64_t value) {
  tessel_number number;
  number.label = label;
  number.kind = TESSEL_NUMBER_UNSIGNED;
  number.value.as_unsigned = value;
  return number;
}

static inline tessel_number tessel_double(const char* label, double value) {
  tessel_number number;
  number.label = label;
  number.kind = TESSEL_NUMBER_DOUBLE;
  number.value.as_double = value;
  return number;
}

/* NOLINTBEGIN(modernize-use-nullptr): this is C as well */

#include "trace_entry.h"

/* ---- The calls ------------------------------------------------------------------------------ */

/* Whether trace points are recorded: ask before work that is done for a trace point only. */
static inline bool tessel_enabled(void) {
#ifdef TESSEL_TRACE_DISABLED
  return false;
#else
  const int mode = __atomic_load_n(&tessel_state_v2_.mode, __ATOMIC_RELAXED);
  if (__builtin_expect(mode == TESSEL_OFF_, 0)) return false;
  return mode != TESSEL_UNKNOWN_ || tessel_resolve_mode_();
#endif
}

/* Switches recording on or off for the program, whatever the environment says. Losses from before
 * are told at the end of the program all the same. */
static inline void tessel_enable(bool on) {
  const int mode = on ? tessel_mode_when_on_() : TESSEL_OFF_;
  __atomic_store_n(&tessel_state_v2_.mode, mode, __ATOMIC_RELAXED);
}

#ifdef TESSEL_TRACE_DISABLED
#define TESSEL_IF_ON_(call) (0 ? (call) : 0)
#else
#define TESSEL_IF_ON_(call) (tessel_enabled() ? (call) : 0)
#endif

/* Records a single event. */
static inline int tessel_event(const tessel_point* point TESSEL_CALLER_) {
  return TESSEL_IF_ON_(tessel_event_(point, place));
}

/* Begins an interval and fills `token`. What is not known yet can be left to the end. */
static inline int tessel_interval_begin(const tessel_point* point,
                                        tessel_interval* token TESSEL_CALLER_) {
  token->error = 0;
  token->open = false;
  token->lost = false;
  return TESSEL_IF_ON_(tessel_begin_(point, token, place));
}

/* Ends the interval of `token`, with the duration since its begin. `point` names the same
 * subsystem, category, name and interval_id; of the rest, what it says wins over the begin. Without
 * a token (null) it ends an interval that was begun elsewhere, and the reader takes the duration
 * from the two times. A token whose begin failed gives that error again, and nothing is sent. */
static inline int tessel_interval_end(tessel_interval* token,
                                      const tessel_point* point TESSEL_CALLER_) {
  return TESSEL_IF_ON_(tessel_end_(token, point, NULL, place));
}

/* As tessel_interval_end(); the interval measured an animation, at `frame_rate` frames a second. */
static inline int tessel_animation_end(tessel_interval* token, const tessel_point* point,
                                       double frame_rate TESSEL_CALLER_) {
  return TESSEL_IF_ON_(tessel_end_(token, point, &frame_rate, place));
}

/* NOLINTEND(modernize-use-nullptr) */

#ifndef __cplusplus
/* An event in one expression, whose arguments cost nothing while recording is off:
 * TESSEL_EVENT(.subsystem = "com.vantor.Calendar", .category = "View", .name = "Open"); */
#define TESSEL_EVENT(...) (tessel_enabled() ? tessel_event(&(const tessel_point){__VA_ARGS__}) : 0)

/* Each call says where it stands. A name within its own macro stays a function. */
#define tessel_event(...) tessel_event(__VA_ARGS__, TESSEL_HERE_)
#define tessel_interval_begin(...) tessel_interval_begin(__VA_ARGS__, TESSEL_HERE_)
#define tessel_interval_end(...) tessel_interval_end(__VA_ARGS__, TESSEL_HERE_)
#define tessel_animation_end(...) tessel_animation_end(__VA_ARGS__, TESSEL_HERE_)
#else
#pragma GCC diagnostic pop
} /* extern "C" */
#include "trace_scope.h"
#endif

#endif
#endif
