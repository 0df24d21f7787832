// Records an event, an interval and an animation from C++.
//
//   c++ -std=c++17 record.cpp $(pkg-config --cflags tessel-trace) && ./a.out

#include <tessel/trace.h>

using tessel::trace::Interval;
using tessel::trace::Point;

namespace {

Point calendar(const char* name) { return Point("com.vantor.Calendar", "View", name).telemetry(); }

void openView() {
  tessel::trace::event(calendar("Open").string1("period", "week").number1("events", 12));
}

void loadMonth() {
  Interval load(calendar("Load"));
  // ... the work that is measured ...
  load.point().number1("bytes", 18446744073709551615u);  // known only now
}  // the interval ends here, however the function is left

void scrollDown() {
  Interval scroll(calendar("Scroll"));
  scroll.endAnimation(59.94);
}

}  // namespace

int main() {
  openView();
  loadMonth();
  scrollDown();
}
