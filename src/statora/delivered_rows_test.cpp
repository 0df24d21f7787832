// Delivered rows: how long they stay, and what they give way to.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>

#include "os/testing/TemporaryDirectory.h"
#include "platform/testing/Fakes.h"
#include "statora/ForwarderState.h"
#include "statora/Spool.h"

namespace tessel {
namespace {

using std::chrono::hours;
using ::testing::ElementsAre;

constexpr uint64_t kMebibyte = uint64_t{1} << 20;

class DeliveredRowsTest : public ::testing::Test {
 protected:
  // A run of the service that sends events with so much text each.
  SpoolFigures run(size_t events, size_t bytes = 400) {
    testing::ManualQueueFactory queues;
    Spool spool(directory_.path(), limits_, clock_, status_, queues.makeSerialQueue("writer"),
                queues);
    share_ = spool.beginRun();
    Payload payload;
    payload.set("Text", SharedString(std::string(bytes, 'x')));
    for (size_t i = 0; i < events; ++i) spool.sendEvent("a", payload, EventRank::object);
    return spool.endRun();
  }
  // Puts rows there that wait, past every limit of a run.
  void fill(size_t rows, size_t bytes = 400) {
    SqliteDatabase client;
    ASSERT_TRUE(client.open(path_, SqliteDatabase::Mode::readWrite).ok());
    ASSERT_TRUE(client
                    .execute("WITH RECURSIVE row(n) AS (SELECT 1 UNION ALL SELECT n + 1 FROM row"
                             " WHERE n < " +
                             std::to_string(rows) +
                             ")"
                             " INSERT INTO events(time, name, payload) SELECT " +
                             std::to_string(clock_.now().time_since_epoch().count()) +
                             ", 'a', printf('{\"Text\":\"%." + std::to_string(bytes) +
                             "c\"}', 'x') FROM row")
                    .ok());
    ASSERT_TRUE(client.execute("PRAGMA wal_checkpoint(TRUNCATE)").ok());
  }
  void deliver() {
    ASSERT_TRUE(state_->open().ok());
    state_->shortenDelivered(clock_.now());
    for (;;) {
      const std::vector<SpooledEvent> events = state_->oldest(512, kMebibyte);
      if (events.empty()) break;
      std::vector<const SpooledEvent*> rows;
      for (const SpooledEvent& event : events) rows.push_back(&event);
      ForwarderState::Rows left = rows;
      uint64_t rejected = 0;
      ASSERT_TRUE(
          state_->acknowledge(left, rejected, "https://collector.example:4318", clock_.now()).ok());
    }
    while (state_->shrink(64)) continue;
  }
  int64_t integer(const std::string& query) {
    SqliteDatabase client;
    EXPECT_TRUE(client.open(path_, SqliteDatabase::Mode::readOnly).ok());
    return client.integer(query).value_or(-1);
  }
  void execute(const std::string& statements) {
    SqliteDatabase client;
    ASSERT_TRUE(client.open(path_, SqliteDatabase::Mode::readWrite).ok());
    ASSERT_TRUE(client.execute(statements).ok()) << client.status().reason;
  }
  int64_t waiting() { return integer("SELECT count(*) FROM events"); }
  int64_t delivered() { return integer("SELECT count(*) FROM forwarder_delivered"); }
  uint64_t bytesOfDelivered() {
    return static_cast<uint64_t>(
        integer("SELECT sum(pgsize) FROM dbstat WHERE name='forwarder_delivered'"));
  }
  uint64_t fileBytes() const {
    std::error_code none;
    const auto log = std::filesystem::file_size(path_ + "-wal", none);
    return std::filesystem::file_size(path_) + (none ? 0 : log);
  }

  testing::TemporaryDirectory directory_;
  const std::string path_ = directory_.path(kSpoolFileName);
  testing::FakeClock clock_;
  testing::FakeServiceStatus status_;
  testing::RecordingLog log_;
  SpoolLimits limits_{.bytes = 8 * kMebibyte, .days = std::chrono::days{30}};
  uint64_t share_ = 0;  // of the last run
  std::optional<ForwarderState> state_{directory_.path()};
};

TEST_F(DeliveredRowsTest, ARowIsMovedWhole) {
  run(2);
  clock_.advance(hours{1});
  deliver();
  EXPECT_EQ(waiting(), 0);
  SqliteDatabase client;
  ASSERT_TRUE(client.open(path_, SqliteDatabase::Mode::readOnly).ok());
  SqliteStatement select = client.prepare(kSelectDelivered);
  const auto rows = readDelivered(select, 0, 10, kMebibyte);
  ASSERT_EQ(rows.size(), 2u);
  EXPECT_LT(rows[0].number, rows[1].number);
  EXPECT_EQ(rows[1].event.id, 2);
  EXPECT_EQ(rows[1].at - rows[1].event.time, 3'600'000'000);
  EXPECT_EQ(rows[1].destination, "https://collector.example:4318");
  EXPECT_EQ(rows[1].event.name + rows[1].event.payload.substr(0, 10), "a{\"Text\":\"x");
}

TEST_F(DeliveredRowsTest, TheyTakeTheirPartAndTheOldestGo) {
  run(1);
  for (const size_t bytes : {20u, 400u, 2500u, 20'000u}) {
    SCOPED_TRACE(bytes);
    fill(6 * kMebibyte / spaceOfRow(bytes + 12), bytes);
    deliver();
    EXPECT_LE(bytesOfDelivered(), 2 * kMebibyte) << "a quarter of the limit";
    EXPECT_GE(bytesOfDelivered(), 2 * kMebibyte * 8 / 10);
    EXPECT_EQ(integer("SELECT max(id) FROM forwarder_delivered"),
              integer("SELECT seq FROM sqlite_sequence WHERE name='events'"));
    EXPECT_LE(fileBytes(), limits_.bytes);
  }
  limits_.bytes = 4 * kMebibyte;
  run(0);
  EXPECT_LE(bytesOfDelivered(), kMebibyte) << "the service has a new limit";
  EXPECT_EQ(DeliveredRows::allowance({.bytes = uint64_t{1} << 40}, 0), 64 * kMebibyte);
}

TEST_F(DeliveredRowsTest, TheyStayForSevenDaysOrForThoseOfTheSpool) {
  const struct {
    int spoolDays, waited, kept;
    bool stays;
  } cases[] = {{30, 0, 6, true}, {30, 0, 8, false}, {0, 0, 6, true},   {0, 0, 8, false},
               {3, 0, 2, true},  {3, 0, 4, false},  {30, 28, 1, true}, {30, 28, 3, false}};
  for (const bool byService : {true, false}) {
    for (const auto& c : cases) {
      SCOPED_TRACE(std::to_string(c.spoolDays) + " " + std::to_string(c.kept));
      limits_.days = std::chrono::days{c.spoolDays};
      run(200);
      clock_.advance(hours{24 * c.waited});
      deliver();
      EXPECT_EQ(delivered(), 200);
      clock_.advance(hours{24 * c.kept});
      if (byService) {
        EXPECT_EQ(run(0).expired, 0u) << "they did not expire unsent";
      } else {
        deliver();
      }
      EXPECT_EQ(delivered(), c.stays ? 200 : 0);
      execute("DELETE FROM forwarder_delivered");
    }
  }
}

TEST_F(DeliveredRowsTest, NewRowsHaveTheRoomOfDeliveredOnes) {
  run(1);
  const uint64_t shareOfEmpty = share_;
  fill(4 * kMebibyte / 500);
  deliver();
  ASSERT_GT(delivered(), 3000);
  run(0);
  EXPECT_GE(share_ + 2 * kSpoolPageBytes, shareOfEmpty) << "they do not make a run's part smaller";
  // So many that wait that a run has to clear most of the delivered ones.
  while (waiting() < 15'000) {
    const SpoolFigures figures = run(100);
    ASSERT_EQ(figures.stored, 100u) << waiting() << " wait, " << delivered() << " are delivered";
    if (waiting() < 8000) fill(500);
    ASSERT_LE(fileBytes(), limits_.bytes);
  }
  EXPECT_LT(delivered(), 2500);
  fill(5000);
  EXPECT_EQ(run(300).stored, 0u);
  EXPECT_EQ(delivered(), 0) << "the last of them goes before a row is refused";
}

TEST_F(DeliveredRowsTest, AReaderThatStaysCostsCopiesAndNoDelivery) {
  run(1);
  fill(6000);
  SqliteDatabase reader;
  ASSERT_TRUE(reader.open(path_, SqliteDatabase::Mode::readOnly).ok());
  ASSERT_TRUE(reader.execute("BEGIN; SELECT count(*) FROM events").ok());
  deliver();
  EXPECT_EQ(waiting(), 0);
  EXPECT_EQ(state_->counters().delivered, 6001u);
  EXPECT_GT(delivered(), 0);
  EXPECT_LT(delivered(), 2000) << "a copy would make the log longer";
  ASSERT_TRUE(reader.execute("COMMIT").ok());
  run(50);
  deliver();
  EXPECT_EQ(integer("SELECT count(*) FROM forwarder_delivered WHERE id > 6001"), 50);
}

TEST_F(DeliveredRowsTest, ATamperedTableStopsNobody) {
  for (const char* tampering :
       {"ALTER TABLE forwarder_delivered ADD COLUMN more TEXT CHECK (id < 400)",
        "CREATE INDEX slow ON forwarder_delivered(length(zeroblob(id * 1000000)))"
        " WHERE id > 400",
        "DROP TABLE forwarder_delivered; CREATE VIEW forwarder_delivered AS SELECT * FROM events",
        "DROP TABLE forwarder_delivered; CREATE TABLE forwarder_delivered(id)",
        "UPDATE forwarder_delivered SET running_bytes=9223372036854775807 - id",
        "UPDATE forwarder_delivered SET running_bytes=-9223372036854775807 + id",
        "UPDATE forwarder_delivered SET running_bytes='x', destination=zeroblob(99), name=x'ff'",
        "INSERT INTO forwarder_delivered VALUES(9223372036854775807, 1, 1, 1, 1, '', '', '')",
        "UPDATE meta SET value='-1' WHERE key LIKE 'limit%'",
        "UPDATE meta SET value='99999999999999999999' WHERE key LIKE 'limit%'"}) {
    SCOPED_TRACE(tampering);
    run(300);
    deliver();
    execute(tampering);
    EXPECT_EQ(run(300).stored, 300u);
    deliver();
    EXPECT_EQ(waiting(), 0);
    fill(16'800);
    EXPECT_EQ(run(100).failed[static_cast<size_t>(SpoolFailure::limit)], 100u);
    EXPECT_LE(fileBytes(), limits_.bytes);
    state_.emplace(directory_.path());
    for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(path_ + suffix);
  }
}

}  // namespace
}  // namespace tessel
