/* TESSEL_TRACE=check: tells on standard error which trace points are not recorded as they were
 * given, and why. For trace.h alone, which includes it behind its types; names that end in an
 * underscore are not for users.
 */
#ifndef TESSEL_TRACE_CHECK_H
#define TESSEL_TRACE_CHECK_H

/* Where a call stands. In C a macro adds it to each call, in C++ a default argument does. */
typedef struct tessel_place_ {
  const char* file;
  int line;
} tessel_place_;

#ifdef TESSEL_TRACE_DISABLED
#define TESSEL_FILE_ NULL
#define TESSEL_LINE_ 0
#elif defined(__cplusplus)
#define TESSEL_FILE_ __builtin_FILE()
#define TESSEL_LINE_ __builtin_LINE()
#else
#define TESSEL_FILE_ __FILE__
#define TESSEL_LINE_ __LINE__
#endif
#ifdef __cplusplus
#define TESSEL_CALLER_ALONE_ tessel_place_ place = {TESSEL_FILE_, TESSEL_LINE_}
#define TESSEL_CALLER_ , TESSEL_CALLER_ALONE_
#else
#define TESSEL_HERE_ ((tessel_place_){TESSEL_FILE_, TESSEL_LINE_})
#define TESSEL_CALLER_ , tessel_place_ place
#endif

/* What was told already, as hashes. 256 kinds of mistake are more than anybody reads; further ones
 * are not told. Linear search: nobody waits for a program that is checked. */
enum { TESSEL_TOLD_MAX_ = 256 };
extern uint64_t tessel_told_v1_[TESSEL_TOLD_MAX_];
/* NOLINTNEXTLINE(misc-definitions-in-headers): weak */
__attribute__((weak, visibility("hidden"))) uint64_t tessel_told_v1_[TESSEL_TOLD_MAX_] = {0};

TESSEL_INNER_ bool tessel_checks_(void) {
  return __atomic_load_n(&tessel_state_v2_.mode, __ATOMIC_RELAXED) == TESSEL_CHECK_;
}

/* FNV-1a; `hash` is that of the text before. */
TESSEL_SLOW_ uint64_t tessel_hash_(uint64_t hash, const char* text) {
  for (; *text; ++text) hash = (hash ^ (unsigned char)*text) * 1099511628211u;
  return hash * 1099511628211u;
}

/* Whether nobody asked this before. Of several threads one hears yes. */
TESSEL_SLOW_ bool tessel_is_first_(uint64_t hash) {
  hash += hash == 0; /* 0 is an empty slot */
  for (int i = 0; i < TESSEL_TOLD_MAX_; ++i) {
    uint64_t known = 0;
    if (__atomic_compare_exchange_n(&tessel_told_v1_[i], &known, hash, false, __ATOMIC_RELAXED,
                                    __ATOMIC_RELAXED)) {
      return true;
    }
    if (known == hash) return false;
  }
  return false;
}

/* One line, in one write, so that lines of several threads do not mix. `kind` stands for `what`
 * when we ask whether it was told: it lacks the numbers, which may be others each time. */
TESSEL_SLOW_ void tessel_tell_kind_(tessel_place_ place, const char* effect, const char* what,
                                    const char* kind) {
  char number[16];
  char line[512];
  const char* file = place.file ? place.file : "?";
  const char* const slash = strrchr(file, '/');
  if (slash) file = slash + 1;
  snprintf(number, sizeof number, "%d", place.line);
  const uint64_t seed = 14695981039346656037u;
  const uint64_t hash =
      tessel_hash_(tessel_hash_(tessel_hash_(tessel_hash_(seed, file), number), effect), kind);
  if (!tessel_is_first_(hash)) return;
  int size =
      snprintf(line, sizeof line, "tessel: %.200s:%s: %s: %.200s\n", file, number, effect, what);
  if (size > 0 && write(STDERR_FILENO, line, (size_t)size) < 0) size = 0; /* nobody to tell */
}

TESSEL_INNER_ void tessel_tell_(tessel_place_ place, const char* effect, const char* what) {
  tessel_tell_kind_(place, effect, what, what);
}

TESSEL_SLOW_ void tessel_tell_refusal_(tessel_place_ place, const tessel_message_* message) {
  char what[256];
  const int name = (int)strcspn(message->words, "=");
  if (message->size == 0) {
    tessel_tell_(place, "refused", message->words);
    return;
  }
  if (message->refused == E2BIG) {
    snprintf(what, sizeof what, "there are %zu attributes, the limit is %zu", message->size,
             message->limit);
  } else {
    snprintf(what, sizeof what, "%.*s has %zu bytes, the limit is %zu", name, message->words,
             message->size, message->limit);
  }
  tessel_tell_kind_(place, "refused", what, message->words);
}

/* As the reader sees it: shortest forms only, no surrogates, nothing over U+10FFFF. */
TESSEL_SLOW_ bool tessel_is_utf8_(const char* text) {
  const unsigned char* at = (const unsigned char*)text;
  while (*at) {
    const unsigned lead = *at++;
    const int further = lead < 0x80 ? 0 : lead < 0xc2 ? -1 : lead < 0xe0 ? 1 : lead < 0xf0 ? 2 : 3;
    if (further < 0 || lead > 0xf4) return false;
    for (int i = 0; i < further; ++i, ++at) {
      const unsigned low = i > 0 ? 0x80 : lead == 0xe0 ? 0xa0 : lead == 0xf0 ? 0x90 : 0x80;
      const unsigned high = i > 0 ? 0xbf : lead == 0xed ? 0x9f : lead == 0xf4 ? 0x8f : 0xbf;
      if (*at < low || *at > high) return false; /* also at the end of the text */
    }
  }
  return true;
}

TESSEL_SLOW_ void tessel_check_text_(tessel_place_ place, const char* text, const char* words) {
  if (text && !tessel_is_utf8_(text)) tessel_tell_(place, "changed", words);
}

TESSEL_SLOW_ void tessel_check_texts_(tessel_place_ place, const tessel_point* point) {
  tessel_check_text_(place, point->subsystem, "TESSEL_SUBSYSTEM is not UTF-8");
  tessel_check_text_(place, point->category, "TESSEL_CATEGORY is not UTF-8");
  tessel_check_text_(place, point->name, "TESSEL_NAME is not UTF-8");
  tessel_check_text_(place, point->string1.label, "TESSEL_STRING1_NAME is not UTF-8");
  tessel_check_text_(place, point->string1.value, "TESSEL_STRING1_VALUE is not UTF-8");
  tessel_check_text_(place, point->string2.label, "TESSEL_STRING2_NAME is not UTF-8");
  tessel_check_text_(place, point->string2.value, "TESSEL_STRING2_VALUE is not UTF-8");
  tessel_check_text_(place, point->number1.label, "TESSEL_NUMBER1_NAME is not UTF-8");
  tessel_check_text_(place, point->number2.label, "TESSEL_NUMBER2_NAME is not UTF-8");
  for (size_t i = 0; i < point->attribute_count; ++i) {
    tessel_check_text_(place, point->attributes[i].key, "TESSEL_ATTRIBUTE is not UTF-8");
    tessel_check_text_(place, point->attributes[i].value, "TESSEL_ATTRIBUTE is not UTF-8");
    for (size_t j = 0; j < i; ++j) {
      if (strcmp(point->attributes[i].key, point->attributes[j].key) == 0) {
        tessel_tell_(place, "dropped", "two attributes have one key");
      }
    }
  }
}

/* A number counts as absent without a label. tessel_int(NULL, 0) looks like one that was never set.
 */
TESSEL_SLOW_ void tessel_check_number_(tessel_place_ place, const tessel_number* number,
                                       const char* words) {
  const bool set = number->kind != TESSEL_NUMBER_SIGNED || number->value.as_unsigned != 0;
  if (!number->label && set) tessel_tell_(place, "dropped", words);
}

/* Tells what became of a point. `error` is what its call answers. */
TESSEL_SLOW_ void tessel_check_(tessel_place_ place, const tessel_point* point, bool is_event,
                                const tessel_message_* message, int error) {
  if (message->refused) {
    tessel_tell_refusal_(place, message);
    return;
  }
  if (error == EAGAIN || error == ETOOMANYREFS) {
    tessel_tell_(place, "lost", "the journal has no room");
  } else if (error == ENOENT || error == ECONNREFUSED) {
    tessel_tell_(place, "lost", "no journal is running");
  } else if (error) {
    tessel_tell_(place, "lost", strerror(error));
  }
  if (is_event && point->interval_id) {
    tessel_tell_(place, "dropped", "an event has no interval_id");
  }
  if (is_event && point->system_scope) tessel_tell_(place, "dropped", "an event has no scope");
  tessel_check_number_(place, &point->number1, "number1 has a value and no label");
  tessel_check_number_(place, &point->number2, "number2 has a value and no label");
  tessel_check_texts_(place, point);
}

#endif
