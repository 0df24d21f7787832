// Health records over a real spool and a real record of runs.

#include "forwarder/Health.h"

#include <gtest/gtest.h>

#include <nlohmann/json.hpp>
#include <numeric>

#include "linux/RunRecordFile.h"
#include "linux/StateDirectory.h"
#include "os/testing/TemporaryDirectory.h"
#include "statora/SpoolFile.h"

namespace tessel {
namespace {

using Json = nlohmann::json;
using std::chrono::hours;
using std::chrono::minutes;

class HealthTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(openSpoolDatabase(service_, directory_.path(kSpoolFileName), 0).ok());
    ASSERT_TRUE(state_.open().ok());
  }
  // What the service would leave: some rows, and the end of a run.
  void run(uint64_t rows) {
    RunRecord record;
    record.start = now_;
    record.end = now_ + minutes{1};
    record.inspected = 7;
    record.classified[TesselReporterClassificationTelemetryReported] = 7;
    record.rowsStored = rows;
    record.rowsFailed = {{"limit", 15 - rows}, {"locked", 0}};
    record.addTotals({});
    record.totals.expired = 2;
    for (uint64_t row = 0; row < rows; ++row)
      ASSERT_TRUE(
          service_.execute("INSERT INTO events(time, name, payload) VALUES(1, 'a', '{}')").ok());
    begin();
    ASSERT_FALSE(writeRunRecord(record, directory_.path()));
  }
  // What runs would leave that were killed, and one that is under way: their notes.
  void died(uint64_t count) {
    Json runs = Json::array();
    const uint64_t notes = std::min<uint64_t>(count, RunHistory::kMaxRuns);
    for (uint64_t start = count - notes; start < count; ++start)
      runs.push_back({{"start", start}, {"boot", ""}});
    directory_.write("last_run.json", Json{{"runs_begun", count}, {"runs", runs}}.dump());
  }
  void begin() { ASSERT_FALSE(writeRunBegin(now_, "none", directory_.path())); }
  bool lookAfter(minutes time) { return health_.look(now_ += time); }
  // The collector takes all that waits. Answers the health records among it.
  std::vector<Json> deliver() {
    const auto rows = state_.oldest(100, size_t{1} << 20);
    std::vector<const SpooledEvent*> taken;
    std::vector<Json> records;
    for (const SpooledEvent& row : rows) {
      taken.push_back(&row);
      if (row.name == kHealthEvent) records.push_back(Json::parse(row.payload));
    }
    ForwarderState::Rows left = taken;
    uint64_t rejected = 0;
    EXPECT_TRUE(rows.empty() || state_.acknowledge(left, rejected, "here", now_).ok());
    return records;
  }
  Json delivered() {
    auto records = deliver();
    EXPECT_EQ(records.size(), 1u);
    return records.empty() ? Json::object() : records.at(0);
  }
  static std::vector<std::string> outcomes(const Json& record) {
    std::vector<std::string> found;
    for (const Json& each : Json::parse(record.at("Runs").get<std::string>()))
      found.push_back(each.at("outcome"));
    return found;
  }

  testing::TemporaryDirectory directory_{testing::memoryDirectory()};
  SqliteDatabase service_;
  ForwarderState state_{directory_.path()};
  Health health_{directory_.path(), state_};
  Date now_{std::chrono::microseconds{1'795'000'000'000'000}};
};

TEST_F(HealthTest, ARecordTellsCodesRunsAndTheBooks) {
  directory_.write(kSavedStatusName, R"({"good":false,"time":12,"version":"1.2","problems":[
      {"code":"rows_refused","words":"of /home/me"},{"code":"Spool filling"},{"code":4},5],
      "notes":[{"code":"over_share"},{"code":"malformed"}],
      "tasking":{"tasked":true,"share":5.0,"cohort":"spring"}})");
  run(10);
  ASSERT_TRUE(lookAfter(minutes{2}));
  const Json record = delivered();
  const Json expected = Json::parse(R"({"Good":false,"StatusTime":12,"Problems":"rows_refused",
      "Notes":"over_share,malformed","TaskedOn":true,"SharePercent":5.0,"Cohort":"spring",
      "ServiceVersion":"1.2","RunsMissing":0,"RowsStored":10,"RowsWaiting":10,"RowsDelivered":0,
      "RowsRejected":0,"RowsSetAside":0,"RowsExpired":2,"RowsWithdrawn":0,"RowsRefused":5,
      "Requests":0,"Retries":0,"BytesSent":0})");
  Json flat = record;
  EXPECT_EQ(Json::parse(flat.at("Runs").get<std::string>()),
            Json::parse(R"([{"start":1795000000000000,"end":1795000060000000,
      "outcome":"completed","inspected":7,"sent":15,"stored":10,"refused":5}])"));
  flat.erase("Runs");
  flat.erase("ForwarderVersion");
  EXPECT_EQ(flat, expected);
  EXPECT_EQ(record.dump().find("/home/me"), std::string::npos) << "words stay on the machine";
}

TEST_F(HealthTest, OnceADayAndOnChangeButAtMostHourly) {
  EXPECT_TRUE(lookAfter(minutes{0})) << "the first one, even where nothing is known yet";
  directory_.write(kSavedStatusName, R"({"good":true,"time":1})");
  EXPECT_FALSE(lookAfter(minutes{59})) << "a change, but too soon";
  EXPECT_TRUE(lookAfter(minutes{1}));
  directory_.write(kSavedStatusName, R"({"good":true,"time":2})");
  EXPECT_FALSE(lookAfter(hours{23})) << "a later look at the same state is no change";
  EXPECT_TRUE(lookAfter(hours{1})) << "a day";
  run(1);
  EXPECT_TRUE(lookAfter(hours{1})) << "a run is a change";
  Health another(directory_.path(), state_);
  EXPECT_FALSE(another.look(now_ + hours{2})) << "a forwarder that starts anew remembers";
  EXPECT_TRUE(another.look(now_ - hours{2})) << "nobody knows how old a record of the future is";
}

TEST_F(HealthTest, EachRunIsToldUntilACollectorTookIt) {
  run(1);
  ASSERT_TRUE(lookAfter(hours{1}));
  run(2);
  begin();
  ASSERT_TRUE(lookAfter(hours{1})) << "what waits gives way to the newer record";
  Json record = delivered();
  EXPECT_EQ(outcomes(record), (std::vector<std::string>{"completed", "completed"}))
      << "the third may be under way";
  EXPECT_EQ(record.at("RowsWithdrawn"), 0) << "the record itself comes after its books";
  run(3);
  ASSERT_TRUE(lookAfter(hours{1}));
  const auto rows = state_.oldest(100, size_t{1} << 20);
  ASSERT_TRUE(state_.setAside(rows.back(), 400, "no", now_).ok());
  deliver();
  ASSERT_TRUE(lookAfter(hours{24}));
  record = delivered();
  EXPECT_EQ(outcomes(record), (std::vector<std::string>{"died", "completed"}))
      << "nobody has taken the record that was set aside";
  const auto sum = [&](std::initializer_list<const char*> keys) {
    uint64_t all = 0;
    for (const char* key : keys) all += record.at(key).get<uint64_t>();
    return all;
  };
  EXPECT_EQ(record.at("RowsStored"),
            sum({"RowsDelivered", "RowsWaiting", "RowsSetAside", "RowsWithdrawn"}));
  died(4 + RunHistory::kMaxRuns + 3);
  ASSERT_TRUE(lookAfter(hours{1}));
  record = delivered();
  EXPECT_EQ(outcomes(record).size(), RunHistory::kMaxRuns - 1);
  EXPECT_EQ(record.at("RunsMissing"), 3) << "what is not known is said to be missing";
  ASSERT_TRUE(lookAfter(hours{24}));
  EXPECT_EQ(delivered().at("Runs"), "[]");
}

TEST_F(HealthTest, AnOutageOfManyRunsHidesNone) {
  std::vector<uint64_t> told;
  const auto collect = [&](size_t records) {
    const std::vector<Json> taken = deliver();
    EXPECT_EQ(taken.size(), records);
    for (const Json& record : taken) {
      EXPECT_EQ(record.at("RunsMissing"), 0);
      for (const Json& each : Json::parse(record.at("Runs").get<std::string>()))
        told.push_back(each.at("start"));
    }
  };
  const auto all = [](uint64_t count) {
    std::vector<uint64_t> numbers(count);
    std::iota(numbers.begin(), numbers.end(), uint64_t{0});
    return numbers;
  };
  for (uint64_t begun = 100; begun <= 1000; begun += 100) {
    died(begun);
    ASSERT_TRUE(lookAfter(hours{1}));
  }
  collect(5);
  EXPECT_EQ(told, all(999)) << "the last one may be under way";
  died(1002);
  ASSERT_TRUE(lookAfter(hours{1}));
  collect(1);
  EXPECT_EQ(told, all(1001));
  // Somebody removes the file while a record waits.
  told.clear();
  died(1003);
  ASSERT_TRUE(lookAfter(hours{1}));
  died(3);
  ASSERT_TRUE(lookAfter(hours{1}));
  collect(2);
  EXPECT_EQ(told, (std::vector<uint64_t>{1001, 0, 1}));
}

TEST_F(HealthTest, WithdrawnRecordsNeverLeave) {
  ASSERT_TRUE(lookAfter(minutes{0}));
  health_.withdraw();
  EXPECT_TRUE(deliver().empty());
  EXPECT_TRUE(lookAfter(minutes{1})) << "wanted again";
  const auto rows = state_.oldest(1, 1);
  ASSERT_TRUE(state_.setAside(rows.at(0), 400, "no", now_).ok());
  ASSERT_TRUE(lookAfter(hours{24}));
  ASSERT_TRUE(state_.requeue());
  EXPECT_EQ(service_.integer("SELECT count(*) FROM events"), 2);
  health_.withdraw();
  EXPECT_TRUE(deliver().empty());
}

}  // namespace
}  // namespace tessel
