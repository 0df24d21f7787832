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

uint64_t failures(const Spool& spool, SpoolFailure kind) {
  return spool.figures().failed[static_cast<size_t>(kind)];
}

class SpoolTest : public ::testing::Test {
 protected:
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
  RecordingLog log_;
};

TEST_F(SpoolTest, RowsStandInSendOrder) {
  Spool spool(directory_.path("state"), clock_);
  EXPECT_FALSE(std::filesystem::exists(directory_.path("state"))) << "nothing was sent yet";
  Payload payload;
  payload.set("Z", SharedString("first"));
  payload.set("A", Number{0.1f});
  payload.set("M", Number{true});
  payload.set("Text", SharedString("a\xff\"b"));
  EXPECT_TRUE(spool.sendEvent("com.vantor.performance.tessel", payload));
  clock_.advance(std::chrono::microseconds{7});
  EXPECT_TRUE(spool.sendEvent("ts__\xc3__", Payload{}));

  Reader reader(directory_.path("state"));
  EXPECT_THAT(reader.rows(),
              ElementsAre("1795000000000000 com.vantor.performance.tessel "
                          "{\"Z\":\"first\",\"A\":0.1,\"M\":true,\"Text\":\"a\xef\xbf\xbd\\\"b\"}",
                          "1795000000000007 ts__\xef\xbf\xbd__ {}"));
  EXPECT_EQ(reader.database().text("PRAGMA journal_mode"), "wal");
  EXPECT_EQ(reader.database().integer("SELECT length(value) FROM meta WHERE key='spool_id'"), 32);
  EXPECT_EQ(spool.figures().stored, 2u);
  EXPECT_TRUE(log_.lines().empty());
}

TEST_F(SpoolTest, TheGroupMayWriteIt) {
  const mode_t before = ::umask(0007);
  Spool spool(directory_.path(), clock_);
  EXPECT_TRUE(spool.sendEvent("a", numbered(1)));
  ::umask(before);
  using std::filesystem::perms;
  const perms shared =
      perms::owner_read | perms::owner_write | perms::group_read | perms::group_write;
  for (const char* name : {"statora.db", "statora.db-wal", "statora.db-shm"}) {
    EXPECT_EQ(std::filesystem::status(directory_.path(name)).permissions(), shared) << name;
  }
}

TEST_F(SpoolTest, ALaterProcessGoesOn) {
  std::optional<std::string> id;
  for (int64_t run = 1; run <= 3; ++run) {
    Spool spool(directory_.path(), clock_);
    EXPECT_TRUE(spool.sendEvent("a", numbered(run)));
    Reader reader(directory_.path());
    EXPECT_EQ(reader.count(), run);
    const auto found = reader.database().text("SELECT value FROM meta WHERE key='spool_id'");
    EXPECT_EQ(id.value_or(*found), *found);
    id = found;
  }
}

TEST_F(SpoolTest, ARemovedSpoolIsMadeAnew) {
  Spool spool(directory_.path(), clock_);
  EXPECT_TRUE(spool.sendEvent("a", numbered(1)));
  spool.endRun();
  std::filesystem::remove(directory_.path(kSpoolFileName));
  spool.beginRun();
  EXPECT_EQ(spool.figures().stored, 0u);
  EXPECT_TRUE(spool.sendEvent("a", numbered(2)));
  EXPECT_EQ(Reader(directory_.path()).count(), 1);
}

TEST_F(SpoolTest, ALockHoldsTheQueueOnceAndIsSaidOnce) {
  Spool spool(directory_.path(), clock_);
  ASSERT_TRUE(spool.sendEvent("a", numbered(0)));
  Reader other(directory_.path());
  ASSERT_TRUE(other.database().execute("BEGIN IMMEDIATE").ok());
  const auto start = std::chrono::steady_clock::now();
  for (int i = 0; i < 200; ++i) EXPECT_FALSE(spool.sendEvent("a", numbered(i)));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(20))
      << "waited more than once";
  ASSERT_TRUE(other.database().execute("COMMIT").ok());
  EXPECT_TRUE(spool.sendEvent("a", numbered(1)));
  EXPECT_EQ(failures(spool, SpoolFailure::locked), 200u);
  EXPECT_EQ(log_.lines().size(), 1u);
  EXPECT_EQ(other.count(), 2);
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
    Spool spool(directory_.path(), clock_);
    EXPECT_FALSE(spool.sendEvent("a", numbered(1)));
    EXPECT_FALSE(spool.sendEvent("a", numbered(2)));
    EXPECT_EQ(failures(spool, c.reason), 2u);
    EXPECT_EQ(log_.lines().size(), 1u);
    EXPECT_TRUE(filesWith("damaged").empty());
    std::filesystem::remove_all(file);
    EXPECT_TRUE(spool.sendEvent("a", numbered(3))) << "works again as soon as the cause is gone";
    spool.endRun();
    std::filesystem::remove_all(file);
  }
}

TEST_F(SpoolTest, PastTheLimitOldRowsStay) {
  constexpr uint64_t kLimit = 1 << 20;
  Spool spool(directory_.path(), clock_, kLimit);
  uint64_t sent = 0;
  while (spool.sendEvent("a", ofSize(10'000))) ASSERT_LT(++sent, 1000u);
  EXPECT_FALSE(spool.sendEvent("a", ofSize(10'000)));
  EXPECT_GT(sent, 80u) << "the limit is a size, not a handful";
  EXPECT_EQ(failures(spool, SpoolFailure::limit), 2u);
  EXPECT_EQ(log_.lines().size(), 1u);
  spool.endRun();
  EXPECT_LE(std::filesystem::file_size(directory_.path(kSpoolFileName)), kLimit);

  Reader reader(directory_.path());
  EXPECT_EQ(reader.count(), static_cast<int64_t>(sent));
  ASSERT_TRUE(reader.database().execute("DELETE FROM events WHERE id <= 10").ok());
  spool.beginRun();
  EXPECT_TRUE(spool.sendEvent("a", ofSize(10'000))) << "space that was given back is used again";
}

TEST_F(SpoolTest, AnEndlessReaderCannotGrowTheLog) {
  constexpr uint64_t kLimit = 4 << 20;
  Spool spool(directory_.path(), clock_, kLimit);
  ASSERT_TRUE(spool.sendEvent("a", numbered(0)));
  Reader other(directory_.path());
  ASSERT_TRUE(other.database().execute("BEGIN; SELECT count(*) FROM events").ok());
  for (int i = 0; i < 2000; ++i) spool.sendEvent("a", numbered(i));
  EXPECT_GT(failures(spool, SpoolFailure::limit), 0u);
  EXPECT_LE(std::filesystem::file_size(directory_.path("statora.db-wal")), kLimit / 8);
  ASSERT_TRUE(other.database().execute("COMMIT").ok());
  EXPECT_TRUE(spool.sendEvent("a", numbered(1)));
}

TEST_F(SpoolTest, ADamagedSpoolIsSetAside) {
  const std::string damage(8192, '\x5a');
  directory_.write(kSpoolFileName, damage);
  directory_.write("statora.db-wal", "its log");
  Spool spool(directory_.path(), clock_);
  EXPECT_TRUE(spool.sendEvent("a", numbered(1)));
  const std::string name = "statora.db.damaged-20261118T110640Z";
  EXPECT_THAT(spool.figures().setAside, ElementsAre(name));
  EXPECT_THAT(log_.lines(), ElementsAre(HasSubstr(name)));
  EXPECT_EQ(std::filesystem::file_size(directory_.path(name)), damage.size());
  EXPECT_EQ(std::filesystem::file_size(directory_.path(name + "-wal")), 7u);
  EXPECT_EQ(Reader(directory_.path()).count(), 1);
  spool.endRun();

  directory_.write(kSpoolFileName, damage);
  EXPECT_FALSE(spool.sendEvent("a", numbered(2))) << "one a run, however bad the disk";
  EXPECT_EQ(failures(spool, SpoolFailure::damaged), 1u);
  spool.beginRun();
  EXPECT_TRUE(spool.sendEvent("a", numbered(3)));
  EXPECT_THAT(spool.figures().setAside, ElementsAre(name + "-2"))
      << "an older one is not overwritten";
}

TEST_F(SpoolTest, DamageCostsNoStoredRow) {
  Spool spool(directory_.path(), clock_);
  for (int i = 0; i < 300; ++i) ASSERT_TRUE(spool.sendEvent("a", ofSize(500)));
  spool.endRun();
  // Everything but the first page: the schema is read, the tables are not.
  const auto size = std::filesystem::file_size(directory_.path(kSpoolFileName));
  {
    std::fstream file(directory_.path(kSpoolFileName),
                      std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(4096);
    file << std::string(size - 4096, '\x5a');
  }
  EXPECT_TRUE(spool.sendEvent("a", numbered(1)));
  ASSERT_EQ(spool.figures().setAside.size(), 1u);
  EXPECT_EQ(std::filesystem::file_size(directory_.path(spool.figures().setAside[0])), size);
  EXPECT_EQ(spool.figures().stored, 301u);
}

}  // namespace
}  // namespace tessel
