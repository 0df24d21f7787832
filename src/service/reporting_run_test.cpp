// A whole run over fakes: its order, its exits, the deferral, the books.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <regex>

#include "objects/testing/TestObjects.h"
#include "platform/testing/Fakes.h"
#include "service/ReportingRun.h"

namespace tessel {
namespace {

using ::testing::ElementsAre;
using testing::makeAnimationInterval;
using testing::makeEvent;
using testing::makeInterval;
using ::testing::Pair;
using testing::TestPoint;

class RunTest : public ::testing::Test {
 protected:
  RunTest() { variant.internal = true; }

  std::shared_ptr<TesselSupportObjectExtractor> nextExtractor() {
    log.write(LogLevel::debug, "", "", "(extractor made)");
    return extractor;
  }
  void perform() { run.performReportingRun(activity); }
  // The run's lines up to its first summary section, without those of filter and throttle.
  std::vector<std::string> linesBeforeSummary() const {
    std::vector<std::string> kept;
    for (const std::string& line : log.lines()) {
      if (line.starts_with("**************")) break;
      kept.push_back(line);
    }
    return kept;
  }

  testing::RecordingLog log;
  testing::FakeClock clock;
  testing::ManualQueueFactory queues;
  testing::ManualQueue reportingQueue{"reporting"};
  testing::FakeBuildVariant variant;
  testing::FakeConfigurationService configurations;
  testing::FakeFiles files;
  testing::FakeVolumes volumes;
  testing::FakeBundles bundles;
  testing::RememberingSender sender;
  testing::FakeDates dates;
  std::shared_ptr<testing::FakeExtractor> extractor = std::make_shared<testing::FakeExtractor>();
  std::shared_ptr<testing::FakeActivity> activity = std::make_shared<testing::FakeActivity>();
  testing::FakeServiceStatus status;
  std::vector<RunRecord> records;

  TaskingGate gate{variant, configurations, queues, clock};
  CookieFile cookie{files};
  Throttle throttle{clock, clock};
  ProcessIdentity identity{bundles};
  RunSummary summary{sender, throttle, clock, dates, status};
  EventRoad road{throttle, sender, reportingQueue};
  DeferralPoll poll{queues};
  TraceReading reading{[this] { return nextExtractor(); },
                       [this] {
                         return std::make_shared<ObjectReporter>(
                             TesselReporterObjectFilter::init(variant), bootVolumeFacts(volumes),
                             identity, road);
                       },
                       poll,
                       summary,
                       reportingQueue,
                       clock,
                       status};
  RunBook book{[this](Date) { log.write(LogLevel::debug, "", "", "(begun)"); },
               [this](const RunRecord& record) { records.push_back(record); }};
  ReportingRun run{gate, cookie, reading, clock, status, book};
};

TEST_F(RunTest, GoesThroughItsStepsInOrder) {
  extractor->duringProcessing = [this] { EXPECT_TRUE(files.items.contains(cookieFilePath)); };
  perform();
  EXPECT_THAT(linesBeforeSummary(),
              ElementsAre("Reporting based on os_flavor result", "(begun)", "Created cookie file",
                          "(extractor made)", "Filesystem for '/': ext4", "Boot disk type: SSD"));
  EXPECT_EQ(log.lines().back(), "Cleared cookie file");
  EXPECT_THAT(extractor->calls, ElementsAre("interval callback", "animation callback",
                                            "event callback", "composite off", "process"));
  EXPECT_EQ(extractor->processedPath, std::nullopt);
  EXPECT_EQ(extractor->endDate - extractor->startDate, std::chrono::hours{24});
  EXPECT_EQ(extractor->endDate, clock.date);
  EXPECT_FALSE(files.items.contains(cookieFilePath));
  EXPECT_TRUE(activity->statesSet.empty());
  EXPECT_EQ(records.at(0).outcome, RunOutcome::completed);
  EXPECT_THAT(status.said,
              ElementsAre("waiting for the tasking configuration", "reading the trace store",
                          "summarising", "storing the last rows", "idle"));
}

TEST_F(RunTest, AnObjectIsTwoEventsAndANamelessOneOne) {
  TestPoint point;
  TestPoint nameless;
  nameless.name.reset();
  extractor->objects = {makeEvent(point), makeInterval(point), makeAnimationInterval(point),
                        makeEvent(nameless)};
  extractor->duringProcessing = [this] { EXPECT_EQ(status.steps, extractor->objects.size()); };
  perform();
  const std::vector<std::string> names = sender.names();
  ASSERT_GE(names.size(), 8u);
  for (size_t i = 0; i < 6; i += 2) {
    EXPECT_EQ(names[i], "com.vantor.performance.tessel");
    EXPECT_EQ(names[i + 1], "ts__com.vantor.Calendar__View__Open");
    EXPECT_EQ(sender.events[i].json, sender.events[i + 1].json);
  }
  size_t bytes = 0;
  for (size_t i = 0; i < 7; ++i) bytes += names[i].size() + sender.events[i].json.size();
  EXPECT_EQ(road.queuedBytes(), bytes);
  EXPECT_EQ(names[6], "com.vantor.performance.tessel");
  EXPECT_EQ(names[7], "com.vantor.performance.tessel_counts");
  EXPECT_EQ(records.at(0).unnamed, 1u);
  EXPECT_EQ(names.back(), "com.vantor.performance.tessel_reporting_stats");
  EXPECT_EQ(
      sender.events[0].json,
      R"({"Subsystem":"com.vantor.Calendar","Category":"View","Name":"Open","IntervalType":"Event",)"
      R"("DurationInSeconds":0.0,"StartProcessName":"Unknown","BootPartitionFS":"ext4","BootDiskType":"SSD"})");
}

TEST_F(RunTest, WithoutTaskingNothingIsTouched) {
  variant.internal = false;
  files.items[cookieFilePath] = false;
  perform();
  EXPECT_TRUE(files.items.contains(cookieFilePath));
  EXPECT_TRUE(extractor->calls.empty());
  EXPECT_TRUE(sender.events.empty());
  EXPECT_EQ(records.at(0).outcome, RunOutcome::notTasked);
}

TEST_F(RunTest, AMarkerMakesOnlyOneRunBailOut) {
  files.items[cookieFilePath] = true;
  perform();
  EXPECT_THAT(log.lines(),
              ElementsAre("Reporting based on os_flavor result", "(begun)",
                          "Cookie file exists but is directory", "Bailing due to cookie file",
                          "Cookie file exists but is directory", "Cleared cookie file"));
  EXPECT_TRUE(sender.events.empty());
  perform();
  EXPECT_EQ(sender.names().back(), "com.vantor.performance.tessel_reporting_stats");
  EXPECT_EQ(records.at(0).outcome, RunOutcome::bailedOut);
  EXPECT_EQ(records.at(1).outcome, RunOutcome::completed);
}

TEST_F(RunTest, WithoutAMarkerOfItsOwnARunDoesNothing) {
  files.canCreate = false;
  perform();
  EXPECT_EQ(log.lines().back(), "Could not create cookie file");
  EXPECT_TRUE(extractor->calls.empty());
  EXPECT_EQ(records.at(0).outcome, RunOutcome::failed);
  EXPECT_EQ(records.at(0).failure,
            std::string("the run marker could not be made: ") + cookieFilePath + ": Disk full");
}

TEST_F(RunTest, AMarkerThatStaysIsAnErrorWithTheReason) {
  files.removal = RemovalResult{false, PlatformError{ErrorCode::noAccess, "Permission denied"}};
  perform();
  files.items.clear();
  files.removal = RemovalResult{false, {}};
  perform();
  EXPECT_THAT(log.errors(), ElementsAre("Could not clear cookie file: Permission denied",
                                        "Could not clear cookie file: Unknown error"));
}

TEST_F(RunTest, AMarkerIsClearedAndMadeOnlyIfNeeded) {
  files.removal = RemovalResult{false, PlatformError{ErrorCode::notFound, "gone"}};
  cookie.clearCookieFile();
  files.items[cookieFilePath] = false;
  EXPECT_TRUE(cookie.createCookieFile());
  EXPECT_TRUE(log.lines().empty());
}

TEST_F(RunTest, AFailedExtractionHasASummary) {
  extractor->failure = PlatformError{ErrorCode::notFound, "/store: no such directory"};
  extractor->eventCount = 7;
  perform();
  EXPECT_EQ(log.count("Failed to process tessel data due to error: /store: no such directory"), 1u);
  EXPECT_NE(sender.events.back().json.find("\"LogObjectsProcessed\":7"), std::string::npos);
  EXPECT_FALSE(files.items.contains(cookieFilePath));
  EXPECT_EQ(records.at(0).outcome, RunOutcome::failed);
  EXPECT_EQ(records.at(0).failure, "/store: no such directory");
}

TEST_F(RunTest, AnUnknownFilesystemLeavesItsKeyOut) {
  for (const auto& type : {std::optional<std::string>(), std::optional<std::string>("\xff")}) {
    volumes.type = type;
    extractor->objects = {makeEvent(TestPoint{})};
    sender.events.clear();
    perform();
    EXPECT_EQ(sender.events.at(0).json.find("BootPartitionFS"), std::string::npos);
    EXPECT_NE(sender.events.at(0).json.find("\"BootDiskType\":\"SSD\""), std::string::npos);
  }
  EXPECT_EQ(log.count("Could not determine filesystem type"), 2u);
}

// The class of this object says that it has a payload, but makes none.
struct WithoutPayload final : TesselObject {
  using TesselObject::TesselObject;
  bool canGenerateStatoraPayload() const override { return true; }
  std::optional<Payload> statoraPayload(ProcessIdentity& /*identity*/) const override { return {}; }
};

TEST_F(RunTest, AnObjectWithoutPayloadIsCountedAndNotSent) {
  const auto filter = TesselReporterObjectFilter::init(variant);
  ObjectReporter reporter(filter, {{}, SharedString("SSD")}, identity, road);
  const SharedString text("Text");
  TracePointFields fields;
  fields.subsystem = fields.category = fields.name = text;
  fields.telemetryEnabled = true;
  const auto object = std::make_shared<const WithoutPayload>(fields);
  for (int i = 0; i < 10; ++i) EXPECT_TRUE(reporter.reportTesselObject(object));
  EXPECT_EQ(log.count("Failed to create payload for Text/TextText"), 10u);
  EXPECT_EQ(filter->telemetryReportedAggregation().totalCount(), 10u);
  EXPECT_EQ(throttle.throttledCount(), 0u);
  EXPECT_EQ(reportingQueue.pending(), 0u);
  EXPECT_EQ(reporter.unsendableCount(), 10u);
  EXPECT_EQ(road.queuedBytes(), 0u);
}

TEST_F(RunTest, ADeferralStopsTheExtraction) {
  extractor->objects = {makeEvent(TestPoint{}), makeEvent(TestPoint{})};
  activity->deferWanted = true;
  extractor->beforeProcessing = [this] {
    ASSERT_TRUE(queues.timers.back()->resumed);
    queues.timers.back()->fire();
    queues.runAll();
  };
  perform();
  EXPECT_EQ(log.count("Trying to stop in-flight reporting work."), 1u);
  EXPECT_EQ(log.count("Concluding processing due to deferral request"), 1u);
  EXPECT_THAT(sender.names(), ElementsAre("com.vantor.performance.tessel_reporting_stats"));
  EXPECT_NE(sender.events.back().json.find("\"WasInterrupted\":true"), std::string::npos);
  EXPECT_TRUE(activity->statesSet.empty());
  EXPECT_EQ(records.at(0).outcome, RunOutcome::interrupted);
  const auto timer = queues.timers.back();
  EXPECT_EQ(timer->interval, std::chrono::seconds{10});
  EXPECT_EQ(timer->leeway, std::chrono::seconds{10});
  EXPECT_EQ(timer->queue->label(), "tessel_reporter defer polling queue");
  // The reading itself knows whether the deferral cut it short.
  for (const bool stopped : {true, false}) {
    extractor->found.emplace().stopped = stopped;
    perform();
    EXPECT_NE(sender.events.back().json.find("\"WasInterrupted\":true"), std::string::npos);
    EXPECT_EQ(records.back().outcome, stopped ? RunOutcome::interrupted : RunOutcome::completed);
  }
}

TEST_F(RunTest, ThePollOutlivesTheRunNotItsExtractor) {
  perform();
  const std::weak_ptr<testing::FakeExtractor> weak = extractor;
  extractor.reset();
  EXPECT_TRUE(weak.expired());
  log.clear();
  queues.timers.back()->fire();
  activity->deferWanted = true;
  queues.runAll();
  EXPECT_THAT(log.lines(), ElementsAre("Trying to stop in-flight reporting work.",
                                       "Concluding processing due to deferral request"));
  activity->deferWanted = false;
  log.clear();
  queues.timers.back()->fire();
  queues.runAll();
  EXPECT_THAT(log.lines(), ElementsAre("Deferral not requested, continuing."));
}

TEST_F(RunTest, FivePairsOfEachSectionAreSent) {
  for (int pair = 0; pair < 7; ++pair) {
    TestPoint point;
    point.category = "C" + std::to_string(pair);
    for (int i = 0; i <= pair; ++i) extractor->objects.push_back(makeEvent(point));
    point.durationSeconds = -1;
    extractor->objects.push_back(makeEvent(point));
  }
  perform();
  const std::regex count(R"re(\{"Subsystem":"com.vantor.Calendar","Category":"(C.)","Count":(.),)re"
                         R"re("Classification":"(.*)"\})re");
  std::map<std::string, std::string> sections;
  for (const auto& event : sender.events) {
    std::smatch found;
    if (std::regex_match(event.json, found, count))
      sections[found.str(3)] += found.str(1) + "=" + found.str(2) + " ";
  }
  EXPECT_THAT(sections, ElementsAre(Pair("AllInspected", "C6=8 C5=7 C4=6 C3=5 C2=4 "),
                                    Pair("DurationThresholdFiltered", "C0=1 C1=1 C2=1 C3=1 C4=1 "),
                                    Pair("Reported", "C6=7 C5=6 C4=5 C3=4 C2=3 "),
                                    Pair("ReportedEvents", "C6=7 C5=6 C4=5 C3=4 C2=3 ")));
  EXPECT_EQ(records.at(0).countEvents, 20u);
  EXPECT_EQ(status.steps, 35u + 28u) << "each object and each pair is progress";
  EXPECT_EQ(throttle.throttledCount(), 8u) << "each pair of a section is paced, sent or not";
  EXPECT_EQ(log.count("com.vantor.Calendar/C2:\t4 (Count reported to Statora)"), 1u);
  EXPECT_EQ(log.count("com.vantor.Calendar/C1:\t3 (Count not reported)"), 1u);
  EXPECT_EQ(log.count("**************\nTotal tessel object count: 35"), 1u);
}

TEST_F(RunTest, TheBooksAreSentAndLogged) {
  TestPoint reported;
  TestPoint disabled;
  disabled.telemetryEnabled = false;
  TestPoint negative;
  negative.durationSeconds = -0.5f;
  TestPoint capped;
  capped.subsystem = "com.vantor.quellan.knowledge";
  capped.category = "tessel";
  capped.name = "Footprint";
  extractor->objects = {makeEvent(reported),           makeEvent(reported),
                        makeInterval(reported),        makeEvent(disabled),
                        makeInterval(disabled),        makeInterval(negative),
                        makeAnimationInterval(capped), makeAnimationInterval(reported)};
  extractor->eventCount = 99;
  extractor->duringProcessing = [this] { clock.advance(std::chrono::milliseconds{1250}); };
  extractor->found.emplace().losses.add(LossCode::malformed, "words", {}, 3);
  const Date began = clock.date;
  perform();
  RunRecord expected;
  expected.start = began;
  expected.end = clock.date;
  expected.logEvents = 99;
  expected.inspected = 8;
  expected.classified = {2, 4, 0, 1, 1, 0};
  expected.countEvents = records.at(0).countEvents;
  expected.reading = extractor->found;
  EXPECT_EQ(records.at(0), expected);
  EXPECT_EQ(
      sender.events.back().json,
      R"({"ProcessingDurationInSeconds":1.25,"LogObjectsProcessed":99,"AnimationsReported":1,)"
      R"("IntervalsReported":1,"EventsReported":2,"AnimationsNotReported":1,"IntervalsNotReported":2,)"
      R"("EventsNotReported":1,"WasInterrupted":false})");
  const std::string from = dates.format(extractor->startDate);
  const std::string to = dates.format(extractor->endDate);
  EXPECT_EQ(log.count("Done processing 2 reported and 1 unreported events, 1 reported and 2 "
                      "unreported intervals and 1 reported and 1 unreported animations (1 "
                      "blacklisted, 1 too short, 0 whitelisted, 2 telemetry not enabled) from 99 "
                      "log events in 1.25s between " +
                      from + " and " + to + "\n"),
            1u);
}

TEST_F(RunTest, TheThrottleLineSumsUpTheProcess) {
  perform();
  for (const std::string& line : log.lines()) EXPECT_FALSE(line.starts_with("Throttled ")) << line;
  for (int i = 0; i < 5; ++i) extractor->objects.push_back(makeEvent(TestPoint{}));
  perform();
  ASSERT_EQ(throttle.throttledCount(), 1u);
  const std::string line = "Throttled 1 times for a total of " +
                           std::to_string(throttle.throttledMicroseconds()) + " usec";
  EXPECT_EQ(log.count(line), 1u);
  extractor->objects.clear();
  perform();
  EXPECT_EQ(log.count(line), 2u);
}

class ActivityTest : public RunTest {
 protected:
  void handle() { handler.handleActivity(activity); }

  testing::FakeRuntime runtime;
  ReporterActivity handler{runtime, run};
  const std::vector<std::string> aroundEverything{
      "open com.vantor.tessel.tessel_reporter_activity transaction", "clean exit", "close"};
};

TEST_F(ActivityTest, EachStateAsksForACleanExit) {
  for (const int64_t state : {0, 1, 3, -5}) {
    runtime.calls.clear();
    activity->currentState = state;
    handle();
    EXPECT_EQ(runtime.calls, aroundEverything);
  }
  EXPECT_THAT(log.lines(), ElementsAre("Checking in\n", "Unknown state 1\n", "Unknown state 3\n",
                                       "Unknown state -5\n"));
  EXPECT_TRUE(records.empty());
}

TEST_F(ActivityTest, ADeferredRunDoesNotAskTheGate) {
  activity->deferWanted = true;
  handle();
  EXPECT_THAT(log.lines(), ElementsAre("Deferred tessel_reporter\n"));
  EXPECT_EQ(activity->statesSet, std::vector<int64_t>{3});
  EXPECT_EQ(runtime.calls, aroundEverything);
  EXPECT_EQ(variant.asked, 0u);
}

TEST_F(ActivityTest, ARefusedDeferralRuns) {
  activity->deferWanted = true;
  activity->takesStates = false;
  handle();
  EXPECT_EQ(records.size(), 1u);
  EXPECT_EQ(log.count("Deferred tessel_reporter\n"), 0u);
  EXPECT_EQ(runtime.calls, aroundEverything);
}

}  // namespace
}  // namespace tessel
