/* How a trace point becomes an entry of the journal: its fields in their order, and what is
 * refused. For trace.h alone, which includes it behind its types; names that end in an underscore
 * are not for users.
 */
#ifndef TESSEL_TRACE_ENTRY_H
#define TESSEL_TRACE_ENTRY_H

#include "trace_check.h"

/* NOLINTBEGIN(modernize-use-nullptr): this is C as well */

/* Text that reads back as the same double, never as an integer, in any locale. */
TESSEL_SLOW_ void tessel_put_double_(tessel_message_* message, const char* name, double value) {
  char text[40];
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

/* `words`: of the two mistakes that a pair allows. */
TESSEL_INNER_ void tessel_put_string_(tessel_message_* message, const char* label_name,
                                      const char* value_name, const tessel_string* string,
                                      const char* const words[2]) {
  if (!string->label != !string->value) {
    tessel_refuse_(message, EBADMSG, words[string->label == NULL], 0, 0);
    return;
  }
  tessel_put_text_(message, label_name, string->label);
  tessel_put_text_(message, value_name, string->value);
}

TESSEL_INNER_ void tessel_put_number_(tessel_message_* message, const char* label_name,
                                      const char* value_name, const tessel_number* number,
                                      const char* words) {
  if (!number->label) return;
  const uint64_t bits = number->value.as_unsigned;
  const bool negative = number->kind == TESSEL_NUMBER_SIGNED && number->value.as_signed < 0;
  tessel_put_text_(message, label_name, number->label);
  if (number->kind == TESSEL_NUMBER_DOUBLE && !__builtin_isfinite(number->value.as_double)) {
    tessel_refuse_(message, EDOM, words, 0, 0);
  } else if (number->kind == TESSEL_NUMBER_DOUBLE) {
    tessel_put_double_(message, value_name, number->value.as_double);
  } else {
    tessel_put_integer_(message, value_name, negative, negative ? 0 - bits : bits);
  }
}

TESSEL_SLOW_ void tessel_put_attribute_(tessel_message_* message, const tessel_attribute* it) {
  char text[TESSEL_VALUE_MAX];
  const size_t key = it->key ? strlen(it->key) : 0;
  const size_t value = it->value ? strlen(it->value) : 0;
  if (key == 0) {
    tessel_refuse_(message, ENOKEY, "an attribute has no key", 0, 0);
  } else if (strpbrk(it->key, "=\n")) {
    tessel_refuse_(message, ENOKEY, "an attribute key holds '=' or a line feed", 0, 0);
  } else if (!it->value) {
    tessel_refuse_(message, EBADMSG, "an attribute has no value", 0, 0);
  } else if (key > TESSEL_KEY_MAX) {
    tessel_refuse_(message, ENAMETOOLONG, "an attribute key", key, TESSEL_KEY_MAX);
  } else if (value >= sizeof text - key) {
    tessel_refuse_(message, EMSGSIZE, "an attribute", key + 1 + value, TESSEL_VALUE_MAX);
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
  static const char* const pairs[2][2] = {
      {"string1 has a label and no value", "string1 has a value and no label"},
      {"string2 has a label and no value", "string2 has a value and no label"}};
  if (!point->subsystem || !*point->subsystem) {
    tessel_refuse_(message, EINVAL, "the subsystem is missing", 0, 0);
    return;
  }
  if (!point->category || !*point->category) {
    tessel_refuse_(message, EINVAL, "the category is missing", 0, 0);
    return;
  }
  tessel_put_text_(message, "PRIORITY=", "7");
  tessel_put_text_(message, "TESSEL_SUBSYSTEM=", point->subsystem);
  tessel_put_text_(message, "TESSEL_CATEGORY=", point->category);
  tessel_put_text_(message, "TESSEL_NAME=", point->name);
  tessel_put_text_(message, "TESSEL_TELEMETRY=", point->telemetry ? "1" : NULL);
  tessel_put_string_(message, "TESSEL_STRING1_NAME=", "TESSEL_STRING1_VALUE=", &point->string1,
                     pairs[0]);
  tessel_put_string_(message, "TESSEL_STRING2_NAME=", "TESSEL_STRING2_VALUE=", &point->string2,
                     pairs[1]);
  tessel_put_number_(message, "TESSEL_NUMBER1_NAME=", "TESSEL_NUMBER1_VALUE=", &point->number1,
                     "number1 is not finite");
  tessel_put_number_(message, "TESSEL_NUMBER2_NAME=", "TESSEL_NUMBER2_VALUE=", &point->number2,
                     "number2 is not finite");
  if (point->attribute_count > TESSEL_ATTRIBUTES_MAX) {
    tessel_refuse_(message, E2BIG, "too many attributes", point->attribute_count,
                   TESSEL_ATTRIBUTES_MAX);
  }
  for (size_t i = 0; i < point->attribute_count && !message->refused; ++i) {
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

/* The reader keeps a frame rate as a 32-bit float, so one that is no such float would cost the
 * whole interval. */
TESSEL_SLOW_ void tessel_put_frame_rate_(tessel_message_* message, double frame_rate) {
  if (__builtin_isfinite((float)frame_rate)) {
    tessel_put_double_(message, "TESSEL_FRAME_RATE=", frame_rate);
  } else {
    tessel_refuse_(message, EDOM, "frame_rate is not finite", 0, 0);
  }
}

/* Encodes and sends one trace point. `token` and `frame_rate`: null where there is none. Tells
 * through `lost` whether the point counts as lost. */
TESSEL_SLOW_ int tessel_record_(tessel_kind_ kind, const tessel_point* point,
                                const tessel_interval* token, const double* frame_rate,
                                tessel_place_ place, bool* lost) {
  static const char* const kinds[] = {"event", "begin", "end"};
  const int caller_errno = errno;
  tessel_message_ message;
  tessel_start_(&message);
  tessel_put_text_(&message, "TESSEL_KIND=", kinds[kind]);
  tessel_put_point_(&message, point);
  if (kind != TESSEL_EVENT_) tessel_put_interval_(&message, point, token);
  if (kind == TESSEL_END_ && token) {
    tessel_put_duration_(&message, tessel_now_ns_() - token->start_ns);
  }
  if (frame_rate) tessel_put_frame_rate_(&message, *frame_rate);
  const int error =
      message.refused ? message.refused : tessel_hand_over_(&message, !point->no_wait);
  *lost = error && !message.refused;
  if (message.memfd >= 0) close(message.memfd);
  if (__builtin_expect(tessel_checks_(), 0)) {
    tessel_check_(place, point, kind == TESSEL_EVENT_, &message, error);
  }
  errno = caller_errno;
  return error;
}

TESSEL_SLOW_ int tessel_event_(const tessel_point* point, tessel_place_ place) {
  bool lost = false;
  return tessel_record_(TESSEL_EVENT_, point, NULL, NULL, place, &lost);
}

TESSEL_SLOW_ int tessel_begin_(const tessel_point* point, tessel_interval* token,
                               tessel_place_ place) {
  token->start_ns = tessel_now_ns_();
  token->id =
      __atomic_add_fetch(&tessel_state_v2_.intervals, 1, __ATOMIC_RELAXED) << 40 ^ token->start_ns;
  token->error = tessel_record_(TESSEL_BEGIN_, point, token, NULL, place, &token->lost);
  token->open = token->error == 0;
  return token->error;
}

/* The end of an interval that is not open. Where its begin is lost, the end is lost with it: alone
 * it would pair with nothing. It counts once, however often it is tried. */
TESSEL_SLOW_ int tessel_end_unopened_(tessel_interval* token, tessel_place_ place) {
  const int caller_errno = errno;
  const bool lost = token->lost;
  if (lost) tessel_count_lost_();
  token->lost = false;
  if (tessel_checks_()) {
    tessel_tell_(place, lost ? "lost" : "refused",
                 token->error ? (lost ? "its begin was lost" : "its begin was refused")
                              : "the interval is not open");
  }
  errno = caller_errno;
  return token->error ? token->error : ECANCELED;
}

TESSEL_SLOW_ int tessel_end_(tessel_interval* token, const tessel_point* point,
                             const double* frame_rate, tessel_place_ place) {
  bool lost = false;
  if (token && !token->open) return tessel_end_unopened_(token, place);
  if (token) token->open = false;
  return tessel_record_(TESSEL_END_, point, token, frame_rate, place, &lost);
}

/* NOLINTEND(modernize-use-nullptr) */

#endif
