// DataMarks: which data objects of a file make their entries worth reading.
//
// A user of the store needs only entries that have a field with one of his marks (see
// FieldTokenizer::marks()). This is asked for every field of every entry, and it is all that we ask
// of most entries. So the answer is two bits in a table that the processor keeps near.
//
// The walk over the file passes each data object before the first entry that has it. It shows us
// the text there, where it is at hand. Whoever meets an object that the walk did not show asks the
// text itself: an object that is compressed, or lies behind damage.
//
// Threads: one at a time.

#pragma once

#include <algorithm>
#include <bit>
#include <cstdint>
#include <cstring>
#include <span>
#include <string_view>
#include <vector>

#include "journal/EntryStream.h"

namespace tessel {

class DataMarks {
 public:
  enum State : uint8_t { unknown, plain, mark };

  // Bytes for the tables of all files of a store. They serve 2 GiB of files that are read at once;
  // most files follow one another.
  static constexpr size_t kTotal = size_t{8} << 20;

  // Takes its memory from `bytesLeft` and gives it back at its end. Both must outlive this.
  DataMarks(std::span<const std::string_view> marks, size_t& bytesLeft) : bytesLeft_(bytesLeft) {
    for (const std::string_view text : marks) {
      const uint64_t mask = text.size() < 8 ? (uint64_t{1} << 8 * text.size()) - 1 : UINT64_MAX;
      marks_.push_back({mask, firstWord(text), text});
    }
  }
  ~DataMarks() { bytesLeft_ += 2 * plain_.size() * sizeof(uint64_t); }
  DataMarks(const DataMarks&) = delete;
  DataMarks& operator=(const DataMarks&) = delete;

  // Whether there are marks. Without any, every entry is worth reading.
  bool any() const { return !marks_.empty(); }

  // What is known of the data object at `offset`.
  State at(uint64_t offset) const {
    if (Plain(*this).has(offset)) return plain;
    return isMark(offset) ? mark : unknown;
  }
  bool isMark(uint64_t offset) const { return isSet(mark_.data(), mark_.size(), offset); }
  // The objects that are no mark, as they are known now, for a loop. Void after see().
  class Plain {
   public:
    explicit Plain(const DataMarks& marks)
        : words_(marks.plain_.data()), size_(marks.plain_.size()) {}
    bool has(uint64_t offset) const { return isSet(words_, size_, offset); }
    // The same for four at once, with one look at the size of the table: it is a power of two, so
    // it is greater than all of them if it is greater than their bits together.
    bool hasAll(uint64_t a, uint64_t b, uint64_t c, uint64_t d) const {
      return (a | b | c | d) >> kWordShift < size_ && isSet(words_, a) && isSet(words_, b) &&
             isSet(words_, c) && isSet(words_, d);
    }

   private:
    const uint64_t* words_;
    size_t size_;
  };

  // Looks at the first bytes of the text of the data object at `offset`, kMaxMark of them or the
  // whole text, and remembers whether it is a mark. Answers `unknown` if it is none, but there is
  // no memory left to remember that.
  [[gnu::always_inline]] State see(uint64_t offset, std::string_view head) {
    const uint64_t first = firstWord(head);
    bool candidate = false;
    for (const Mark& one : marks_) candidate |= (first & one.mask) == one.word;
    const uint64_t word = offset >> kWordShift;
    if (candidate || word >= plain_.size()) [[unlikely]]
      return seeUnusual(offset, head);
    plain_[word] |= bitOf(offset) & ~mark_[word];
    return plain;
  }

 private:
  // Data objects are longer than 64 bytes, so each has a place of its own among the stretches of 64
  // bytes. A word has a bit for 64 places.
  static constexpr int kPlaceShift = 6;
  static constexpr int kWordShift = 12;
  // A mark with its first eight bytes as a word: one comparison rules out nearly every text.
  struct Mark {
    uint64_t mask;
    uint64_t word;
    std::string_view text;
  };

  static uint64_t bitOf(uint64_t offset) { return uint64_t{1} << (offset >> kPlaceShift & 63); }
  static bool isSet(const uint64_t* words, size_t size, uint64_t offset) {
    return offset >> kWordShift < size && isSet(words, offset);
  }
  static bool isSet(const uint64_t* words, uint64_t offset) {
    return (words[offset >> kWordShift] >> (offset >> kPlaceShift & 63) & 1) != 0;
  }
  static uint64_t firstWord(std::string_view text) {
    uint64_t word = 0;
    if (text.size() >= sizeof word) [[likely]] {
      std::memcpy(&word, text.data(), sizeof word);
    } else if (!text.empty()) {
      std::memcpy(&word, text.data(), text.size());
    }
    return word;
  }
  [[gnu::noinline]] State seeUnusual(uint64_t offset, std::string_view head) {
    const uint64_t first = firstWord(head);
    // The word tells all of a short mark.
    const auto matches = [&](const Mark& one) {
      return (first & one.mask) == one.word &&
             (one.text.size() <= sizeof first || head.starts_with(one.text));
    };
    const State state = std::ranges::any_of(marks_, matches) ? mark : plain;
    const uint64_t word = offset >> kWordShift;
    if (word >= plain_.size() && !grow(word)) return state == plain ? unknown : mark;
    if (state == mark) mark_[word] |= bitOf(offset);
    // Damage can put two objects into one place. A mark must not be hidden then.
    plain_[word] = (plain_[word] | bitOf(offset)) & ~mark_[word];
    return state;
  }
  bool grow(uint64_t word) {
    if (word > kTotal) return false;
    const auto size = static_cast<size_t>(std::max<uint64_t>(std::bit_ceil(word + 1), 64));
    const size_t more = 2 * (size - plain_.size()) * sizeof(uint64_t);
    if (more > bytesLeft_) return false;
    bytesLeft_ -= more;
    plain_.resize(size);
    mark_.resize(size);
    return true;
  }

  std::vector<Mark> marks_;
  size_t& bytesLeft_;
  std::vector<uint64_t> plain_;
  std::vector<uint64_t> mark_;  // as long
};

}  // namespace tessel
