// Records what the lines of standard input say, and answers each action with its errno value.
#include <cstring>
#include <optional>
#include <string>

#include "runner.h"

using tessel::trace::Interval;
using tessel::trace::Point;

namespace {

tessel_attribute attributes[64];
size_t attributeCount = 0;
std::optional<Interval> intervals[8];

template <class Set>
void nextNumber(Set set) {
  const char* label = next_text();
  const char kind = *next_word();
  const char* value = next_word();
  if (kind == 'i') {
    set(label, std::stoll(value));
  } else if (kind == 'u') {
    set(label, std::stoull(value));
  } else {
    set(label, std::strtod(value, nullptr));
  }
}

void add(Point& point, const char* word) {
  const bool first = word[2] == '1';
  switch (word[1]) {
    case 's': {
      const char* label = next_text();
      const char* value = next_text();
      static_cast<void>(first ? point.string1(label, value) : point.string2(label, value));
      return;
    }
    case 'n':
      return nextNumber([&](const char* label, auto value) {
        static_cast<void>(first ? point.number1(label, value) : point.number2(label, value));
      });
    case 'i':
      point.intervalId(next_text());
      return;
    case 'y':
      point.systemScope();
      return;
    case 't':
      point.telemetry();
      return;
    case 'w':
      point.noWait();
      return;
    default:
      attributes[attributeCount].key = next_text();
      attributes[attributeCount++].value = next_text();
      point.attributes(attributes, attributeCount);
  }
}

// The begin of an Interval answers nothing, so its token is asked with an end... of nothing.
int act(const Point& point, const char* word) {
  std::optional<Interval>& interval = intervals[word[1] == ':' ? word[2] - '0' : 0];
  const tessel_point& plain = point;
  switch (*word) {
    case 'v':
      return tessel::trace::event(point);
    case 'b':
      interval.emplace(point);
      return 0;
    case 'e':
      if (word[1] != ':') return tessel_interval_end(nullptr, &plain);
      interval->point() = point;
      return interval->end();
    case 'a':
      interval->point() = point;
      return interval->endAnimation(std::strtod(next_word(), nullptr));
    case 'r': {
      int failed = 0;
      for (long i = std::strtol(next_word(), nullptr, 10); i > 0; --i) {
        failed += tessel::trace::event(point) != 0;
      }
      return failed;
    }
    default:
      return act_on_process(word);
  }
}

int runLine() {
  static Point point(nullptr, nullptr, nullptr);
  for (const char* word = strtok_r(line, " \n", &rest); word; word = next_word()) {
    if (std::strcmp(word, "new") == 0) {
      const char* subsystem = next_text();
      const char* category = next_text();
      point = Point(subsystem, category, next_text());
      attributeCount = 0;
    } else if (word[0] == '+') {
      add(point, word);
    } else if (std::strcmp(word, "fork") == 0) {
      return go_on_in_child() ? 0 : -2;
    } else {
      return act(point, word);
    }
  }
  return -1;
}

}  // namespace

int main() { run_lines(runLine); }
