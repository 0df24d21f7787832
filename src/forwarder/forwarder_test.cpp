// Delivery policy over a real spool and a collector that is told what to answer.

#include "forwarder/Forwarder.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <numeric>
#include <optional>
#include <regex>
#include <set>

#include "os/testing/TemporaryDirectory.h"
#include "platform/testing/Fakes.h"
#include "statora/Spool.h"

namespace tessel {
namespace {

using ::testing::ElementsAre;
using ::testing::SizeIs;

constexpr long kForeign = 1200;  // a success from somebody who is no collector

struct ScriptedCollector final : Collector {
  CollectorAnswer post(std::string_view body) override {
    bodies.emplace_back(body);
    CollectorAnswer answer;
    answer.status = status(bodies.back());
    if (answer.status == 0) answer.error = "gone";
    if (answer.status == kForeign) {
      answer.status = 200;
      answer.mediaType = "text/html";
    } else if (answer.status == 200) {
      accepted += body;
    }
    return answer;
  }
  std::function<long(const std::string& body)> status = [](const std::string&) { return 200; };
  std::vector<std::string> bodies;
  std::string accepted;  // bodies, one after the other
};

// The plainest format: the row's id and its payload, a line each.
struct LinesEncoder final : Encoder {
  std::string_view contentType() const override { return "text/plain"; }
  std::optional<std::string> record(const SpooledEvent& event, std::string_view) const override {
    return std::to_string(event.id) + event.payload;
  }
  std::string body(std::span<const OutgoingRecord> records) const override {
    std::string lines;
    for (const OutgoingRecord& record : records) lines += record.text + '\n';
    return lines;
  }
  std::optional<PartialSuccess> readSuccess(std::string_view type,
                                            std::string_view) const override {
    return type == "text/html" ? std::nullopt : std::optional(PartialSuccess{});
  }
};

// The numbers of the records in a body, in order.
std::vector<int> numbersIn(const std::string& body) {
  static const std::regex number("\"Number\":([0-9]+)");
  std::vector<int> all;
  for (std::sregex_iterator at(body.begin(), body.end(), number), end; at != end; ++at)
    all.push_back(std::stoi(at->str(1)));
  return all;
}

class ForwarderTest : public ::testing::Test {
 protected:
  ForwarderTest() {
    options_.maxRecords = 8;
    options_.recordsPerSecond = 0;
  }

  // Fills the spool the way the service does, with numbers from `first` on.
  void send(int64_t count, int64_t first = 1) {
    testing::ManualQueueFactory queues;
    Spool spool(directory_.path(), {}, clock_, status_, queues.makeSerialQueue("writer"), queues);
    for (int64_t number = first; number < first + count; ++number) {
      Payload payload;
      payload.set("Number", Number{number});
      ASSERT_TRUE(spool.sendEvent("a", payload, EventRank::object));
    }
    ASSERT_EQ(spool.endRun().stored, static_cast<uint64_t>(count));
  }
  ForwarderOutcome deliver() {
    if (!forwarder_) restart();
    return forwarder_->deliverAll();
  }
  // A new process has a new forwarder.
  void restart() {
    forwarder_.emplace(Forwarder::World{state_, encoder_, collector_, clock_, clock_, status_,
                                        stop_, [this] { return chance_; }},
                       options_);
  }
  // Rounds with the waits between them, as the program does them, until nothing waits any more.
  void deliverFor(std::chrono::seconds time) {
    const Date end = clock_.now() + time;
    while (clock_.now() < end && deliver() != ForwarderOutcome::delivered)
      clock_.advance(forwarder_->pause());
  }
  // Refuses every body that holds one of `numbers`.
  void refuse(const std::vector<int>& numbers, long status = 400) {
    collector_.status = [numbers, status](const std::string& body) {
      const std::vector<int> sent = numbersIn(body);
      const bool bad = std::ranges::find_first_of(sent, numbers) != sent.end();
      return bad ? status : 200;
    };
  }
  int64_t integer(const char* query) {
    SqliteDatabase database;
    EXPECT_TRUE(database.open(directory_.path("statora.db"), SqliteDatabase::Mode::readOnly).ok());
    return database.integer(query).value_or(-1);
  }
  int64_t waiting() { return integer("SELECT count(*) FROM events"); }
  int64_t setAside() { return integer("SELECT count(*) FROM forwarder_set_aside"); }

  testing::TemporaryDirectory directory_{testing::memoryDirectory()};
  testing::FakeClock clock_;
  testing::RecordingLog log_;
  LinesEncoder encoder_;
  ScriptedCollector collector_;
  testing::FakeServiceStatus status_;
  Semaphore stop_{0};
  ForwarderOptions options_;
  ForwarderState state_{directory_.path(), 3};
  double chance_ = 0.0;
  std::optional<Forwarder> forwarder_;
};

TEST_F(ForwarderTest, DeliveredRowsGiveTheirSpaceBack) {
  send(20);
  EXPECT_EQ(deliver(), ForwarderOutcome::delivered);
  EXPECT_THAT(collector_.bodies, SizeIs(3));
  EXPECT_EQ(waiting(), 0);
  EXPECT_EQ(integer("PRAGMA freelist_count"), 0);
  EXPECT_EQ(state_.counters().delivered, 20u);
  EXPECT_EQ(state_.counters().position, 20u);
  collector_.bodies.clear();
  send(1);
  EXPECT_EQ(deliver(), ForwarderOutcome::delivered);
  EXPECT_TRUE(collector_.bodies.at(0).starts_with("21{")) << "row numbers are never used again";
}

TEST_F(ForwarderTest, OnlyRefusedRecordsAreSetAside) {
  for (const std::vector<int>& bad : {std::vector{1}, {8}, {3, 4}, {1, 5, 8}, {2, 3, 12}}) {
    collector_.accepted.clear();
    send(12);
    refuse(bad);
    ASSERT_EQ(deliver(), ForwarderOutcome::delivered);
    EXPECT_EQ(waiting(), 0);
    EXPECT_EQ(setAside(), static_cast<int64_t>(bad.size()));
    std::vector<int> good(12);
    std::iota(good.begin(), good.end(), 1);
    std::erase_if(good, [&](int number) { return std::ranges::count(bad, number) > 0; });
    std::vector<int> arrived = numbersIn(collector_.accepted);
    std::ranges::sort(arrived);
    EXPECT_EQ(arrived, good);
    // What is put back is delivered by a collector that takes it, and stays in the spool otherwise.
    EXPECT_EQ(state_.requeue(), static_cast<int64_t>(bad.size()));
    EXPECT_EQ(deliver(), ForwarderOutcome::held);
    refuse({});
    EXPECT_EQ(deliver(), ForwarderOutcome::delivered);
  }
}

TEST_F(ForwarderTest, NoAnswerTakesRowsFromACollectorThatRecovers) {
  // A day has four rounds, so that all statuses take seconds.
  options_.hold = options_.interval = std::chrono::hours{6};
  options_.firstRetry = options_.longestRetry = std::chrono::hours{12};
  std::vector<long> answers{0, kForeign};
  for (long status = 300; status < 600; ++status) answers.push_back(status);
  for (const long answer : answers) {
    restart();
    collector_ = {};
    send(20);
    collector_.status = [answer](const std::string&) { return answer; };
    deliverFor(std::chrono::hours{24});
    ASSERT_EQ(waiting(), 20) << answer;
    ASSERT_LT(collector_.bodies.size(), 60u) << answer;
    collector_.status = [](const std::string&) { return 200; };
    deliver();
    ASSERT_EQ(waiting() + setAside(), 0) << answer;
  }
}

// A collector that fails every second time looks for a moment as if a row were at fault.
TEST_F(ForwarderTest, ACollectorThatWaversLosesNoRow) {
  for (const long answer : {0L, 302L, 403L, 500L, 503L, 520L, kForeign}) {
    for (const int period : {2, 3, 5}) {
      restart();
      send(20);
      collector_.status = [answer, period, turn = 0](const std::string&) mutable {
        return ++turn % period == 0 ? answer : 200;
      };
      deliverFor(std::chrono::hours{12});
      ASSERT_EQ(waiting() + setAside(), 0) << answer << " each " << period;
    }
  }
}

TEST_F(ForwarderTest, ARowThatIsRefusedForEverHoldsUpNoOther) {
  options_.hold = options_.interval = std::chrono::hours{1};
  for (const long status : {403L, 413L, 500L, 502L, kForeign}) {
    restart();
    collector_.accepted.clear();
    refuse({1, 2, 3, 17}, status);
    send(30);
    for (int more = 100; more < 120; ++more) {
      deliverFor(std::chrono::hours{3});
      send(1, more);
    }
    EXPECT_EQ(deliver(), ForwarderOutcome::held);
    EXPECT_EQ(numbersIn(collector_.accepted).size(), 46u) << status;
    // The table of refused rows has room for three. The fourth row waits.
    EXPECT_EQ(setAside(), 3) << status;
    EXPECT_EQ(waiting(), 1) << status;
    EXPECT_THAT(forwarder_->reason(), ::testing::HasSubstr("no room is left to set it aside"));
    collector_.status = [](const std::string&) { return 200; };
    EXPECT_TRUE(state_.requeue());
    deliver();
    EXPECT_EQ(waiting(), 0) << status;
  }
}

TEST_F(ForwarderTest, ALoneRowIsNeverSetAside) {
  send(1);
  refuse({1});
  deliverFor(std::chrono::hours{2});
  EXPECT_EQ(setAside(), 0);
  EXPECT_EQ(forwarder_->pause(), options_.hold);
  send(1, 2);
  EXPECT_EQ(deliver(), ForwarderOutcome::delivered);
  EXPECT_EQ(setAside(), 1);
}

TEST_F(ForwarderTest, EachFailureMakesTheWaitLonger) {
  send(3);
  collector_.status = [](const std::string&) { return 503; };
  std::vector<int64_t> tenths;
  for (int round = 0; round < 5; ++round) {
    EXPECT_EQ(deliver(), ForwarderOutcome::unreachable);
    tenths.push_back(forwarder_->pause().count() / 100'000'000);
  }
  EXPECT_THAT(tenths, ElementsAre(25, 50, 100, 200, 400));
  EXPECT_EQ(std::set<std::string>(collector_.bodies.begin(), collector_.bodies.end()).size(), 1u);
  EXPECT_EQ(waiting(), 3);
  EXPECT_EQ(state_.counters().retries, 5u);
  EXPECT_EQ(state_.counters().refusedRequests, 5u);
}

TEST_F(ForwarderTest, WhatWasTakenIsOnlyAcknowledgedAgain) {
  send(20);
  ASSERT_TRUE(state_.open().ok());
  state_.database().setBusyTimeout(0);  // the lock stays for as long as the forwarder waits for it
  SqliteDatabase other;
  ASSERT_TRUE(other.open(directory_.path("statora.db"), SqliteDatabase::Mode::readWrite).ok());
  collector_.status = [&other](const std::string&) {
    EXPECT_TRUE(other.execute("BEGIN IMMEDIATE").ok());
    return 200;
  };
  EXPECT_EQ(deliver(), ForwarderOutcome::spoolFailed);
  EXPECT_TRUE(forwarder_->owesAcknowledgement());
  EXPECT_EQ(forwarder_->pause(), options_.firstRetry / 2);
  EXPECT_TRUE(other.execute("COMMIT").ok());
  collector_.status = [](const std::string&) { return 200; };
  EXPECT_EQ(deliver(), ForwarderOutcome::delivered);
  EXPECT_THAT(collector_.bodies, SizeIs(3));
  EXPECT_EQ(state_.counters().delivered, 20u);
}

TEST_F(ForwarderTest, AReaderThatStaysStopsTheDelivery) {
  send(2000);
  ASSERT_TRUE(state_.open().ok());
  SqliteDatabase reader;
  ASSERT_TRUE(reader.open(directory_.path("statora.db"), SqliteDatabase::Mode::readWrite).ok());
  ASSERT_TRUE(reader
                  .execute("INSERT OR REPLACE INTO meta VALUES('limit_bytes', '4194304');"
                           "BEGIN; SELECT * FROM events")
                  .ok());
  EXPECT_EQ(deliver(), ForwarderOutcome::spoolFailed);
  EXPECT_LT(std::filesystem::file_size(directory_.path("statora.db-wal")), 2'000'000u);
  EXPECT_GT(waiting(), 0);
  EXPECT_TRUE(reader.execute("COMMIT").ok());
  EXPECT_EQ(deliver(), ForwarderOutcome::delivered);
}

TEST_F(ForwarderTest, AskedToStopItLeavesTheRestForLater) {
  send(20);
  collector_.status = [this](const std::string&) {
    stop_.signal();
    return 200;
  };
  EXPECT_EQ(deliver(), ForwarderOutcome::stopped);
  EXPECT_EQ(waiting(), 12);
}

TEST_F(ForwarderTest, TheRateHoldsForEveryRequest) {
  options_.recordsPerSecond = 4;
  send(20);
  EXPECT_EQ(deliver(), ForwarderOutcome::delivered);
  std::vector<int64_t> seconds;
  for (size_t i = 0; i < 3; ++i) seconds.push_back(clock_.waits.at(i).count() / 1'000'000'000);
  EXPECT_THAT(seconds, ElementsAre(0, 2, 2)) << "eight records each, but for the first";
}

// As in a spool that was restored from a copy: an id is given twice.
TEST_F(ForwarderTest, AnIdThatWasGivenTwiceLosesNoRow) {
  send(2);
  ASSERT_TRUE(state_.open().ok());
  SpooledEvent event = state_.oldest(1, 1).at(0);
  ASSERT_TRUE(state_.setAside(event, 400, "no", clock_.now()).ok());
  event.payload = R"({"Number":3})";
  ASSERT_TRUE(state_.setAside(event, 400, "no", clock_.now()).ok());
  EXPECT_EQ(setAside(), 2);
  SqliteDatabase service;
  ASSERT_TRUE(service.open(directory_.path("statora.db"), SqliteDatabase::Mode::readWrite).ok());
  ASSERT_TRUE(service.execute("INSERT INTO events VALUES(1, 1, 'a', '{\"Number\":4}')").ok());
  EXPECT_EQ(state_.requeue(), 2);
  EXPECT_EQ(deliver(), ForwarderOutcome::delivered);
  std::vector<int> arrived = numbersIn(collector_.accepted);
  std::ranges::sort(arrived);
  EXPECT_THAT(arrived, ElementsAre(1, 2, 3, 4));
}

TEST_F(ForwarderTest, CountsStayInBounds) {
  send(1);
  ASSERT_TRUE(state_.open().ok());
  SqliteDatabase stranger;
  ASSERT_TRUE(stranger.open(directory_.path("statora.db"), SqliteDatabase::Mode::readWrite).ok());
  ASSERT_TRUE(
      stranger
          .execute(
              "INSERT INTO forwarder VALUES('delivered', -5), ('rejected', 9223372036854775807)")
          .ok());
  clock_.date = Date{std::chrono::seconds{-1'000'000}};
  const auto counters = readForwarderCounters(stranger);
  EXPECT_EQ(counters->delivered, 0u);
  EXPECT_EQ(counters->rejected, uint64_t{1} << 60);
  EXPECT_EQ(deliver(), ForwarderOutcome::delivered);
  collector_.status = [](const std::string&) { return 503; };
  send(1);
  EXPECT_EQ(deliver(), ForwarderOutcome::unreachable);
  EXPECT_EQ(state_.counters().lastSuccess, 0u);
  EXPECT_EQ(state_.counters().lastErrorAt, 0u);
}

TEST_F(ForwarderTest, SendingGoesOnDuringARequest) {
  send(8);
  collector_.status = [this](const std::string&) {
    if (collector_.bodies.size() == 1) send(3);
    return 200;
  };
  EXPECT_EQ(deliver(), ForwarderOutcome::delivered);
  EXPECT_EQ(state_.counters().delivered, 11u);
}

}  // namespace
}  // namespace tessel
