// JournalBender: one wrong word in a journal file, for tests only.
//
// Every word of the header and of every object may be the one: it becomes zero, the greatest
// number, another by one bit or by one place, or a word that means something, such as the offset of
// another object of the same kind.

#pragma once

#include <cstdint>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "journal/testing/JournalWriter.h"

namespace tessel::testing {

// Writes the word at an offset of a file that is held in memory.
void put(std::string& file, uint64_t at, uint64_t value);

class JournalBender {
 public:
  // REQUIRES: `file` is a whole journal. `compact` tells its layout.
  JournalBender(std::string file, bool compact);

  // A copy of the file with one bent word, and which word that is.
  std::pair<std::string, std::string> bent(std::mt19937_64& random) const;

 private:
  struct Object {
    uint8_t type;
    uint64_t offset;
    uint64_t size;
  };
  uint64_t other(uint64_t old, std::mt19937_64& random) const;
  uint64_t similar(uint64_t old, std::mt19937_64& random) const;

  const std::string file_;
  std::vector<Object> objects_;
  const bool compact_;
};

// Closed and open files of both layouts, with either hash and each compression.
std::vector<JournalLayout> everyLayout();

// How many bends a test tries of each kind of file: TESSEL_DAMAGE_ROUNDS, else `usual`.
uint64_t damageRounds(uint64_t usual);

}  // namespace tessel::testing
