// Delivery policy over a real spool and a collector that is told what to answer.

#include "forwarder/Forwarder.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <numeric>
#include <regex>
#include <set>

#include "os/testing/TemporaryDirectory.h"
#include "platform/testing/Fakes.h"
#include "statora/Spool.h"

namespace tessel {
namespace {

using ::testing::ElementsAre;
using ::testing::SizeIs;

struct ScriptedCollector final : Collector {
  CollectorAnswer post(std::string_view body) override {
    bodies.emplace_back(body);
    CollectorAnswer answer;
    answer.status = status(bodies.back());
    if (answer.status == 200) accepted += body;
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
  std::optional<PartialSuccess> readSuccess(std::string_view, std::string_view) const override {
    return PartialSuccess{};
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
    options_.maxAttempts = 5;
    options_.refusalsInARow = 4;
  }

  // Fills the spool the way the service does.
  void send(int64_t count) {
    testing::ManualQueueFactory queues;
    Spool spool(directory_.path(), {}, clock_, status_, queues.makeSerialQueue("writer"), queues);
    for (int64_t number = 1; number <= count; ++number) {
      Payload payload;
      payload.set("Number", Number{number});
      ASSERT_TRUE(spool.sendEvent("a", payload, EventRank::object));
    }
    ASSERT_EQ(spool.endRun().stored, static_cast<uint64_t>(count));
  }
  ForwarderOutcome deliver() {
    EXPECT_TRUE(state_.open().ok());
    Forwarder forwarder({state_, encoder_, collector_, clock_, status_, stop_, [] { return 0.0; }},
                        options_);
    return forwarder.deliverAll();
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

  testing::TemporaryDirectory directory_;
  testing::FakeClock clock_;
  testing::RecordingLog log_;
  LinesEncoder encoder_;
  ScriptedCollector collector_;
  testing::FakeServiceStatus status_;
  Semaphore stop_{0};
  ForwarderOptions options_;
  ForwarderState state_{directory_.path()};
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
  for (const std::vector<int>& bad : {std::vector{1}, {8}, {3, 4}, {1, 5, 8, 12}, {2, 3, 9}}) {
    const int64_t setAsideBefore = collector_.bodies.empty() ? 0 : setAside();
    collector_.accepted.clear();
    send(12);
    refuse(bad);
    ASSERT_EQ(deliver(), ForwarderOutcome::delivered);
    EXPECT_EQ(waiting(), 0);
    EXPECT_EQ(setAside() - setAsideBefore, static_cast<int64_t>(bad.size()));
    std::vector<int> good(12);
    std::iota(good.begin(), good.end(), 1);
    std::erase_if(good, [&](int number) { return std::ranges::count(bad, number) > 0; });
    EXPECT_EQ(numbersIn(collector_.accepted), good);
  }
}

TEST_F(ForwarderTest, RefusalsInARowHoldEverythingUp) {
  send(12);
  refuse({1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12});
  EXPECT_EQ(deliver(), ForwarderOutcome::held);
  EXPECT_EQ(setAside(), 4);
  EXPECT_EQ(waiting(), 8);
}

TEST_F(ForwarderTest, ARetrySendsTheSameAfterALongerWait) {
  send(3);
  collector_.status = [](const std::string&) { return 503; };
  EXPECT_EQ(deliver(), ForwarderOutcome::unreachable);
  EXPECT_THAT(collector_.bodies, SizeIs(5));
  EXPECT_EQ(std::set<std::string>(collector_.bodies.begin(), collector_.bodies.end()).size(), 1u);
  std::vector<int64_t> seconds;
  for (const auto wait : clock_.waits) {
    if (wait.count() > 0) seconds.push_back(wait.count() / 100'000'000);
  }
  EXPECT_THAT(seconds, ElementsAre(25, 50, 100, 200)) << "tenths of a second";
  EXPECT_EQ(waiting(), 3);
  EXPECT_EQ(integer("SELECT value FROM forwarder WHERE name='retries'"), 4);
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

TEST_F(ForwarderTest, TheOldestSetAsideGoesFirst) {
  ForwarderState state(directory_.path(), 2);
  send(3);
  ASSERT_TRUE(state.open().ok());
  for (const SpooledEvent& event : state.oldest(10, 1000)) {
    clock_.advance(std::chrono::seconds{1});
    ASSERT_TRUE(state.setAside(event, 400, "no", clock_.now()).ok());
  }
  EXPECT_EQ(integer("SELECT min(id) * 10 + max(id) FROM forwarder_set_aside"), 23);
  EXPECT_EQ(state.counters().setAside, 3u);
  EXPECT_EQ(state.counters().setAsideDropped, 1u);
  EXPECT_EQ(state.requeue(), 2);
  EXPECT_EQ(waiting(), 2);
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
