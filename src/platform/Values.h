// The values that travel from a trace point to an event: shared strings, numbers and payloads.

#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/FlatIndex.h"
#include "platform/Json.h"

namespace tessel {

// SharedString, StringRef, StringPool: immutable text that carries its hash and may be absent.
//
// A text is stored once, in a reference-counted record that also holds its hash. SharedString owns
// a share of a record; StringRef borrows one, for as long as somebody else keeps it (a pool, a
// SharedString). Both are one pointer wide, and null means absent. Copying either never copies
// text; comparing compares the hash first and looks at the text only where the hashes agree.
//
// Absent equals nothing, not even absent, so neither type has operator==: use sameString().
//
// Threads: records are immutable and their count is atomic, so handles may be copied and read
// anywhere. A StringPool is used by one thread at a time while it grows.

// 64-bit hash of `text`, seeded once per process, so that a writer cannot choose collisions.
uint64_t hashText(std::string_view text);

class StringRecord {
 public:
  StringRecord(const StringRecord&) = delete;
  StringRecord& operator=(const StringRecord&) = delete;

  std::string_view text() const { return {reinterpret_cast<const char*>(this + 1), length_}; }
  uint64_t hash() const { return hash_; }

 private:
  friend class SharedString;
  StringRecord(uint64_t hash, uint32_t length) : hash_(hash), references_(1), length_(length) {}

  const uint64_t hash_;
  mutable std::atomic<uint32_t> references_;
  const uint32_t length_;
};

class SharedString;

// A borrowed string, or absent. Valid while an owner of the record lives.
class StringRef {
 public:
  constexpr StringRef() = default;
  constexpr explicit StringRef(const StringRecord* record) : record_(record) {}

  bool present() const { return record_ != nullptr; }
  explicit operator bool() const { return present(); }
  // REQUIRES: present().
  std::string_view text() const { return record_->text(); }
  // The text, or `fallback` where the string is absent.
  std::string_view textOr(std::string_view fallback) const {
    return record_ ? record_->text() : fallback;
  }
  // The hash; 0 where the string is absent.
  uint64_t hash() const { return record_ ? record_->hash() : 0; }
  const StringRecord* record() const { return record_; }

 private:
  const StringRecord* record_ = nullptr;
};

// An owned string, or absent.
class SharedString {
 public:
  SharedString() = default;
  // Makes a new record for `text`, which has less than 4 GiB.
  explicit SharedString(std::string_view text) : SharedString(text, hashText(text)) {}
  // REQUIRES: hash == hashText(text).
  SharedString(std::string_view text, uint64_t hash);
  // Takes a share of a borrowed string.
  SharedString(StringRef borrowed) : record_(borrowed.record()) { retain(); }
  SharedString(const SharedString& other) : record_(other.record_) { retain(); }
  SharedString(SharedString&& other) noexcept : record_(other.record_) { other.record_ = nullptr; }
  SharedString& operator=(SharedString other) noexcept {
    std::swap(record_, other.record_);
    return *this;
  }
  ~SharedString() { release(); }

  operator StringRef() const { return StringRef(record_); }
  bool present() const { return record_ != nullptr; }
  explicit operator bool() const { return present(); }
  // REQUIRES: present().
  std::string_view text() const { return record_->text(); }
  std::string_view textOr(std::string_view fallback) const {
    return StringRef(*this).textOr(fallback);
  }
  uint64_t hash() const { return StringRef(*this).hash(); }

 private:
  void retain() {
    if (record_) record_->references_.fetch_add(1, std::memory_order_relaxed);
  }
  void release();

  const StringRecord* record_ = nullptr;
};

// True when both are present and their texts are equal. An absent string equals nothing.
inline bool sameString(StringRef a, StringRef b) {
  if (!a.present() || !b.present()) return false;
  if (a.record() == b.record()) return true;
  return a.hash() == b.hash() && a.text() == b.text();
}
inline bool sameString(StringRef a, std::string_view b) { return a.present() && a.text() == b; }

// Stores each distinct text once and lends it out.
class StringPool {
 public:
  StringPool() = default;
  StringPool(const StringPool&) = delete;
  StringPool& operator=(const StringPool&) = delete;

  struct Noted {
    StringRef string;
    uint32_t& note;  // valid until the next call of intern() or internNoted()
  };

  // This pool's only record of `text`, which the first call makes. Valid while the pool lives.
  StringRef intern(std::string_view text) { return internNoted(text).string; }
  // The same, with a number that the pool keeps beside each string for its user. It begins as 0.
  Noted internNoted(std::string_view text);
  size_t size() const { return strings_.size(); }
  // Bytes held by the texts and their records alone.
  size_t textBytes() const { return textBytes_; }
  // Bytes held by the texts, their records and the bookkeeping of both.
  size_t memoryUsed() const {
    return textBytes_ + strings_.capacity() * sizeof(Kept) + index_.memoryUsed();
  }

 private:
  struct Kept {
    SharedString string;
    uint32_t note = 0;
  };

  std::vector<Kept> strings_;
  FlatIndex index_;  // of strings_
  size_t textBytes_ = 0;
};

// Number and Payload: what an analytics event carries.
//
// Both are plain values. A payload is completed on one thread and then shared unchanged.

// A number that keeps its kind from the recording application to the event. Booleans are numbers. A
// 32-bit float stays a 32-bit float, and a 64-bit integer never passes through a double.
using Number = std::variant<bool, int64_t, uint64_t, float, double>;

// False for false, 0 and 0.0; true for every other number.
bool booleanValue(const Number& number);
// The number as JSON text: the shortest digits that read back as the same number of its kind ("5"
// for an integer, "5.0" for a float or double), "true" or "false" for a boolean, "null" for a
// number that is not finite.
std::string numberText(const Number& number);

// A flat dictionary: keys to strings or numbers, in the order in which the keys were first set.
class Payload {
 public:
  using Value = std::variant<SharedString, Number>;
  // Keys are literals: the views given to set() must outlive the payload.
  using Entry = std::pair<std::string_view, Value>;

  // Setting an absent string changes nothing: a key that has a value keeps it.
  void set(std::string_view key, SharedString value);
  void set(std::string_view key, Number value);
  // The value under `key`; null where there is none.
  const Value* find(std::string_view key) const;
  const std::vector<Entry>& entries() const { return entries_; }

 private:
  void store(std::string_view key, Value value);

  std::vector<Entry> entries_;
};

// The payload as one JSON object, keys in payload order. Bytes of a string that are not
// valid UTF-8 become U+FFFD, one for each maximal invalid part.
std::string payloadJson(const Payload& payload, JsonStyle style = {});

}  // namespace tessel
