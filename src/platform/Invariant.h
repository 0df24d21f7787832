// TESSEL_INVARIANT: a check of our own bookkeeping that stays in the release build.
//
// This service exists to account for every trace point. A run that has lost count must not send a
// summary that looks right. So the process aborts and names the place, and the run marker that it
// leaves makes the next run notice it. Only our own mistakes are checked like this; bad input is
// counted under a reason instead. Any thread.

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
