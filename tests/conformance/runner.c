/* Records what the lines of standard input say, and answers each action with its errno value. */
#include "runner.h"

static tessel_point point;
static tessel_attribute attributes[64];
static tessel_interval tokens[8];

static tessel_number next_number(void) {
  const char* const label = next_text();
  const char* const kind = next_word();
  const char* const value = next_word();
  if (*kind == 'i') return tessel_int(label, strtoll(value, NULL, 10));
  return *kind == 'u' ? tessel_uint(label, strtoull(value, NULL, 10))
                      : tessel_double(label, strtod(value, NULL));
}

static tessel_string next_string(void) {
  tessel_string string;
  string.label = next_text();
  string.value = next_text();
  return string;
}

static int event_in(long count) {
  int failed = 0;
  for (long i = 0; i < count; ++i) failed += tessel_event(&point) != 0;
  return failed;
}

static int act(const char* word) {
  tessel_interval* const token = word[1] == ':' ? &tokens[word[2] - '0'] : NULL;
  switch (*word) {
    case 'v':
      return tessel_event(&point);
    case 'b':
      return tessel_interval_begin(&point, token);
    case 'e':
      return tessel_interval_end(token, &point);
    case 'a':
      return tessel_animation_end(token, &point, strtod(next_word(), NULL));
    case 'r':
      return event_in(strtol(next_word(), NULL, 10));
    default:
      return act_on_process(word);
  }
}

static int run_line(void) {
  for (const char* word = strtok_r(line, " \n", &rest); word; word = next_word()) {
    if (strcmp(word, "new") == 0) {
      memset(&point, 0, sizeof point);
      point.subsystem = next_text();
      point.category = next_text();
      point.name = next_text();
    } else if (word[0] == '+') {
      if (word[1] == 's') *(word[2] == '1' ? &point.string1 : &point.string2) = next_string();
      if (word[1] == 'n') *(word[2] == '1' ? &point.number1 : &point.number2) = next_number();
      if (word[1] == 'i') point.interval_id = next_text();
      if (word[1] == 'y') point.system_scope = true;
      if (word[1] == 't') point.telemetry = true;
      if (word[1] == 'w') point.no_wait = true;
      if (word[1] == 'a') {
        attributes[point.attribute_count].key = next_text();
        attributes[point.attribute_count++].value = next_text();
        point.attributes = attributes;
      }
    } else if (strcmp(word, "fork") == 0) {
      return go_on_in_child() ? 0 : -2;
    } else {
      return act(word);
    }
  }
  return -1;
}

int main(void) {
  run_lines(run_line);
  return 0;
}
