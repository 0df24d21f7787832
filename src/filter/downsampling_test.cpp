// The downsampling tree: what its rows may be, which one applies, what each lets through.

#include <gtest/gtest.h>

#include <csignal>
#include <limits>
#include <map>
#include <random>

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

// The cap of the entry that applies to an object at `path`; absent if no entry applies.
std::optional<uint64_t> capAt(const TRSubsystemCategoryNameFilter& filter, const Path& path) {
  const auto* entry = filter.downsampleEntryForObject(*objectAt(path));
  return entry ? std::optional(entry->cap()) : std::nullopt;
}

TEST(DownsamplingTest, ARowThatLacksAValueMakesNoFilter) {
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
    // The last row, with a ratio of 0, would be logged as well if it were read.
    EXPECT_EQ(filterOf({good, each.bad, row(path, whole(1), whole(0))}), nullptr);
    EXPECT_EQ(log.lines(), std::vector<std::string>{each.message});
  }
  const testing::RecordingLog log;
  EXPECT_EQ(TRSubsystemCategoryNameFilter::initWithDictionaryArray(std::nullopt), nullptr);
  EXPECT_TRUE(log.lines().empty());
}

TEST(DownsamplingTest, ARowWithARatioOfZeroIsSkipped) {
  const testing::RecordingLog log;
  const auto filter =
      filterOf({row({"S", {}, {}}, whole(1), whole(0)), row({"T", {}, {}}, whole(5), whole(1))});
  ASSERT_NE(filter, nullptr);
  EXPECT_EQ(capAt(*filter, {"S", "C", "N"}), std::nullopt);
  EXPECT_EQ(capAt(*filter, {"T", "C", "N"}), 5u);
  EXPECT_EQ(log.lines(),
            std::vector<std::string>{"Tried to create a downsample entry with 0 downsample ratio"});
}

TEST(DownsamplingTest, NumbersOfAnyKindAreReadAsUnsigned) {
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

TEST(DownsamplingTest, AgreesWithANaiveFormulation) {
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

TEST(FilterTierDeathTest, AbstractOperationsAbort) {
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

TEST(DefaultDownsamplingTest, EachPlatformHasOneFilter) {
  using Platform = TesselReporterPlatform;
  for (const Platform platform : {Platform::selvin, Platform::quarro}) {
    const auto filter = defaultFilterForPlatform(platform);
    ASSERT_NE(filter, nullptr);
    EXPECT_EQ(filter, defaultFilterForPlatform(platform));
    EXPECT_NE(filter, makeDefaultFilterForPlatform(platform));
  }
  for (const uint64_t code : {0u, 3u, 4u, 5u, 6u}) {
    EXPECT_EQ(defaultFilterForPlatform(static_cast<Platform>(code)), nullptr);
    EXPECT_EQ(makeDefaultFilterForPlatform(static_cast<Platform>(code)), nullptr);
  }
  EXPECT_NE(defaultFilterForPlatform(Platform::selvin), defaultFilterForPlatform(Platform::quarro));
}

TEST(DefaultDownsamplingTest, TheTablesHoldTheirRows) {
  using Row = std::optional<std::pair<uint64_t, uint64_t>>;  // cap and ratio
  const auto rowFor = [](TesselReporterPlatform platform, const Path& path) -> Row {
    const auto filter = makeDefaultFilterForPlatform(platform);
    const auto* entry = filter->downsampleEntryForObject(*objectAt(path));
    return entry ? Row({entry->cap(), entry->downsampleRatio()}) : std::nullopt;
  };
  const Path text{"com.vantor.TextInput", "Any", "Any"};
  const Path footprint{"com.vantor.quellan.knowledge", "tessel", "Footprint"};
  const Path mail{"com.vantor.Mordane.HighSeverity", "SlowNetworkCondition",
                  "CannotSendMailCondition"};
  Path batch{"com.vantor.Mordane.MediumSeverity", "HighCPUCondition", "GliskBatchIndex"};
  EXPECT_EQ(rowFor(TesselReporterPlatform::selvin, text), Row({500, 503}));
  for (const Path& path : {footprint, mail, batch})
    EXPECT_EQ(rowFor(TesselReporterPlatform::selvin, path), Row({0, 1})) << *path.name;
  batch.subsystem = mail.subsystem;
  Path other = footprint;
  other.name = "Other";
  for (const Path& path : {batch, other})
    EXPECT_EQ(rowFor(TesselReporterPlatform::selvin, path), std::nullopt) << *path.name;
  EXPECT_EQ(rowFor(TesselReporterPlatform::quarro, footprint), Row({0, 503}));
  EXPECT_EQ(rowFor(TesselReporterPlatform::quarro, text), std::nullopt);
  EXPECT_EQ(defaultConfigurationForPlatform(TesselReporterPlatform::selvin)->size(), 4u);
  EXPECT_EQ(defaultConfigurationForPlatform(TesselReporterPlatform::quarro)->size(), 1u);
}

}  // namespace
}  // namespace tessel
