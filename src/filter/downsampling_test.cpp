// The downsampling tree: the entry's arithmetic, where entries land, which one applies.

#include <gtest/gtest.h>

#include <csignal>
#include <limits>
#include <map>
#include <random>

#include "filter/DefaultDownsampling.h"
#include "filter/SubsystemCategoryFilter/TRSubsystemCategoryNameFilter.h"
#include "objects/testing/TestObjects.h"
#include "platform/testing/Fakes.h"

namespace tessel {
namespace {

using testing::makeEvent;
using testing::TestPoint;
using Text = TestPoint::Text;

struct Path {
  Text subsystem, category, name;
};

std::shared_ptr<const TesselObject> objectAt(const Path& path) {
  TestPoint point;
  point.subsystem = path.subsystem;
  point.category = path.category;
  point.name = path.name;
  return makeEvent(point);
}

ConfigurationValue::Dictionary row(const Path& path, std::optional<Number> cap,
                                   std::optional<Number> ratio) {
  ConfigurationValue::Dictionary dictionary;
  if (path.subsystem) dictionary["Subsystem"] = {*path.subsystem};
  if (path.category) dictionary["Category"] = {*path.category};
  if (path.name) dictionary["Name"] = {*path.name};
  if (cap) dictionary["Cap"] = {*cap};
  if (ratio) dictionary["DownsampleRatio"] = {*ratio};
  return dictionary;
}

std::shared_ptr<TRSubsystemCategoryNameFilter> filterOf(const DownsampleConfiguration& rows) {
  return TRSubsystemCategoryNameFilter::initWithDictionaryArray(rows);
}

Number whole(uint64_t value) { return value; }

void addEntry(TRSubsystemCategoryNameFilter& filter, const Path& path, uint64_t cap,
              uint64_t ratio) {
  const auto shared = [](const Text& text) { return text ? SharedString(*text) : SharedString(); };
  filter.addEntryWithSubsystem(shared(path.subsystem), shared(path.category), shared(path.name),
                               cap, ratio);
}

// The cap of the entry that applies to an object at `path`; nothing where none does.
std::optional<uint64_t> capAt(const TRSubsystemCategoryNameFilter& filter, const Path& path) {
  const auto* entry = filter.downsampleEntryForObject(*objectAt(path));
  return entry ? std::optional(entry->cap()) : std::nullopt;
}

TEST(DownsampleEntryTest, LetsThroughEveryRatiothUpToTheCap) {
  const struct {
    uint64_t cap, ratio;
    uint64_t calls;
  } cases[] = {{0, 1, 10}, {3, 1, 10}, {0, 503, 1200}, {500, 503, 252506}, {2, 7, 100}};
  for (const auto& each : cases) {
    const auto entry = TRDownsampleEntry::initWithCap(each.cap, each.ratio);
    uint64_t reported = 0;
    for (uint64_t number = 1; number <= each.calls; ++number) {
      const bool expected = number % each.ratio == 0 && number / each.ratio <= each.cap;
      ASSERT_EQ(entry->shouldReportThisTime(), expected) << each.cap << " " << number;
      reported += expected;
    }
    EXPECT_EQ(entry->eventsSeen(), each.calls);
    EXPECT_EQ(entry->eventsReported(), reported);
    EXPECT_EQ(reported, std::min(each.cap, each.calls / each.ratio));
  }
}

TEST(DownsampleEntryTest, ARatioOfZeroMakesNone) {
  const testing::RecordingLog log;
  EXPECT_EQ(TRDownsampleEntry::initWithCap(5, 0), nullptr);
  EXPECT_EQ(log.lines(),
            std::vector<std::string>{"Tried to create a downsample entry with 0 downsample ratio"});
}

TEST(DownsamplingFilterTest, AnEntryLandsAtTheFirstAbsentString) {
  const struct {
    Path row, object;
    bool applies;
  } cases[] = {
      {{"S", {}, {}}, {"S", "C", "N"}, true},
      {{"S", {}, {}}, {"S", {}, {}}, true},
      {{"S", {}, {}}, {"T", "C", "N"}, false},
      {{"S", "C", {}}, {"S", "C", "N"}, true},
      {{"S", "C", {}}, {"S", {}, "N"}, false},
      {{"S", "C", {}}, {"S", "D", "N"}, false},
      {{"S", "C", "N"}, {"S", "C", "N"}, true},
      {{"S", "C", "N"}, {"S", "C", {}}, false},
      {{"S", "C", "N"}, {"S", "C", "M"}, false},
      {{"S", "C", "N"}, {"s", "C", "N"}, false},
      // The name plays no part without its category, and an absent subsystem means the root.
      {{"S", {}, "N"}, {"S", "C", "M"}, true},
      {{{}, "C", "N"}, {"T", "D", "M"}, true},
      {{{}, {}, {}}, {{}, {}, {}}, true},
  };
  for (const auto& each : cases) {
    const auto filter = filterOf({});
    addEntry(*filter, each.row, 9, 1);
    EXPECT_EQ(capAt(*filter, each.object).has_value(), each.applies)
        << each.row.subsystem.value_or("-") << each.row.category.value_or("-")
        << each.row.name.value_or("-") << " for " << each.object.subsystem.value_or("-")
        << each.object.category.value_or("-") << each.object.name.value_or("-");
  }
}

TEST(DownsamplingFilterTest, AConfigurationRowThatLacksAValueMakesNoFilter) {
  const Path path{"S", {}, {}};
  const auto good = row(path, whole(1), whole(1));
  const struct {
    ConfigurationValue::Dictionary bad;
    const char* message;
  } cases[] = {
      {row({{}, "C", "N"}, whole(1), whole(1)), "Missing required subsystem"},
      {row({{}, {}, {}}, std::nullopt, std::nullopt), "Missing required subsystem"},
      {row(path, std::nullopt, whole(1)), "Missing required cap"},
      {row(path, std::nullopt, std::nullopt), "Missing required cap"},
      {row(path, whole(1), std::nullopt), "Missing required downsample ratio"},
      {{{"Subsystem", {whole(1)}}}, "Missing required subsystem"},
  };
  for (const auto& each : cases) {
    const testing::RecordingLog log;
    // The row after it would be logged, too, were it read.
    EXPECT_EQ(filterOf({good, each.bad, row(path, whole(1), whole(0))}), nullptr);
    EXPECT_EQ(log.lines(), std::vector<std::string>{each.message});
  }
  const testing::RecordingLog log;
  EXPECT_EQ(TRSubsystemCategoryNameFilter::initWithDictionaryArray(std::nullopt), nullptr);
  EXPECT_TRUE(log.lines().empty());
}

TEST(DownsamplingFilterTest, ARowWithARatioOfZeroIsSkipped) {
  const testing::RecordingLog log;
  const auto filter =
      filterOf({row({"S", {}, {}}, whole(1), whole(0)), row({"T", {}, {}}, whole(5), whole(1))});
  ASSERT_NE(filter, nullptr);
  EXPECT_EQ(capAt(*filter, {"S", "C", "N"}), std::nullopt);
  EXPECT_EQ(capAt(*filter, {"T", "C", "N"}), 5u);
  EXPECT_EQ(log.lines().size(), 1u);
}

TEST(DownsamplingFilterTest, NumbersOfAnyKindAreReadAsUnsigned) {
  constexpr uint64_t kMost = std::numeric_limits<uint64_t>::max();
  const struct {
    Number cap;
    uint64_t read;
  } cases[] = {{kMost, kMost},
               {int64_t{-1}, kMost},
               {7.9, 7},
               {7.9F, 7},
               {true, 1},
               {-3.5, 0},
               {1e30, kMost},
               {18446744073709551616.0, kMost},
               {std::numeric_limits<double>::quiet_NaN(), 0}};
  for (const auto& each : cases) {
    const auto filter = filterOf({row({"S", "C", "N"}, each.cap, whole(1))});
    EXPECT_EQ(capAt(*filter, {"S", "C", "N"}), each.read) << numberText(each.cap);
  }
}

// What the rules say, without a tree: the row with the most strings in common wins, and lets
// through the objects whose running number is a multiple of its ratio, `cap` of them. A row for the
// path of another takes its place and starts afresh; with a ratio of 0 it takes it away.
class NaiveDownsampling {
 public:
  void add(Path path, uint64_t cap, uint64_t ratio) {
    if (!path.subsystem) path.category = {};
    if (!path.category) path.name = {};
    std::erase_if(rows_, [&](const Row& each) { return same(each.path, path); });
    if (ratio != 0) rows_.push_back({path, cap, ratio, 0});
  }
  bool reports(const Path& object) {
    Row* best = nullptr;
    for (Row& each : rows_) {
      if (covers(each.path, object) && (!best || depth(each.path) > depth(best->path)))
        best = &each;
    }
    if (best == nullptr) return true;
    ++best->seen;
    return best->seen % best->ratio == 0 && best->seen / best->ratio <= best->cap;
  }

 private:
  struct Row {
    Path path;
    uint64_t cap, ratio, seen;
  };
  static bool same(const Path& a, const Path& b) {
    return a.subsystem == b.subsystem && a.category == b.category && a.name == b.name;
  }
  static int depth(const Path& path) {
    return path.subsystem.has_value() + path.category.has_value() + path.name.has_value();
  }
  static bool covers(const Path& path, const Path& object) {
    return (!path.subsystem || path.subsystem == object.subsystem) &&
           (!path.category || path.category == object.category) &&
           (!path.name || path.name == object.name);
  }
  std::vector<Row> rows_;
};

TEST(DownsamplingFilterTest, LongSequencesAgreeWithANaiveFormulation) {
  std::mt19937 random(503);
  const auto anyText = [&random](const char* prefix, bool mayBeAbsent) -> Text {
    const auto pick = random() % 4;
    if (pick == 3 && mayBeAbsent) return {};
    return prefix + std::to_string(pick % 3);
  };
  const auto anyPath = [&] {
    const bool mayBeAbsent = random() % 2 == 0;
    return Path{anyText("S", mayBeAbsent), anyText("C", mayBeAbsent), anyText("N", mayBeAbsent)};
  };
  for (int tree = 0; tree < 20; ++tree) {
    const auto filter = filterOf({});
    NaiveDownsampling naive;
    for (int i = 0; i < 3000; ++i) {
      if (i < 12 || i % 100 == 0) {
        const Path path = anyPath();
        const uint64_t cap = random() % 6;
        const uint64_t ratio = random() % 5;
        addEntry(*filter, path, cap, ratio);
        naive.add(path, cap, ratio);
      }
      const Path path = anyPath();
      ASSERT_EQ(filter->shouldReportObject(*objectAt(path)), naive.reports(path))
          << "tree " << tree << ", object " << i;
    }
  }
}

struct TierWithoutOperations : FilterTier {
  TierWithoutOperations() : FilterTier(nullptr) {}
};

TEST(FilterTierDeathTest, AbstractOperationsStopTheProcess) {
  const FilterQuery query({}, {}, {});
  const ::testing::KilledBySignal aborted(SIGABRT);
  EXPECT_EXIT(
      static_cast<void>(TierWithoutOperations().keyForChildren(query)), aborted,
      "^Assertion failed: \\(false\\), function -\\[FilterTier keyForChildren:\\], file "
      "tessel_reporter/SubsystemCategoryFilter/TRSubsystemCategoryNameFilter, line 121\\.\n$");
  EXPECT_EXIT(
      static_cast<void>(FilterNameTier().newChildInstance()), aborted,
      "^Assertion failed: \\(false\\), function -\\[FilterTier newChildInstance\\], file "
      "tessel_reporter/SubsystemCategoryFilter/TRSubsystemCategoryNameFilter, line 127\\.\n$");
}

TEST(DefaultDownsamplingTest, SelvinAndQuarroHaveAFilterForTheLifeOfTheProcess) {
  using Platform = TesselReporterPlatform;
  for (const Platform platform : {Platform::selvin, Platform::quarro}) {
    const auto filter = defaultFilterForPlatform(platform);
    const auto again = defaultFilterForPlatform(platform);
    ASSERT_NE(filter, nullptr);
    EXPECT_EQ(filter, again);
    const auto footprint = objectAt({"com.vantor.quellan.knowledge", "tessel", "Footprint"});
    const uint64_t seen = filter->downsampleEntryForObject(*footprint)->eventsSeen();
    EXPECT_FALSE(filter->shouldReportObject(*footprint));
    EXPECT_EQ(again->downsampleEntryForObject(*footprint)->eventsSeen(), seen + 1);
    const auto unshared = makeDefaultFilterForPlatform(platform);
    EXPECT_EQ(unshared->downsampleEntryForObject(*footprint)->eventsSeen(), 0u);
  }
  for (const uint64_t code : {0u, 3u, 4u, 5u, 6u}) {
    EXPECT_EQ(defaultFilterForPlatform(static_cast<Platform>(code)), nullptr);
    EXPECT_EQ(makeDefaultFilterForPlatform(static_cast<Platform>(code)), nullptr);
  }
  EXPECT_NE(defaultFilterForPlatform(Platform::selvin), defaultFilterForPlatform(Platform::quarro));
}

TEST(DefaultDownsamplingTest, TheTablesHoldTheirRows) {
  const struct {
    TesselReporterPlatform platform;
    Path path;
    std::optional<std::pair<uint64_t, uint64_t>> capAndRatio;
  } cases[] = {
      {TesselReporterPlatform::selvin, {"com.vantor.TextInput", "Any", "Any"}, {{500, 503}}},
      {TesselReporterPlatform::selvin, {"com.vantor.TextInput", {}, {}}, {{500, 503}}},
      {TesselReporterPlatform::selvin,
       {"com.vantor.quellan.knowledge", "tessel", "Footprint"},
       {{0, 1}}},
      {TesselReporterPlatform::selvin, {"com.vantor.quellan.knowledge", "tessel", "Other"}, {}},
      {TesselReporterPlatform::selvin,
       {"com.vantor.Mordane.HighSeverity", "SlowNetworkCondition", "CannotSendMailCondition"},
       {{0, 1}}},
      {TesselReporterPlatform::selvin,
       {"com.vantor.Mordane.MediumSeverity", "HighCPUCondition", "GliskBatchIndex"},
       {{0, 1}}},
      {TesselReporterPlatform::selvin,
       {"com.vantor.Mordane.HighSeverity", "HighCPUCondition", "GliskBatchIndex"},
       {}},
      {TesselReporterPlatform::quarro,
       {"com.vantor.quellan.knowledge", "tessel", "Footprint"},
       {{0, 503}}},
      {TesselReporterPlatform::quarro, {"com.vantor.TextInput", "Any", "Any"}, {}},
  };
  for (const auto& each : cases) {
    const auto filter = makeDefaultFilterForPlatform(each.platform);
    const auto* entry = filter->downsampleEntryForObject(*objectAt(each.path));
    ASSERT_EQ(entry != nullptr, each.capAndRatio.has_value());
    if (entry == nullptr) continue;
    EXPECT_EQ(std::pair(entry->cap(), entry->downsampleRatio()), *each.capAndRatio);
  }
  EXPECT_EQ(defaultSelvinConfiguration().size(), 4u);
  EXPECT_EQ(defaultQuarroConfiguration().size(), 1u);
}

}  // namespace
}  // namespace tessel
