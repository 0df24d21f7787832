/* Trace points: record events, intervals and animations for tessel_reporter.
 *
 * Header-only, C11 and C++17, for Linux with GCC or Clang; needs no library. A trace point is an
 * entry of the system journal and is sent as one datagram to the journal's socket. From
 * TESSEL_BUFFER_SIZE bytes on it travels in a sealed memory file instead.
 *
 * Every function returns 0 or an errno value, leaves errno alone and never waits:
 *   EINVAL        subsystem or category missing or empty; a label without a value or the other way
 *                 round; a number or frame rate that is not finite; a bad attribute key
 *   EMSGSIZE      a string longer than TESSEL_VALUE_MAX bytes
 *   ENAMETOOLONG  an attribute key longer than TESSEL_KEY_MAX bytes, or a socket path too long
 *   E2BIG         more than TESSEL_ATTRIBUTES_MAX attributes
 *   ECANCELED     the end of an interval that was begun while recording was off, or ended before
 *   EAGAIN        the journal has no room just now; this trace point is lost
 *   ENOENT, ECONNREFUSED   no journal is running
 * or another errno value of the system. A program that ignores them loses trace points, never more.
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
  bool telemetry;          /* may be reported; without it the trace point stays on the machine */
} tessel_point;

/* Links the end of an interval to its begin. The members are the header's own. */
typedef struct tessel_interval {
  uint64_t start_ns;
  uint64_t id;
  int error; /* what its end answers while it is not open */
  bool open;
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

/* ---- How it is written: names that end in an underscore are the header's own --------------- */

#if !defined(__cplusplus) && !defined(CLOCK_MONOTONIC) /* strict C11 hides both */
#define CLOCK_MONOTONIC 1
extern int clock_gettime(int clock, struct timespec* time);
#endif

TESSEL_INNER_ uint64_t tessel_now_ns_(void) {
  struct timespec now;
  clock_gettime(CLOCK_MONOTONIC, &now);
  return (uint64_t)now.tv_sec * 1000000000u + (uint64_t)now.tv_nsec;
}

/* Decimal text of `value`, ending before `end`; answers where it begins. */
TESSEL_INNER_ char* tessel_decimal_(char* end, uint64_t value) {
  do {
    *--end = (char)('0' + value % 10);
  } while (value /= 10);
  return end;
}

/* Text that reads back as the same double, never as an integer, in any locale. */
TESSEL_SLOW_ void tessel_put_double_(tessel_message_* message, const char* name, double value) {
  char text[40];
  if (!__builtin_isfinite(value)) {
    message->error = EINVAL;
    return;
  }
  snprintf(text, sizeof text, "%.15g", value);
  const double read_back = strtod(text, NULL);
  if (read_back < value || read_back > value) snprintf(text, sizeof text, "%.17g", value);
  char* point = text + strspn(text, "+-0123456789");
  if (*point == '\0') {
    memcpy(point, ".0", 3);
  } else if (*point != 'e') { /* the locale's decimal point, one byte or more */
    const char* rest = point + strcspn(point, "0123456789");
    *point = '.';
    memmove(point + 1, rest, strlen(rest) + 1);
  }
  tessel_put_field_(message, name, text, strlen(text));
}

TESSEL_INNER_ void tessel_put_integer_(tessel_message_* message, const char* name, bool negative,
                                       uint64_t magnitude) {
  char text[24];
  char* const end = text + sizeof text;
  char* begin = tessel_decimal_(end, magnitude);
  if (negative) *--begin = '-';
  tessel_put_field_(message, name, begin, (size_t)(end - begin));
}

/* Seconds with nine decimals. */
TESSEL_INNER_ void tessel_put_duration_(tessel_message_* message, uint64_t nanoseconds) {
  char text[32];
  char* const end = text + sizeof text;
  /* The added 1 keeps the leading zeros and gives its place to the point. */
  char* const point = tessel_decimal_(end, nanoseconds % 1000000000u + 1000000000u);
  *point = '.';
  const char* begin = tessel_decimal_(point, nanoseconds / 1000000000u);
  tessel_put_field_(message, "TESSEL_DURATION=", begin, (size_t)(end - begin));
}

TESSEL_INNER_ void tessel_put_text_(tessel_message_* message, const char* name, const char* value) {
  if (value) tessel_put_field_(message, name, value, strlen(value));
}

TESSEL_INNER_ void tessel_put_string_(tessel_message_* message, const char* label_name,
                                      const char* value_name, const tessel_string* string) {
  if (!string->label != !string->value) message->error = EINVAL;
  tessel_put_text_(message, label_name, string->label);
  tessel_put_text_(message, value_name, string->value);
}

TESSEL_INNER_ void tessel_put_number_(tessel_message_* message, const char* label_name,
                                      const char* value_name, const tessel_number* number) {
  if (!number->label) return;
  const uint64_t bits = number->value.as_unsigned;
  const bool negative = number->kind == TESSEL_NUMBER_SIGNED && number->value.as_signed < 0;
  tessel_put_text_(message, label_name, number->label);
  if (number->kind == TESSEL_NUMBER_DOUBLE) {
    tessel_put_double_(message, value_name, number->value.as_double);
  } else {
    tessel_put_integer_(message, value_name, negative, negative ? 0 - bits : bits);
  }
}

TESSEL_SLOW_ void tessel_put_attribute_(tessel_message_* message, const tessel_attribute* it) {
  char text[TESSEL_VALUE_MAX];
  const size_t key = it->key ? strlen(it->key) : 0;
  const size_t value = it->value ? strlen(it->value) : 0;
  if (key == 0 || !it->value || strpbrk(it->key, "=\n")) {
    message->error = EINVAL;
  } else if (key > TESSEL_KEY_MAX) {
    message->error = ENAMETOOLONG;
  } else if (value >= sizeof text - key) {
    message->error = EMSGSIZE;
  } else {
    memcpy(text, it->key, key);
    text[key] = '=';
    memcpy(text + key + 1, it->value, value);
    tessel_put_field_(message, "TESSEL_ATTRIBUTE=", text, key + 1 + value);
  }
}

/* The fields of `point`. Priority debug: the journal then counts trace points against its rate
 * limit apart from the program's own messages. */
TESSEL_INNER_ void tessel_put_point_(tessel_message_* message, const tessel_point* point) {
  if (!point->subsystem || !*point->subsystem || !point->category || !*point->category) {
    message->error = EINVAL;
    return;
  }
  tessel_put_text_(message, "PRIORITY=", "7");
  tessel_put_text_(message, "TESSEL_SUBSYSTEM=", point->subsystem);
  tessel_put_text_(message, "TESSEL_CATEGORY=", point->category);
  tessel_put_text_(message, "TESSEL_NAME=", point->name);
  tessel_put_text_(message, "TESSEL_TELEMETRY=", point->telemetry ? "1" : NULL);
  tessel_put_string_(message, "TESSEL_STRING1_NAME=", "TESSEL_STRING1_VALUE=", &point->string1);
  tessel_put_string_(message, "TESSEL_STRING2_NAME=", "TESSEL_STRING2_VALUE=", &point->string2);
  tessel_put_number_(message, "TESSEL_NUMBER1_NAME=", "TESSEL_NUMBER1_VALUE=", &point->number1);
  tessel_put_number_(message, "TESSEL_NUMBER2_NAME=", "TESSEL_NUMBER2_VALUE=", &point->number2);
  if (point->attribute_count > TESSEL_ATTRIBUTES_MAX) message->error = E2BIG;
  for (size_t i = 0; i < point->attribute_count && !message->error; ++i) {
    tessel_put_attribute_(message, &point->attributes[i]);
  }
}

/* What only intervals carry. `token`: null where the interval has none. */
TESSEL_INNER_ void tessel_put_interval_(tessel_message_* message, const tessel_point* point,
                                        const tessel_interval* token) {
  if (point->interval_id) {
    tessel_put_text_(message, "TESSEL_INTERVAL_ID=", point->interval_id);
  } else if (token) {
    tessel_put_integer_(message, "TESSEL_INTERVAL_ID=", false, token->id);
  }
  tessel_put_text_(message, "TESSEL_INTERVAL_SCOPE=", point->system_scope ? "system" : NULL);
}

typedef enum tessel_kind_ { TESSEL_EVENT_, TESSEL_BEGIN_, TESSEL_END_ } tessel_kind_;

/* Encodes and sends one trace point. `token` and `frame_rate`: null where there is none. */
TESSEL_SLOW_ int tessel_record_(tessel_kind_ kind, const tessel_point* point,
                                const tessel_interval* token, const double* frame_rate) {
  static const char* const kinds[] = {"event", "begin", "end"};
  const int caller_errno = errno;
  tessel_message_ message;
  message.used = 0;
  message.memfd = -1;
  message.error = 0;
  tessel_put_text_(&message, "TESSEL_KIND=", kinds[kind]);
  tessel_put_point_(&message, point);
  if (kind != TESSEL_EVENT_) tessel_put_interval_(&message, point, token);
  if (kind == TESSEL_END_ && token) {
    tessel_put_duration_(&message, tessel_now_ns_() - token->start_ns);
  }
  if (frame_rate) tessel_put_double_(&message, "TESSEL_FRAME_RATE=", *frame_rate);
  const int error = message.error ? message.error : tessel_deliver_(&message);
  if (message.memfd >= 0) close(message.memfd);
  errno = caller_errno;
  return error;
}

TESSEL_SLOW_ int tessel_begin_(const tessel_point* point, tessel_interval* token) {
  token->start_ns = tessel_now_ns_();
  token->id =
      __atomic_add_fetch(&tessel_state_v1_.intervals, 1, __ATOMIC_RELAXED) << 40 ^ token->start_ns;
  token->error = tessel_record_(TESSEL_BEGIN_, point, token, NULL);
  token->open = token->error == 0;
  return token->error;
}

TESSEL_SLOW_ int tessel_end_(tessel_interval* token, const tessel_point* point,
                             const double* frame_rate) {
  if (token && !token->open) return token->error ? token->error : ECANCELED;
  if (token) token->open = false;
  return tessel_record_(TESSEL_END_, point, token, frame_rate);
}

/* ---- The calls ------------------------------------------------------------------------------ */

/* Whether trace points are recorded: ask before work that is done for a trace point only. */
static inline bool tessel_enabled(void) {
#ifdef TESSEL_TRACE_DISABLED
  return false;
#else
  const int mode = __atomic_load_n(&tessel_state_v1_.mode, __ATOMIC_RELAXED);
  if (__builtin_expect(mode == TESSEL_OFF_, 0)) return false;
  return mode == TESSEL_ON_ || tessel_resolve_mode_();
#endif
}

/* Switches recording on or off for the program, whatever the environment says. */
static inline void tessel_enable(bool on) {
  __atomic_store_n(&tessel_state_v1_.mode, on ? TESSEL_ON_ : TESSEL_OFF_, __ATOMIC_RELAXED);
}

/* Records a single event. */
static inline int tessel_event(const tessel_point* point) {
  return tessel_enabled() ? tessel_record_(TESSEL_EVENT_, point, NULL, NULL) : 0;
}

/* Begins an interval and fills `token`. What is not known yet can be left to the end. */
static inline int tessel_interval_begin(const tessel_point* point, tessel_interval* token) {
  token->error = 0;
  token->open = false;
  return tessel_enabled() ? tessel_begin_(point, token) : 0;
}

/* Ends the interval of `token`, with the duration since its begin. `point` names the same
 * subsystem, category, name and interval_id; of the rest, what it says wins over the begin. Without
 * a token (null) it ends an interval that was begun elsewhere, and the reader takes the duration
 * from the two times. A token whose begin failed gives that error again, and nothing is sent. */
static inline int tessel_interval_end(tessel_interval* token, const tessel_point* point) {
  return tessel_enabled() ? tessel_end_(token, point, NULL) : 0;
}

/* As tessel_interval_end(); the interval measured an animation, at `frame_rate` frames a second. */
static inline int tessel_animation_end(tessel_interval* token, const tessel_point* point,
                                       double frame_rate) {
  return tessel_enabled() ? tessel_end_(token, point, &frame_rate) : 0;
}

/* NOLINTEND(modernize-use-nullptr) */

#ifndef __cplusplus
/* An event in one expression, whose arguments cost nothing while recording is off:
 * TESSEL_EVENT(.subsystem = "com.vantor.Calendar", .category = "View", .name = "Open"); */
#define TESSEL_EVENT(...) (tessel_enabled() ? tessel_event(&(const tessel_point){__VA_ARGS__}) : 0)
#else
#pragma GCC diagnostic pop
} /* extern "C" */
#include "trace_scope.h"
#endif

#endif
