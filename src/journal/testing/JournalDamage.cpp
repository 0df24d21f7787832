#include "journal/testing/JournalDamage.h"

#include <algorithm>
#include <cstddef>
#include <cstring>
#include <random>

#include "journal/JournalFormat.h"

namespace tessel::testing {

using namespace journal_format;

namespace {

class Vandal {
 public:
  Vandal(std::string file, uint64_t seed) : file_(std::move(file)), random_(seed) {}

  std::string work() {
    for (uint64_t faults = 1 + below(8); faults > 0 && file_.size() > kMinHeaderSize; --faults)
      doOne();
    return std::move(file_);
  }

 private:
  uint64_t below(uint64_t limit) { return random_() % std::max<uint64_t>(limit, 1); }
  uint64_t place() { return below(2) == 0 ? below(file_.size()) : somewhereInAnObject(); }
  void put(uint64_t at, uint64_t value) {
    if (at + sizeof value <= file_.size()) std::memcpy(file_.data() + at, &value, sizeof value);
  }

  // An object begins with its type. So this looks for a word that may be the beginning of an
  // object, and aims near it.
  uint64_t somewhereInAnObject() {
    for (int tries = 0; tries < 200; ++tries) {
      const uint64_t at = below(file_.size() / 8) * 8;
      if (at >= kMinHeaderSize && file_[at] > 0 && file_[at] <= kTag) return at + below(8) * 8;
    }
    return below(file_.size());
  }

  uint64_t anOffset() {
    switch (below(5)) {
      case 0:
        return 0;
      case 1:
        return below(file_.size());
      case 2:
        return UINT64_MAX - below(1000);
      case 3:
        return file_.size() - below(200);
      default:
        return below(file_.size() / 8) * 8;
    }
  }

  void doOne() {
    const uint64_t at = place();
    const uint64_t length = std::min<uint64_t>(1 + below(600), file_.size() - at);
    switch (below(8)) {
      case 0:
        file_[at] = static_cast<char>(file_[at] ^ (1 << below(8)));
        break;
      case 1:
        std::fill_n(file_.begin() + static_cast<std::ptrdiff_t>(at), length, '\0');
        break;
      case 2:
        for (uint64_t i = 0; i < length; ++i) file_[at + i] = static_cast<char>(random_());
        break;
      case 3:
        file_.resize(below(20) == 0 ? below(file_.size())
                                    : file_.size() - below(2000) % file_.size());
        break;
      case 4:
        put(at & ~uint64_t{7}, anOffset());
        break;
      case 5:
        put(kHeaderSizeAt + below(18) * 8, anOffset());
        break;
      case 6:
        put(kEntryCountAt, random_());
        break;
      default:
        // Doubles a stretch of the file. An entry that is found twice must not be delivered twice.
        file_.insert(at & ~uint64_t{7}, file_.substr(at & ~uint64_t{7}, length & ~uint64_t{7}));
    }
  }

  std::string file_;
  std::mt19937_64 random_;
};

}  // namespace

void put(std::string& file, uint64_t at, uint64_t value) {
  std::memcpy(file.data() + at, &value, sizeof value);
}

std::string damaged(const std::string& file, uint64_t seed) { return Vandal(file, seed).work(); }

}  // namespace tessel::testing
