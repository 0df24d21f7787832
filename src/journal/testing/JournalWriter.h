// JournalWriter: makes journal files of any layout in memory, for tests only. The daemon of the
// machine that runs the tests writes one layout; this also writes XZ, LZ4, old headers and seals.
// Its files are small, and the offsets of their objects are known, so tests can damage them.

#pragma once

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "journal/EntryStream.h"

namespace tessel::testing {

struct JournalLayout {
  bool compact = false;
  bool keyed = false;
  uint8_t compression = 0;   // of journal_format::DataFlag
  size_t compressFrom = 64;  // bytes
  uint64_t headerSize = 256;
  uint8_t state = 2;       // of journal_format::FileState
  unsigned sealEvery = 0;  // entries between two tags; 0: not sealed
  Id128 sequenceId{7};
};

class JournalWriter {
 public:
  explicit JournalWriter(JournalLayout layout = {});

  // Appends an entry. If the sequence number of `header` is 0, it gets the next one.
  void add(EntryHeader header, const std::vector<std::string>& fields);
  // Appends `count` entries of a few fields each, some of them shared, one second apart.
  void addSome(size_t count, uint64_t firstSequence = 1);
  // The file as it stands.
  std::string bytes() const;

  // Offsets of objects, for tests that damage them.
  const std::vector<uint64_t>& entries() const { return entries_; }
  const std::vector<uint64_t>& arrays() const { return all_.arrays; }
  uint64_t dataOf(const std::string& field) const { return data_.at(field).offset; }
  const std::vector<uint64_t>& arraysOf(const std::string& field) const {
    return data_.at(field).list.arrays;
  }

 private:
  // A chain of arrays of entries, each twice as long as the one before.
  struct List {
    uint64_t firstAt = 0;  // where the offset of the first array is put
    std::vector<uint64_t> arrays;
    uint64_t capacity = 0;  // of the last
    uint64_t used = 0;
  };
  struct Data {
    uint64_t offset = 0;
    uint64_t entries = 0;
    List list;
  };

  uint64_t beginObject(uint8_t type, uint8_t flags, uint64_t size);
  Data& dataFor(const std::string& field);
  void link(List& list, uint64_t entry);
  void link(Data& data, uint64_t entry);
  template <typename T>
  void put(uint64_t at, T value);
  size_t offsetSize() const { return layout_.compact ? 4 : 8; }
  void putOffset(uint64_t at, uint64_t offset);

  JournalLayout layout_;
  std::string file_;
  std::map<std::string, Data> data_;
  std::set<std::string> fields_;
  std::vector<uint64_t> entries_;
  List all_;
  uint64_t objects_ = 0;
  uint64_t sequence_ = 0;
};

}  // namespace tessel::testing
