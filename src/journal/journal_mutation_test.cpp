// One wrong word in a journal: no trace point is missing or changed without a word.
//
// Every word of the header and of every object is bent in turn: to zero, to the greatest number, by
// one bit, by one place, and to words that mean something, such as the offset of another object of
// the same kind. TESSEL_DAMAGE_ROUNDS=10000 tries so many bends of each kind of file.

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <map>
#include <random>
#include <tuple>

#include "journal/JournalFormat.h"
#include "journal/JournalStore.h"
#include "journal/testing/JournalDamage.h"
#include "journal/testing/JournalOracle.h"
#include "journal/testing/JournalWriter.h"
#include "os/testing/TemporaryDirectory.h"

namespace tessel {
namespace {

using namespace journal_format;
using testing::JournalLayout;
using testing::JournalWriter;
using testing::put;

// The first and the last entry are no trace points: nothing tells whether their boot is right.
constexpr size_t kJournalEntries = 121;

uint64_t wordAt(const std::string& file, uint64_t at) {
  return load<uint64_t>(reinterpret_cast<const uint8_t*>(file.data()) + at);
}

// Every third entry is a trace point, every fifteenth tells of loss.
JournalWriter journalWith(JournalLayout layout) {
  JournalWriter writer(layout);
  for (size_t i = 1; i <= kJournalEntries; ++i) {
    EntryHeader header;
    header.bootId = {1};
    header.monotonic = i * 1000;
    header.realtime = 1'795'300'000'000'000 + i * 1000;
    const std::string number = std::to_string(i);
    std::vector<std::string> fields = {"_HOSTNAME=desk", "MESSAGE=message " + number + " of some"};
    const auto add = [&](std::vector<std::string> more) {
      fields.insert(fields.end(), more.begin(), more.end());
    };
    if (i % 3 == 0) {
      add({i % 2 == 0 ? "TESSEL_KIND=event" : "TESSEL_KIND=begin", "TESSEL_SUBSYSTEM=com.vantor.a",
           "TESSEL_CATEGORY=Category", "TESSEL_TELEMETRY=" + std::to_string(i % 2),
           "TESSEL_NAME=Operation" + std::to_string(i % 7), "TESSEL_INTERVAL_ID=" + number});
    } else {
      add({"PRIORITY=" + std::to_string(i % 7), "_PID=" + std::to_string(i % 5)});
    }
    if (i % 15 == 1)
      add({"MESSAGE_ID=a596d6fe7bfa4994828e72309e95d61e", "_TRANSPORT=driver", "N_DROPPED=1"});
    writer.add(header, fields);
  }
  return writer;
}

struct Points {
  std::map<std::string, size_t> texts;  // each trace point as it was read, and how often
  uint64_t dropped = 0;
  bool told = false;
};

Points pointsIn(const std::string& path, std::vector<std::string_view> marks) {
  testing::RecordingTokenizer tokenizer(std::move(marks));
  const StopFlag stop{false};
  auto opened = JournalStore::open(path, {}, tokenizer, stop);
  Points points;
  points.told = opened.index() == 1;
  if (points.told) return points;
  for (const auto& entry : testing::readAll(std::get<0>(opened)->entries(), tokenizer)) {
    // The clock may drift, so a minute more or less is not noticed.
    std::string text = textOf(entry.header.bootId) + " " +
                       std::to_string(entry.header.realtime >> 26) + " " +
                       std::to_string(entry.header.monotonic >> 26);
    bool isPoint = false;
    for (const std::string& field : entry.fields) {
      if (field.starts_with("TESSEL_")) text += " " + field;
      isPoint = isPoint || field.starts_with("TESSEL_");
    }
    if (isPoint) ++points.texts[text];
  }
  const StoreReport report = std::get<0>(opened)->report();
  points.told = !report.files.at(0).problems.empty() || report.files.at(0).skipped;
  points.dropped = report.reading.losses.sum(LossCode::droppedByDaemon);
  return points;
}

struct Object {
  uint8_t type;
  uint64_t offset;
  uint64_t size;
};

std::vector<Object> objectsOf(const std::string& file) {
  std::vector<Object> objects;
  for (uint64_t at = wordAt(file, kHeaderSizeAt); at + 16 <= file.size();) {
    objects.push_back({static_cast<uint8_t>(file[at]), at, wordAt(file, at + kObjectSizeAt)});
    at = alignUp(at + objects.back().size);
  }
  return objects;
}

class Bender {
 public:
  Bender(const std::string& file, bool compact)
      : file_(file), objects_(objectsOf(file)), compact_(compact) {}

  // A copy of the file with one bent word, and which word that is.
  std::pair<std::string, std::string> bent(std::mt19937_64& random) const {
    std::string file = file_;
    uint64_t at = random() % (kMinHeaderSize / 8 - 1) * 8 + 8;
    std::string name = "header";
    uint8_t type = 0;
    if (random() % 16 != 0) {
      const Object& object = objects_[random() % objects_.size()];
      type = object.type;
      const uint64_t within = random() % alignUp(object.size) & ~uint64_t{7};
      at = object.offset + within;
      name = "type " + std::to_string(type) + " at " + std::to_string(object.offset) + " + " +
             std::to_string(within);
    }
    const bool half = compact_ && (type == kEntry || type == kEntryArray) && random() % 2 == 0;
    const uint64_t old = wordAt(file, at);
    uint64_t value =
        half ? (old & UINT32_MAX) | other(old >> 32, random) << 32 : other(old, random);
    put(file, at, value);
    return {file, name + ": " + std::to_string(old) + " to " + std::to_string(value)};
  }

 private:
  uint64_t other(uint64_t old, std::mt19937_64& random) const {
    switch (random() % 6) {
      case 0:
        return old == 0 ? UINT64_MAX : 0;
      case 1:
        return old ^ uint64_t { 1 } << random() % (random() % 2 == 0 ? 16 : 64);
      case 2:
        return old + 8;
      case 3:
        return old + 1;
      default:
        return similar(old, random);
    }
  }
  // The offset or the size of another object, of the same type if `old` is an object's.
  uint64_t similar(uint64_t old, std::mt19937_64& random) const {
    const auto known = std::ranges::find(objects_, old, &Object::offset);
    for (int tries = 0; tries < 50; ++tries) {
      const Object& object = objects_[random() % objects_.size()];
      if (known == objects_.end()) return random() % 2 == 0 ? object.size : object.offset;
      if (object.type == known->type && object.offset != old) return object.offset;
    }
    return old + 16;
  }

  const std::string file_;
  const std::vector<Object> objects_;
  const bool compact_;
};

using Parameters = std::tuple<bool, bool, uint8_t, uint8_t>;
class JournalMutationTest : public ::testing::TestWithParam<Parameters> {};

INSTANTIATE_TEST_SUITE_P(Layouts, JournalMutationTest,
                         ::testing::Combine(::testing::Bool(), ::testing::Bool(),
                                            ::testing::Values(0, kXz, kLz4, kZstd),
                                            ::testing::Values(kArchived, kOnline)));

TEST_P(JournalMutationTest, ChangesNothingWithoutAWord) {
  const auto [compact, keyed, compression, state] = GetParam();
  const JournalLayout layout{.compact = compact,
                             .keyed = keyed,
                             .compression = compression,
                             .compressFrom = 24,
                             .state = state};
  const char* wanted = std::getenv("TESSEL_DAMAGE_ROUNDS");
  const uint64_t rounds = wanted != nullptr ? std::strtoull(wanted, nullptr, 10) : 150;
  const testing::TemporaryDirectory directory;
  const std::string good = journalWith(layout).bytes();
  const std::string path = directory.write("a.journal", good);
  const Points truth = pointsIn(path, {"TESSEL_"});
  ASSERT_EQ(truth.texts.size(), kJournalEntries / 3);
  ASSERT_EQ(truth.dropped, kJournalEntries / 15 + 1);
  ASSERT_FALSE(truth.told);
  const Bender bender(good, compact);
  std::mt19937_64 random(1);
  for (uint64_t round = 0; round < rounds; ++round) {
    const auto [file, what] = bender.bent(random);
    directory.write("a.journal", file);
    for (const auto& marks : {std::vector<std::string_view>{"TESSEL_"}, {}}) {
      const Points points = pointsIn(path, marks);
      EXPECT_TRUE(points.told || (points.texts == truth.texts && points.dropped == truth.dropped))
          << what << (marks.empty() ? ", without marks: " : ": ") << points.texts.size();
    }
  }
}

}  // namespace
}  // namespace tessel
