// The rungs of the ladder: ways to read the same journals, each run in a process of its own.

#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace tessel::bench {

struct Rung {
  std::string name;
  // Runs in this program, over a directory of journals; answers the entries it saw, or, where it
  // looks at trace points alone, those. Null: `command` is run by the shell, with
  // $DIRECTORY, $FILES in it and $TESSELCTL set.
  uint64_t (*run)(const std::string& directory);
  std::string command;
  bool slow = false;  // takes many times as long as the others
};

const std::vector<Rung>& rungs();

}  // namespace tessel::bench
