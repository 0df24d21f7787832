/* The C++ side of trace.h, C++17: a trace point as a chain of calls, and an interval as a scope.
 *
 *   using tessel::trace::Interval;
 *   using tessel::trace::Point;
 *   Interval load(Point("com.vantor.Calendar", "View", "Load").telemetry());
 *
 * Neither allocates nor throws. A Point keeps pointers: its strings must outlive it and every
 * interval made of it.
 */
#ifndef TESSEL_TRACE_SCOPE_H
#define TESSEL_TRACE_SCOPE_H

#include <type_traits>

#include "trace.h"

namespace tessel {
namespace trace {

class Point {
 public:
  constexpr Point(const char* subsystem, const char* category, const char* name) noexcept {
    point_.subsystem = subsystem;
    point_.category = category;
    point_.name = name;
  }

  constexpr Point& string1(const char* label, const char* value) noexcept {
    point_.string1 = {label, value};
    return *this;
  }
  constexpr Point& string2(const char* label, const char* value) noexcept {
    point_.string2 = {label, value};
    return *this;
  }
  template <class Value>
  Point& number1(const char* label, Value value) noexcept {
    point_.number1 = number(label, value);
    return *this;
  }
  template <class Value>
  Point& number2(const char* label, Value value) noexcept {
    point_.number2 = number(label, value);
    return *this;
  }
  // The array is not copied.
  constexpr Point& attributes(const tessel_attribute* first, size_t count) noexcept {
    point_.attributes = first;
    point_.attribute_count = count;
    return *this;
  }
  constexpr Point& intervalId(const char* id) noexcept {
    point_.interval_id = id;
    return *this;
  }
  constexpr Point& systemScope(bool system = true) noexcept {
    point_.system_scope = system;
    return *this;
  }
  constexpr Point& telemetry(bool on = true) noexcept {
    point_.telemetry = on;
    return *this;
  }
  // Rather lost than waited for.
  constexpr Point& noWait(bool on = true) noexcept {
    point_.no_wait = on;
    return *this;
  }

  constexpr operator const tessel_point&() const noexcept { return point_; }

 private:
  template <class Value>
  static tessel_number number(const char* label, Value value) noexcept {
    static_assert(std::is_arithmetic<Value>::value && !std::is_same<Value, bool>::value,
                  "a number is an integer or a floating-point number");
    return number(label, value, std::is_floating_point<Value>(), std::is_signed<Value>());
  }
  template <class Value>
  static tessel_number number(const char* label, Value value, std::true_type /*floating*/,
                              std::true_type /*signed*/) noexcept {
    return tessel_double(label, static_cast<double>(value));
  }
  static tessel_number number(const char* label, int64_t value, std::false_type,
                              std::true_type) noexcept {
    return tessel_int(label, value);
  }
  static tessel_number number(const char* label, uint64_t value, std::false_type,
                              std::false_type) noexcept {
    return tessel_uint(label, value);
  }

  tessel_point point_{};
};

inline int event(const tessel_point& point TESSEL_CALLER_) noexcept {
  return tessel_event(&point, place);
}

// Begins when made and ends when it goes out of scope, or before, by one of its ends; those answer
// as their functions in trace.h do.
class Interval {
 public:
  explicit Interval(const Point& begin TESSEL_CALLER_) noexcept : point_(begin), place_(place) {
    const tessel_point& plain = point_;
    tessel_interval_begin(&plain, &token_, place);
  }
  // The end of a lost begin is lost as well, and is counted; all others need none.
  ~Interval() {
    const tessel_point& plain = point_;
    if (token_.open || token_.lost) tessel_interval_end(&token_, &plain, place_);
  }
  Interval(const Interval&) = delete;
  Interval& operator=(const Interval&) = delete;

  // What the end will say; for values that are not known at the begin.
  Point& point() noexcept { return point_; }

  int end(TESSEL_CALLER_ALONE_) noexcept {
    const tessel_point& plain = point_;
    return tessel_interval_end(&token_, &plain, place);
  }
  // `frameRate` in frames a second.
  int endAnimation(double frameRate TESSEL_CALLER_) noexcept {
    const tessel_point& plain = point_;
    return tessel_animation_end(&token_, &plain, frameRate, place);
  }

 private:
  Point point_;
  tessel_place_ place_;
  tessel_interval token_{};
};

}  // namespace trace
}  // namespace tessel

#endif
