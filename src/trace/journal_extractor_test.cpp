// The processing call: delivery, counts, stops, the shares of writers, and real stores.

#include "trace/JournalExtractor.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "journal/EntryRecording.h"
#include "journal/EntryStream.h"
#include "os/testing/TemporaryDirectory.h"
#include "platform/Analytics.h"
#include "platform/testing/Fakes.h"
#include "trace/testing/FakeEntryStream.h"

namespace tessel {
namespace {

using ::testing::Contains;
using ::testing::Each;
using ::testing::ElementsAre;
using testing::FakeEntry;
using testing::FakeEntryStream;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using testing::tracePoint;
using Lines = std::vector<std::string>;

class JournalExtractorTest : public ::testing::Test {
 protected:
  JournalExtractor& extractor() {
    if (!extractor_) {
      extractor_ = std::make_unique<JournalExtractor>(std::nullopt, limits);
      extractor_->setEmitEventProcessingBlock(
          [this](const auto& event) { return deliver(*event); });
      extractor_->setIntervalCompletionProcessingBlock(
          [this](const auto& interval) { return deliver(*interval); });
      extractor_->setAnimationIntervalCompletionProcessingBlock(
          [this](const auto& interval) { return deliver(*interval); });
      extractor_->setBuildAnimationCompositeIntervalTimelines(false);
    }
    return *extractor_;
  }
  void startAfresh() {
    extractor_.reset();
    delivered.clear();
  }
  void process(std::vector<FakeEntry> entries) {
    FakeEntryStream stream(extractor().tokenizer(), std::move(entries));
    extractor().processEntries(stream);
  }

  ExtractionLimits limits;
  Lines delivered;
  std::function<bool()> answer = [] { return true; };

 private:
  bool deliver(const TesselObject& object) {
    delivered.push_back(std::string(object.tesselType()) + " " +
                        std::string(object.category().text()));
    return answer();
  }
  std::unique_ptr<JournalExtractor> extractor_;
};

TEST_F(JournalExtractorTest, eachKindHasItsCallback) {
  process({{{"MESSAGE=a log event"}, {}},
           tracePoint("event"),
           tracePoint("begin"),
           tracePoint("end"),
           tracePoint("begin|FRAME_RATE=60"),
           tracePoint("end"),
           tracePoint("nonsense"),
           tracePoint("end")});
  EXPECT_THAT(delivered, ElementsAre("Event View", "Interval View", "AnimationInterval View"));
  EXPECT_EQ(extractor().processedEventCount(), 8u);
  const ExtractionReport report = extractor().report();
  EXPECT_EQ(report.delivered, 3u);
  EXPECT_EQ(report.store.reading.losses.sum(LossCode::malformed), 1u);
  EXPECT_EQ(report.assembly.unmatchedEnds, 1u);
  EXPECT_EQ(report.assembly.withoutImagePath, 6u);
}

TEST_F(JournalExtractorTest, aStreamThatGrewIsTakenUpAgain) {
  FakeEntryStream stream(extractor().tokenizer(), {tracePoint("begin", 1'000'000)});
  extractor().processEntries(stream);
  EXPECT_THAT(delivered, IsEmpty());
  stream.entries.push_back(tracePoint("end", 2'000'000));
  extractor().processEntries(stream);
  EXPECT_THAT(delivered, ElementsAre("Interval View"));
  EXPECT_EQ(extractor().processedEventCount(), 2u);
}

TEST_F(JournalExtractorTest, currentEntryIsTheObjects) {
  std::vector<FakeEntry> entries = {tracePoint("begin"), tracePoint("end"), tracePoint("event")};
  for (size_t i = 0; i < entries.size(); ++i) entries[i].header.sequenceNumber = i;
  std::vector<uint64_t> numbers;
  answer = [&] {
    numbers.push_back(extractor().currentEntry().sequenceNumber);
    return true;
  };
  process(entries);
  EXPECT_THAT(numbers, ElementsAre(1, 2));
}

// How many of `count` new pairs the writer gets delivered.
class SharesTest : public JournalExtractorTest {
 protected:
  size_t got(const std::string& writer, int count, const std::string& text = "") {
    const size_t before = delivered.size();
    std::vector<FakeEntry> entries;
    for (int i = 0; i < count; ++i)
      entries.push_back(tracePoint("event|CATEGORY=" + std::to_string(next_++) + text + writer));
    process(std::move(entries));
    return delivered.size() - before;
  }
  std::vector<std::string> losses() {
    std::vector<std::string> lines;
    const ExtractionReport report = extractor().report();
    for (const Loss& loss : report.store.reading.losses.all()) {
      if (isOverShare(loss.code))
        lines.push_back(std::to_string(loss.count) + " " + loss.description());
    }
    return lines;
  }

 private:
  int next_ = 100'000;
};

TEST_F(SharesTest, theLastQuarterIsForThoseWhoHoldLittle) {
  limits.shares.pairs = 256;
  EXPECT_EQ(got("|_UID=1|_EXE=/a", 300), 144u) << "three quarters of the three quarters for all";
  EXPECT_EQ(got("|_UID=1|_EXE=/b", 50), 12u) << "a sixteenth of those";
  for (const char* image : {"/c", "/d", "/e"})
    EXPECT_EQ(got("|_UID=1|_EXE=" + std::string(image), 50), 12u) << image;
  EXPECT_EQ(got("|_UID=1|_EXE=/f", 50), 0u) << "the last quarter is for other users";
  EXPECT_EQ(got("|_UID=2|_EXE=/a", 50), 16u) << "a sixteenth of all";
  EXPECT_EQ(got("|_UID=2|_EXE=/b", 50), 0u);
  EXPECT_EQ(got("|_UID=3|_SYSTEMD_OWNER_UID=1|_EXE=/g", 50), 0u) << "a session has one owner";
  EXPECT_EQ(got("|_UID=3|_SYSTEMD_OWNER_UID=4|_EXE=/g", 50), 16u);
  EXPECT_EQ(got("|_UID=7", 50), 16u) << "without owner and executable: the unknown writer";
  EXPECT_EQ(got("|_UID=8", 50) + got("", 50), 0u) << "he is one, whatever users he had";
  EXPECT_EQ(got("|_UID=8|_SYSTEMD_OWNER_UID=9", 50), 16u);
  EXPECT_EQ(got("|_UID=10|_EXE=/a", 50), 0u) << "all are given away";
  process({tracePoint("event|CATEGORY=100000|_UID=1|_EXE=/f")});
  EXPECT_EQ(delivered.back(), "Event 100000") << "who holds a pair does not matter";
  EXPECT_EQ(extractor().report().pairs, delivered.size() - 1);
  EXPECT_THAT(losses(), Contains("156 beyond_pair_limit: too many pairs of subsystem and category "
                                 "(user 1, /a)"));
  EXPECT_THAT(losses(), Contains("134 beyond_pair_limit: too many pairs of subsystem and category "
                                 "(unknown user, unknown)"));
  limits.shares.pairs = 4096;
  limits.shares.pairBytes = 64 * 1024;
  startAfresh();
  EXPECT_EQ(got("|_UID=1|_EXE=/a", 100, std::string(1000, 'x')), 35u) << "text is shared out, too";
  EXPECT_EQ(got("|_UID=2|_EXE=/a", 50), 50u);
  limits.shares = {.pairs = 256};
  limits.table.fields = 50;
  startAfresh();
  EXPECT_EQ(got("|_UID=1|_EXE=/a", 300), 144u) << "other pairs have the tokens of old ones";
  Writers writers({.users = 2});
  std::vector<uint32_t> numbers;
  for (uint32_t user = 0; user < 4; ++user) numbers.push_back(writers.numberOf({user, {}}));
  EXPECT_THAT(numbers, ElementsAre(0, 1, 2, 2)) << "further users are one";
}

TEST_F(SharesTest, programsAreSharedOutWhereTheyMayBeReported) {
  limits.shares.images = 64;
  const auto points = [](const std::string& fields, int count) {
    std::vector<FakeEntry> entries;
    for (int i = 0; i < count; ++i) {
      const std::string image = fields + "/" + std::to_string(i);
      entries.push_back(tracePoint("begin|INTERVAL_SCOPE=system" + image));
      entries.push_back(tracePoint("end|INTERVAL_SCOPE=system" + image));
    }
    return entries;
  };
  process(points("|_UID=1|_EXE=/a", 100));
  EXPECT_EQ(delivered.size(), 100u) << "nothing looks at the executable of an unmarked object";
  process(points("|_UID=1|TELEMETRY=1|_EXE=/a", 100));
  EXPECT_EQ(delivered.size(), 148u);
  process(points("|_UID=2|TELEMETRY=1|_EXE=/b", 3));
  process(points("|_UID=1|TELEMETRY=1|_EXE=/a", 10));
  EXPECT_EQ(delivered.size(), 161u);
  EXPECT_EQ(losses().size(), 17u) << "sixteen programs and the others";
  EXPECT_EQ(extractor().report().store.reading.losses.sum(LossCode::beyondImageLimit), 52u);
  limits.shares.images = 16;
  startAfresh();
  for (int i = 0; i < 20; ++i) {
    process({tracePoint("begin|INTERVAL_SCOPE=system|_UID=1|_EXE=/" + std::to_string(i)),
             tracePoint("end|INTERVAL_SCOPE=system|TELEMETRY=1|_UID=2|_EXE=/honest")});
  }
  EXPECT_THAT(losses(), Each(HasSubstr("(user 1, ")));
  EXPECT_EQ(losses().size(), 12u) << "a begin cannot use up the share of whoever ends it";
}

// A service that takes two steps and some bytes for each object that is called "reported".
TEST_F(SharesTest, timeAndTextCostTheirWriter) {
  testing::FakeClock clock;
  Throttle throttle(clock, clock);
  Spending spending;
  const auto startCharged = [&](uint64_t seconds, uint64_t rowBytes) {
    startAfresh();
    limits.shares.nanoseconds = seconds * 1'000'000'000;
    limits.shares.rowBytes = rowBytes;
    extractor().chargeBy(clock, [&] {
      return Spending{throttle.stepCount(), throttle.sleptTicks(), spending.rowBytes};
    });
  };
  std::chrono::milliseconds rest{0};
  answer = [&] {
    throttle.throttleReportedEvent();
    throttle.throttleReportedEvent();
    clock.advance(rest);
    spending.rowBytes += 10'000;
    return true;
  };
  limits.shares.pairs = 1'000'000;
  const std::string honest = "|_UID=2|_EXE=/a|TELEMETRY=1", junk = "|_UID=1|_EXE=/a|TELEMETRY=1";
  startCharged(64, kNoLimit);
  EXPECT_EQ(got(junk, 3000), 36'000u / 25) << "each step costs 12.5 ms, whichever one sleeps";
  EXPECT_EQ(got(honest, 50), 50u);
  rest = std::chrono::milliseconds{75};
  startCharged(64, kNoLimit);
  EXPECT_EQ(got(junk, 3000), 360u) << "what else the callback takes is added";
  EXPECT_EQ(got("|_UID=3|_EXE=/a", 10), 10u);
  EXPECT_EQ(got(junk, 7), 0u);
  EXPECT_THAT(losses(), ElementsAre("2647 beyond_time_limit: too much of the time of a run "
                                    "(user 1, /a)"));
  rest = std::chrono::hours{8};
  startCharged(64, kNoLimit);
  EXPECT_EQ(got(junk, 3), 3u) << "a machine that slept costs a sixteenth";
  rest = {};
  startCharged(1'000'000, 6'400'000);
  EXPECT_EQ(got(junk, 3000), 360u);
  EXPECT_EQ(got(honest, 50), 40u);
  EXPECT_EQ(extractor().report().store.reading.losses.sum(LossCode::beyondTextLimit), 2650u);
  startCharged(1'000'000, 64'000);
  const std::string text(4000, '\x01');  // six bytes of JSON for each character
  EXPECT_EQ(got(junk, 1, "|STRING1_NAME=" + text), 0u) << "too large at once";
  EXPECT_EQ(got(honest, 1), 1u);
}

TEST_F(JournalExtractorTest, anEarlyStopReturnsAtOnce) {
  extractor().stopProcessing();
  std::optional<PlatformError> error;
  EXPECT_TRUE(extractor().processLogArchiveWithPath("/nowhere", Date{}, Date::max(), error));
  process({tracePoint("event")});
  EXPECT_THAT(delivered, IsEmpty());
  EXPECT_TRUE(extractor().reading()->stopped);
  EXPECT_EQ(extractor().reading()->unread(), extractor().reading()->rangeEnd);
}

TEST_F(JournalExtractorTest, aStopOrARefusalEndsTheCall) {
  for (const bool byStop : {true, false}) {
    startAfresh();
    answer = [&] {
      if (byStop && delivered.size() == 2) extractor().stopProcessing();
      return byStop || delivered.size() < 2;
    };
    std::vector<FakeEntry> entries = {tracePoint("event"), tracePoint("event"),
                                      tracePoint("event")};
    entries[1].header.realtime = 7;
    process(entries);
    EXPECT_EQ(delivered.size(), 2u) << byStop;
    EXPECT_TRUE(extractor().report().stopped);
    EXPECT_EQ(extractor().report().lastEntry, 7u);
  }
}

// Never ends and holds no trace point.
class EndlessStream final : public EntryStream {
 public:
  bool next() override { return true; }
  const EntryHeader& header() const override { return header_; }
  std::span<const FieldToken> tokens() override { return {}; }

 private:
  EntryHeader header_;
};

TEST_F(JournalExtractorTest, aStopNeedsNoDelivery) {
  EndlessStream stream;
  JournalExtractor& running = extractor();  // made before there are two threads
  std::thread stopper([&] { running.stopProcessing(); });
  running.processEntries(stream);
  stopper.join();
  EXPECT_TRUE(running.report().stopped);
}

TEST_F(JournalExtractorTest, aStoreIsReadWithinItsRange) {
  const testing::TemporaryDirectory store;
  RecordOrigin origin = currentOrigin();
  for (const uint64_t time : {99u, 100u, 199u, 200u}) {
    origin.realtime = time;
    ASSERT_FALSE(appendToExportFile(store.path(), origin,
                                    {{"TESSEL_KIND", "event"},
                                     {"TESSEL_SUBSYSTEM", "s"},
                                     {"TESSEL_CATEGORY", std::to_string(time)}}));
    ASSERT_FALSE(appendToExportFile(store.path(), origin, {{"TESSEL_KIND", "begin"}}));
  }
  testing::RecordingLog log;
  std::optional<PlatformError> error;
  const Date start(std::chrono::microseconds(100));
  EXPECT_TRUE(extractor().processLogArchiveWithPath(store.path(), start,
                                                    start + std::chrono::microseconds(100), error));
  EXPECT_THAT(delivered, ElementsAre("Event 100", "Event 199"));
  EXPECT_EQ(extractor().processedEventCount(), 4u);
  extractor().stopProcessing();
  EXPECT_FALSE(extractor().reading()->stopped) << "a stop that comes after the end";
  EXPECT_EQ(extractor().reading()->lastEntry, 199u);
  EXPECT_EQ(extractor().reading()->losses.sum(LossCode::malformed), 2u);
  EXPECT_THAT(log.lines(), Contains("Trace store: lost 2 malformed: missing TESSEL_SUBSYSTEM"));
}

}  // namespace
}  // namespace tessel
