#include "platform/Invariant.h"

#include <cstdio>
#include <cstdlib>

namespace tessel {

void invariantBroken(const char* condition, const char* file, int line) {
  // Not through the log: its sink may be what is broken.
  std::fprintf(stderr, "error: broken invariant at %s:%d: %s\n", file, line, condition);
  std::abort();
}

}  // namespace tessel
