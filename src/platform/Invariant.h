// TESSEL_INVARIANT: a check of our own bookkeeping that stays in the release build.
//
// The books are what this service is for. A run that has lost count must not send a summary that
// looks right, so it ends here, with the place, and the marker that it leaves makes it seen. Only
// our own mistakes are checked like this: whatever came from outside is counted under a reason
// instead. Any thread.

#pragma once

#include <cstdio>
#include <cstdlib>

namespace tessel {

// Says on standard error what does not hold and where, and aborts.
[[noreturn]] inline void invariantBroken(const char* condition, const char* file, int line) {
  // Not through the log: its sink may be what is broken.
  std::fprintf(stderr, "error: broken invariant at %s:%d: %s\n", file, line, condition);
  std::abort();
}

}  // namespace tessel

// A macro, because the message quotes the condition.
#define TESSEL_INVARIANT(condition) \
  ((condition) ? void() : ::tessel::invariantBroken(#condition, __FILE_NAME__, __LINE__))
