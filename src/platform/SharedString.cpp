// Records, the seeded hash and the interning table of SharedString.h.

#include "platform/SharedString.h"

#include <cstring>
#include <limits>
#include <new>
#include <random>
#include <stdexcept>

namespace tessel {

namespace {

// Either factor of a product holds one of them: with a factor that a text alone decides, a text
// could make the product zero, and with it forget what went before.
struct Seeds {
  uint64_t first;
  uint64_t second;
};

const Seeds& processSeeds() {
  static const Seeds seeds = [] {
    std::random_device device;
    const auto word = [&] { return (uint64_t{device()} << 32) ^ device(); };
    return Seeds{word(), word()};
  }();
  return seeds;
}

__extension__ using Wide = unsigned __int128;

uint64_t mix(uint64_t a, uint64_t b) {
  const Wide product = Wide{a} * b;
  return static_cast<uint64_t>(product) ^ static_cast<uint64_t>(product >> 64);
}

uint64_t load(const char* at, size_t count) {
  uint64_t word = 0;
  std::memcpy(&word, at, count);
  return word;
}

}  // namespace

uint64_t hashText(std::string_view text) {
  constexpr uint64_t kOdd = 0x9e3779b97f4a7c15u;
  const auto [first, second] = processSeeds();
  uint64_t state = first;
  const char* at = text.data();
  size_t left = text.size();
  for (; left > 16; at += 16, left -= 16) {
    state = mix(load(at, 8) ^ state, load(at + 8, 8) ^ second);
  }
  const size_t low = left < 8 ? left : 8;
  state = mix(load(at, low) ^ state, load(at + low, left - low) ^ second);
  return mix(state ^ text.size(), kOdd);
}

SharedString::SharedString(std::string_view text, uint64_t hash) {
  if (text.size() > std::numeric_limits<uint32_t>::max()) throw std::length_error("SharedString");
  void* storage = ::operator new(sizeof(StringRecord) + text.size());
  auto* record = new (storage) StringRecord(hash, static_cast<uint32_t>(text.size()));
  if (!text.empty())
    std::memcpy(static_cast<char*>(storage) + sizeof(StringRecord), text.data(), text.size());
  record_ = record;
}

void SharedString::release() {
  if (record_ == nullptr) return;
  if (record_->references_.fetch_sub(1, std::memory_order_acq_rel) != 1) return;
  record_->~StringRecord();
  ::operator delete(const_cast<StringRecord*>(record_));
}

StringPool::Noted StringPool::internNoted(std::string_view text) {
  if (size_ * 2 >= slots_.size()) grow();
  const uint64_t hash = hashText(text);
  const auto half = static_cast<uint32_t>(hash);
  const size_t mask = slots_.size() - 1;
  for (size_t at = half & mask;; at = (at + 1) & mask) {
    Slot& slot = slots_[at];
    if (!slot.string) {
      slot = {SharedString(text, hash), half, 0};
      ++size_;
      textBytes_ += sizeof(StringRecord) + text.size();
      return {slot.string, slot.note};
    }
    if (slot.hash == half && slot.string.text() == text) return {slot.string, slot.note};
  }
}

void StringPool::grow() {
  std::vector<Slot> old(slots_.empty() ? 64 : slots_.size() * 2);
  old.swap(slots_);
  const size_t mask = slots_.size() - 1;
  for (Slot& kept : old) {
    if (!kept.string) continue;
    size_t at = kept.hash & mask;
    while (slots_[at].string) at = (at + 1) & mask;
    slots_[at] = std::move(kept);
  }
}

}  // namespace tessel
