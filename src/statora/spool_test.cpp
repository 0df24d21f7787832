// The spool on real files: what it stores, what it survives, what it refuses.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <filesystem>
#include <fstream>

#include "os/testing/TemporaryDirectory.h"
#include "platform/testing/Fakes.h"
#include "statora/Spool.h"

namespace tessel {
namespace {

using ::testing::ElementsAre;
using testing::FakeClock;
using ::testing::HasSubstr;
using testing::RecordingLog;
using testing::TemporaryDirectory;

Payload numbered(int64_t number) {
  Payload payload;
  payload.set("Number", Number{number});
  return payload;
}

Payload ofSize(size_t bytes) {
  Payload payload;
  payload.set("Text", SharedString(std::string(bytes, 'x')));
  return payload;
}

// Looks at a spool as any other client would.
class Reader {
 public:
  explicit Reader(const std::string& directory, const std::string& name = kSpoolFileName) {
    EXPECT_TRUE(database_.open(directory + "/" + name, SqliteDatabase::Mode::readWrite).ok());
  }
  std::vector<std::string> rows() {
    std::vector<std::string> all;
    SqliteStatement select =
        database_.prepare("SELECT time, name, payload FROM events ORDER BY id");
    while (select.prepared() && select.step() == SqliteStatement::Step::row) {
      all.push_back(std::string(select.text(0)) + " " + std::string(select.text(1)) + " " +
                    std::string(select.text(2)));
    }
    return all;
  }
  int64_t count() { return database_.integer("SELECT count(*) FROM events").value_or(-1); }
  SqliteDatabase& database() { return database_; }

 private:
  SqliteDatabase database_;
};

uint64_t failures(const SpoolFigures& figures, SpoolFailure kind) {
  return figures.failed[static_cast<size_t>(kind)];
}

// The pages of 4 KiB that a limit of 8 MiB allows.
constexpr SpoolLimits kSmall{.bytes = 8 << 20, .days = std::chrono::days{30}};

const uint64_t kLong = spaceOfRow(10'012);  // name and payload of ofSize(10'000)

class SpoolTest : public ::testing::Test {
 protected:
  // A spool whose queue runs when told to.
  class Bench {
   public:
    Bench(SpoolTest& test, const std::string& directory, SpoolLimits limits)
        : queue_(std::make_shared<testing::ManualQueue>("writer")),
          spool_(directory, limits, test.clock_, test.status_, queue_, timers_) {}

    bool queue(const std::string& name, const Payload& payload,
               EventRank rank = EventRank::object) {
      return spool_.sendEvent(name, payload, rank);
    }
    bool send(const std::string& name, const Payload& payload, EventRank rank = EventRank::object) {
      const bool taken = queue(name, payload, rank);
      queue_->runAll();
      return taken;
    }
    void tick() {
      timers_.timers.front()->fire();
      queue_->runAll();
    }
    uint64_t beginRun() { return spool_.beginRun(); }
    SpoolFigures endRun() { return spool_.endRun(); }
    size_t pending() const { return queue_->pending(); }

   private:
    std::shared_ptr<testing::ManualQueue> queue_;
    testing::ManualQueueFactory timers_;
    Spool spool_;
  };

  Bench bench(SpoolLimits limits = {}) { return Bench(*this, directory_.path(), limits); }
  uint64_t sizeOf(const std::string& name) const {
    return std::filesystem::file_size(directory_.path(name));
  }
  std::vector<std::string> filesWith(const std::string& part) const {
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(directory_.path())) {
      if (entry.path().filename().string().find(part) != std::string::npos)
        names.push_back(entry.path().filename());
    }
    return names;
  }

  TemporaryDirectory directory_;
  FakeClock clock_;
  testing::FakeServiceStatus status_;
  RecordingLog log_;
};

TEST_F(SpoolTest, RowsStandInSendOrder) {
  Bench spool(*this, directory_.path("state"), {});
  Payload payload;
  payload.set("Z", SharedString("first"));
  payload.set("A", Number{0.1f});
  payload.set("M", Number{true});
  payload.set("Text", SharedString("a\xff\"b"));
  EXPECT_TRUE(spool.queue("com.vantor.performance.tessel", payload));
  EXPECT_FALSE(std::filesystem::exists(directory_.path("state"))) << "a send touches no disk";
  clock_.advance(std::chrono::microseconds{7});
  EXPECT_TRUE(spool.send("ts__\xc3__", Payload{}));

  Reader reader(directory_.path("state"));
  EXPECT_THAT(reader.rows(),
              ElementsAre("1795000000000000 com.vantor.performance.tessel "
                          "{\"Z\":\"first\",\"A\":0.1,\"M\":true,\"Text\":\"a\xef\xbf\xbd\\\"b\"}",
                          "1795000000000007 ts__\xef\xbf\xbd__ {}"));
  EXPECT_EQ(reader.database().text("PRAGMA journal_mode"), "wal");
  EXPECT_EQ(reader.database().integer("SELECT length(value) FROM meta WHERE key='spool_id'"), 32);
  EXPECT_EQ(spool.endRun().stored, 2u);
  EXPECT_EQ(status_.steps, 2u) << "a row is progress";
  EXPECT_TRUE(log_.lines().empty());
}

TEST_F(SpoolTest, TheGroupMayWriteIt) {
  const mode_t before = ::umask(0007);
  Bench spool = bench();
  EXPECT_TRUE(spool.send("a", numbered(1)));
  ::umask(before);
  using std::filesystem::perms;
  const perms shared =
      perms::owner_read | perms::owner_write | perms::group_read | perms::group_write;
  for (const char* name : {"statora.db", "statora.db-wal", "statora.db-shm"}) {
    EXPECT_EQ(std::filesystem::status(directory_.path(name)).permissions(), shared) << name;
  }
}

TEST_F(SpoolTest, ALaterProcessGoesOnAndARemovedSpoolIsMadeAnew) {
  std::optional<std::string> id;
  for (int64_t run = 1; run <= 3; ++run) {
    Bench spool = bench();
    EXPECT_TRUE(spool.send("a", numbered(run)));
    Reader reader(directory_.path());
    EXPECT_EQ(reader.count(), run);
    const auto found = reader.database().text("SELECT value FROM meta WHERE key='spool_id'");
    EXPECT_EQ(id.value_or(*found), *found);
    id = found;
  }
  Bench spool = bench();
  EXPECT_TRUE(spool.send("a", numbered(4)));
  EXPECT_EQ(spool.endRun().stored, 1u);
  std::filesystem::remove(directory_.path(kSpoolFileName));
  EXPECT_TRUE(spool.send("a", numbered(5)));
  EXPECT_EQ(Reader(directory_.path()).count(), 1);
  EXPECT_EQ(spool.endRun().stored, 1u);
}

TEST_F(SpoolTest, RowsWaitForALockUntilTheRunEnds) {
  Bench spool = bench();
  ASSERT_TRUE(spool.send("a", numbered(0)));
  Reader other(directory_.path());
  const auto start = std::chrono::steady_clock::now();
  for (const bool released : {true, false}) {
    ASSERT_TRUE(other.database().execute("BEGIN IMMEDIATE").ok());
    for (int i = 1; i <= 200; ++i) EXPECT_TRUE(spool.send("a", numbered(i)));
    spool.tick();
    EXPECT_EQ(other.count(), 1);
    if (released) other.database().execute("COMMIT");
    const SpoolFigures figures = spool.endRun();
    if (!released) other.database().execute("COMMIT");
    EXPECT_EQ(failures(figures, SpoolFailure::locked), released ? 0u : 200u);
    EXPECT_EQ(other.count(), released ? 201 : 1);
    ASSERT_TRUE(other.database().execute("DELETE FROM events WHERE id > 1").ok());
  }
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(20))
      << "few waits a run";
  EXPECT_EQ(log_.lines().size(), 1u);
}

TEST_F(SpoolTest, ThreadsLoseNoRow) {
  Threads& threads = testing::realThreads();
  WorkerQueueFactory timers(threads);
  Spool spool(directory_.path(), {}, clock_, status_,
              std::make_shared<WorkerQueue>("writer", threads), timers);
  for (int run = 1; run <= 20; ++run) {
    for (int i = 0; i < 200; ++i) spool.sendEvent("a", numbered(i), EventRank::object);
    EXPECT_EQ(spool.endRun().stored, 200u);
    EXPECT_EQ(Reader(directory_.path()).count(), 200 * run);
  }
}

TEST_F(SpoolTest, ABufferThatIsFullRefusesObjectsAlone) {
  Bench spool = bench();
  const Payload large = ofSize(100'000);
  int taken = 0;
  while (spool.queue("a", large)) ASSERT_LT(++taken, 1000);
  EXPECT_EQ(taken, (16 << 20) / 100'012);
  EXPECT_FALSE(spool.queue("a", large));
  EXPECT_TRUE(spool.queue("b", large, EventRank::statistics));
  EXPECT_EQ(spool.pending(), 1u) << "one job for all rows";
  const SpoolFigures figures = spool.endRun();
  EXPECT_EQ(figures.stored, static_cast<uint64_t>(taken) + 1);
  EXPECT_EQ(failures(figures, SpoolFailure::bufferFull), 2u);
  EXPECT_EQ(log_.lines().size(), 1u);
  EXPECT_TRUE(spool.queue("a", large)) << "the buffer is empty again";
  EXPECT_EQ(spool.endRun().stored, 1u);
}

TEST_F(SpoolTest, AFailedSendHasItsReason) {
  const std::string file = directory_.path(kSpoolFileName);
  const struct {
    const char* what;
    std::function<void()> arrange;
    SpoolFailure reason;
  } cases[] = {
      {"a directory in its place", [&] { std::filesystem::create_directory(file); },
       SpoolFailure::readOnly},
      {"a newer schema",
       [&] {
         SqliteDatabase newer;
         ASSERT_TRUE(newer.open(file, SqliteDatabase::Mode::create).ok());
         ASSERT_TRUE(newer.execute("PRAGMA user_version=99; CREATE TABLE later(x)").ok());
       },
       SpoolFailure::version},
      {"another program's database",
       [&] {
         SqliteDatabase foreign;
         ASSERT_TRUE(foreign.open(file, SqliteDatabase::Mode::create).ok());
         ASSERT_TRUE(foreign.execute("CREATE TABLE events(something)").ok());
       },
       SpoolFailure::other},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    c.arrange();
    log_.clear();
    Bench spool = bench();
    spool.send("a", numbered(1));
    spool.queue("a", numbered(2));
    spool.send("a", numbered(3));
    std::filesystem::remove_all(file);
    EXPECT_TRUE(spool.send("a", numbered(4)));
    const SpoolFigures figures = spool.endRun();
    EXPECT_EQ(failures(figures, c.reason), 3u);
    EXPECT_EQ(figures.stored, 1u) << "works again as soon as the cause is gone";
    EXPECT_EQ(log_.lines().size(), 1u);
    EXPECT_TRUE(filesWith("damaged").empty());
    std::filesystem::remove_all(file);
  }
}

TEST_F(SpoolTest, EachFloodLeavesRoomForTheNextRun) {
  Bench spool = bench(kSmall);
  for (uint64_t run = 1, stored = 0; run <= 20; ++run) {
    const uint64_t share = spool.beginRun();
    EXPECT_LE(share, (kSmall.bytes - stored * 10'000) / 8) << run;
    for (int i = 0; i < 200; ++i) spool.send("a", ofSize(10'000));
    EXPECT_TRUE(spool.send("sum", numbered(int64_t(run)), EventRank::statistics));
    const SpoolFigures figures = spool.endRun();
    const uint64_t refused = failures(figures, SpoolFailure::runShare);
    EXPECT_EQ(refused, 200 - share / kLong) << "the spool takes what it has promised";
    EXPECT_EQ(figures.stored + refused, 201u);
    stored += figures.stored - 1;
    EXPECT_GE(stored, std::min<uint64_t>(run * 23, 450)) << "the limit is a size, not a handful";
  }
  for (int i = 0; i < 50; ++i) spool.send("a", numbered(i));
  EXPECT_EQ(spool.endRun().stored, 50u);
  EXPECT_LE(sizeOf(kSpoolFileName), kSmall.bytes);
  Reader reader(directory_.path());
  EXPECT_EQ(reader.database().integer("SELECT count(*) FROM events WHERE name='sum'"), 20)
      << "the statistics of each run";
  ASSERT_TRUE(reader.database().execute("DELETE FROM events WHERE id <= 200").ok());
  for (int i = 0; i < 20; ++i) spool.send("a", ofSize(10'000));
  EXPECT_EQ(spool.endRun().stored, 20u) << "space that was given back is used again";

  Bench large(*this, directory_.path("large"), {.bytes = 128 << 20});
  const uint64_t objects = large.beginRun() / spaceOfRow(500'012);
  for (int i = 0; i < 40; ++i) large.send("a", ofSize(500'000));
  for (int i = 0; i < 30; ++i) large.send("count", ofSize(48'500), EventRank::count);
  EXPECT_EQ(large.endRun().stored, objects + 30) << "the longest counts, behind a flood";
}

TEST_F(SpoolTest, RowsPastTheirDaysGo) {
  Bench spool = bench(kSmall);
  for (int i = 0; i < 60; ++i) spool.send("old", ofSize(10'000));
  EXPECT_EQ(spool.endRun().expired, 0u);
  clock_.advance(std::chrono::hours{24 * 29});
  for (int i = 0; i < 10; ++i) spool.send("newer", ofSize(10'000));
  EXPECT_EQ(spool.endRun().expired, 0u);
  const uint64_t before = sizeOf(kSpoolFileName);
  // A clock that was set back: an old row behind newer ones.
  EXPECT_TRUE(Reader(directory_.path())
                  .database()
                  .execute("INSERT INTO events SELECT 71, time, name, payload FROM events "
                           "WHERE id=1")
                  .ok());
  clock_.advance(std::chrono::hours{48});
  EXPECT_EQ(spool.endRun().expired, 61u) << "a run that sends nothing removes them, too";
  EXPECT_LT(sizeOf(kSpoolFileName), before / 5) << "the space is given back";
  Reader reader(directory_.path());
  EXPECT_EQ(reader.count(), 10);

  clock_.advance(std::chrono::hours{24 * 1000});
  Bench keeping = bench({.bytes = kSmall.bytes, .days = std::chrono::days{0}});
  EXPECT_EQ(keeping.endRun().expired, 0u);
  EXPECT_EQ(reader.count(), 10);
}

TEST_F(SpoolTest, AReaderThatStaysCostsRowsOnlyAtTheLimit) {
  Bench spool = bench(kSmall);
  spool.send("a", numbered(0));
  Reader other(directory_.path());
  const auto flood = [&] {
    for (int i = 0; i < 90; ++i) {
      for (int j = 0; j < 8; ++j) spool.queue("a", numbered(i));
      spool.send("a", numbered(i));
      spool.tick();
    }
    return spool.endRun();
  };
  ASSERT_TRUE(other.database().execute("BEGIN; SELECT count(*) FROM events").ok());
  EXPECT_EQ(flood().stored, 90u * 9 + 1);
  EXPECT_GT(sizeOf("statora.db-wal"), kSmall.bytes / 16);
  for (int i = 0; i < 2; ++i) spool.send("a", numbered(i));
  EXPECT_EQ(Reader(directory_.path()).count(), 90 * 9 + 1) << "they wait for others";
  for (int i = 0; i < 3; ++i) spool.send("a", ofSize(100'000));
  EXPECT_EQ(Reader(directory_.path()).count(), 90 * 9 + 6) << "together they fill a transaction";
  uint64_t held = 0;
  for (int run = 0; run < 20 && held == 0; ++run)
    held = failures(flood(), SpoolFailure::heldByReader);
  EXPECT_GT(held, 0u);
  EXPECT_LE(sizeOf("statora.db-wal") + sizeOf(kSpoolFileName), kSmall.bytes);
  ASSERT_TRUE(other.database().execute("COMMIT").ok());
  EXPECT_EQ(flood().stored, 90u * 9) << "as soon as the reader is gone";
  EXPECT_LE(sizeOf("statora.db-wal"), kSmall.bytes / 16);
}

TEST_F(SpoolTest, ADamagedSpoolIsSetAside) {
  const std::string damage(8192, '\x5a');
  directory_.write(kSpoolFileName, damage);
  directory_.write("statora.db-wal", "its log");
  Bench spool = bench();
  EXPECT_TRUE(spool.send("a", numbered(1)));
  const std::string name = "statora.db.damaged-20261118T110640Z";
  EXPECT_THAT(log_.lines(), ElementsAre(HasSubstr(name)));
  EXPECT_EQ(sizeOf(name), damage.size());
  EXPECT_EQ(sizeOf(name + "-wal"), 7u);
  EXPECT_EQ(Reader(directory_.path()).count(), 1);
  EXPECT_THAT(spool.endRun().setAside, ElementsAre(name));

  directory_.write(kSpoolFileName, damage);
  spool.send("a", numbered(2));
  EXPECT_THAT(spool.endRun().setAside, ElementsAre(name + "-2"))
      << "an older one is not overwritten";
}

TEST_F(SpoolTest, DamageCostsNoStoredRow) {
  Bench spool = bench();
  for (int i = 0; i < 300; ++i) ASSERT_TRUE(spool.send("a", ofSize(500)));
  EXPECT_EQ(spool.endRun().stored, 300u);
  // Everything but the first page: the schema is read, the tables are not.
  const auto size = sizeOf(kSpoolFileName);
  {
    std::fstream file(directory_.path(kSpoolFileName),
                      std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(4096);
    file << std::string(size - 4096, '\x5a');
  }
  EXPECT_TRUE(spool.send("a", numbered(1)));
  const SpoolFigures figures = spool.endRun();
  ASSERT_EQ(figures.setAside.size(), 1u);
  EXPECT_EQ(sizeOf(figures.setAside[0]), size);
  EXPECT_EQ(figures.stored, 1u);
}

}  // namespace
}  // namespace tessel
