// The processing call: delivery, counts, stops, the limit on pairs, and real stores.

#include "trace/JournalExtractor.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "journal/EntryRecording.h"
#include "journal/EntryStream.h"
#include "os/testing/TemporaryDirectory.h"
#include "platform/testing/Fakes.h"
#include "trace/testing/FakeEntryStream.h"

namespace tessel {
namespace {

using ::testing::Contains;
using ::testing::ElementsAre;
using testing::FakeEntry;
using testing::FakeEntryStream;
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

TEST_F(JournalExtractorTest, pairsOverTheLimitAreRefused) {
  limits.pairs.pairs = 2;
  process({tracePoint("event|CATEGORY=a"), tracePoint("event|CATEGORY=b"),
           tracePoint("event|CATEGORY=c"), tracePoint("begin|CATEGORY=c"),
           tracePoint("end|CATEGORY=c"), tracePoint("event|CATEGORY=a"),
           tracePoint("event|CATEGORY=b|SUBSYSTEM=s")});
  EXPECT_THAT(delivered, ElementsAre("Event a", "Event b", "Event a"));
  const ExtractionReport report = extractor().report();
  EXPECT_EQ(report.pairs, 2u);
  EXPECT_EQ(report.store.reading.losses.sum(LossCode::beyondPairLimit), 3u);
}

TEST_F(JournalExtractorTest, theTextOfPairsIsLimitedToo) {
  limits.pairs.textBytes = 64;
  process({tracePoint("event|CATEGORY=" + std::string(40, 'x')),
           tracePoint("event|CATEGORY=" + std::string(40, 'y')),
           tracePoint("event|CATEGORY=" + std::string(40, 'x'))});
  EXPECT_EQ(delivered.size(), 2u);
}

TEST_F(JournalExtractorTest, anEarlyStopReturnsAtOnce) {
  extractor().stopProcessing();
  std::optional<PlatformError> error;
  EXPECT_TRUE(extractor().processLogArchiveWithPath("/nowhere", Date{}, Date::max(), error));
  process({tracePoint("event")});
  EXPECT_THAT(delivered, IsEmpty());
  EXPECT_TRUE(extractor().report().stopped);
}

TEST_F(JournalExtractorTest, aStopOrARefusalEndsTheCall) {
  for (const bool byStop : {true, false}) {
    startAfresh();
    answer = [&] {
      if (byStop && delivered.size() == 2) extractor().stopProcessing();
      return byStop || delivered.size() < 2;
    };
    process({tracePoint("event"), tracePoint("event"), tracePoint("event")});
    EXPECT_EQ(delivered.size(), 2u) << byStop;
  }
}

// Never ends and holds no trace point.
class EndlessStream final : public EntryStream {
 public:
  bool next() override { return true; }
  const EntryHeader& header() const override { return header_; }
  Entry entry() override { return {header_, {}}; }

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
  EXPECT_EQ(extractor().reading()->losses.sum(LossCode::malformed), 2u);
  EXPECT_THAT(log.lines(), Contains("Trace store: lost 2 malformed: missing TESSEL_SUBSYSTEM"));
}

}  // namespace
}  // namespace tessel
