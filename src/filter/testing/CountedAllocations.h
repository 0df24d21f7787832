// Counts what the process allocates. A test program that asks has its operator new replaced.

#pragma once

#include <cstddef>

namespace tessel::testing {

// How many allocations operator new has made so far, on any thread.
size_t allocationsSoFar();

}  // namespace tessel::testing
