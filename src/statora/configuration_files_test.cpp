// Configurations: their JSON, what an observer is told, and files that change in every way.

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <mutex>
#include <thread>

#include "os/testing/TemporaryDirectory.h"
#include "platform/Queues.h"
#include "platform/testing/Fakes.h"
#include "statora/ConfigurationFiles.h"

namespace tessel {
namespace {

TEST(ConfigurationJsonTest, NumbersKeepTheirKind) {
  const struct {
    const char* text;
    Number number;
  } cases[] = {
      {"true", Number{true}},
      {"false", Number{false}},
      {"1", Number{int64_t{1}}},
      {"-9223372036854775808", Number{std::numeric_limits<int64_t>::min()}},
      {"18446744073709551615", Number{uint64_t{18446744073709551615u}}},
      {"0.0", Number{0.0}},
      {"18446744073709551616", Number{18446744073709551616.0}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.text);
    const auto configuration = parseConfiguration(std::string("{\"TaskedOn\":") + c.text + "}");
    ASSERT_NE(configuration, nullptr);
    const auto& dictionary = std::get<ConfigurationValue::Dictionary>(configuration->value);
    EXPECT_EQ(std::get<Number>(dictionary.at("TaskedOn").value), c.number);
  }
}

TEST(ConfigurationJsonTest, TheLastOfEqualKeysCounts) {
  const auto configuration =
      parseConfiguration("\n{\"a\":[1,null,\"\\u00fc\"],\"b\":{\"a\":2},\"a\":[[],{}, \"x\"]}\n");
  ASSERT_NE(configuration, nullptr);
  const auto& dictionary = std::get<ConfigurationValue::Dictionary>(configuration->value);
  ASSERT_EQ(dictionary.size(), 2u);
  const auto& list = std::get<ConfigurationValue::List>(dictionary.at("a").value);
  ASSERT_EQ(list.size(), 3u);
  EXPECT_TRUE(std::holds_alternative<ConfigurationValue::List>(list[0].value));
  EXPECT_TRUE(std::holds_alternative<ConfigurationValue::Dictionary>(list[1].value));
  EXPECT_EQ(std::get<std::string>(list[2].value), "x");
  const auto& inner = std::get<ConfigurationValue::Dictionary>(dictionary.at("b").value);
  EXPECT_EQ(std::get<Number>(inner.at("a").value), Number{int64_t{2}});
}

TEST(ConfigurationJsonTest, NonsenseIsNoConfiguration) {
  const std::string endless(1 << 20, '[');
  for (const std::string& text :
       {std::string(), std::string("{\"TaskedOn\":true"), std::string("{\"TaskedOn\":true}x"),
        std::string("{}{}"), std::string("{'TaskedOn':true}"), std::string("{\"TaskedOn\":TRUE}"),
        std::string("[\"\xff\"]"), std::string("[1,]"), std::string("{}\0", 3),
        std::string("[1e999"), std::string("[1e999,01e999]"), std::string("[1e999,-]"), endless}) {
    EXPECT_EQ(parseConfiguration(text), nullptr) << text.substr(0, 60);
  }
}

TEST(ConfigurationJsonTest, AnOddMemberIsNullAndHarmsNoOther) {
  const auto nested = [](size_t levels) {
    return std::string(levels, '[') + "1" + std::string(levels, ']');
  };
  const std::string digits(400, '9');
  for (const std::string& odd :
       {std::string("1e400"), "-" + digits, digits + ".5", std::string("[[1e999], {\"x\": 1e999}]"),
        nested(kMaxConfigurationDepth), nested(200'000),
        "{\"a\":" + nested(kMaxConfigurationDepth) + ",\"b\":{}}"}) {
    SCOPED_TRACE(odd.substr(0, 60));
    const auto configuration = parseConfiguration("{\"1e400\":0,\"odd\":" + odd +
                                                  ",\"TaskedOn\":true,\"after\":\"\\\"1e400\"}");
    ASSERT_NE(configuration, nullptr);
    const auto& dictionary = std::get<ConfigurationValue::Dictionary>(configuration->value);
    ASSERT_EQ(dictionary.size(), 4u);
    EXPECT_EQ(std::get<Number>(dictionary.at("TaskedOn").value), Number{true});
    EXPECT_EQ(std::get<std::string>(dictionary.at("after").value), "\"1e400");
    size_t depth = 0;
    for (const ConfigurationValue* value = &dictionary.at("odd");; ++depth) {
      const auto* list = std::get_if<ConfigurationValue::List>(&value->value);
      if (list == nullptr || list->empty()) break;
      value = &list->front();
    }
    EXPECT_LT(depth, kMaxConfigurationDepth);
  }
}

TEST(ConfigurationJsonTest, AMemberIsChangedInItsPlace) {
  const struct {
    const char* text;
    const char* changed;
  } cases[] = {
      {"{}", R"({"on": true})"},
      {" { } \n", " {\"on\": true } \n"},
      {R"({"a": 1e400, "on" : [1, {"on": 2}] ,"b":2.50})",
       R"({"a": 1e400, "on" : true ,"b":2.50})"},
      {R"({"on":1,"x":{"on":2},"on":"}"})", R"({"on":1,"x":{"on":2},"on":true})"},
      {"{\n  \"x\": [\"on\"]\n}\n", "{\n  \"x\": [\"on\"], \"on\": true\n}\n"},
      {R"({"\u006fn":false})", R"({"\u006fn":true})"},
  };
  for (const auto& c : cases) EXPECT_EQ(withMember(c.text, "on", "true"), c.changed);
}

const ConfigurationFile kNone{false, {}};
const ConfigurationFile kUnreadable{true, {}};
ConfigurationFile holding(const char* text) { return {true, text}; }

TEST(ConfigurationChangesTest, AbsenceIsToldWhenItLasts) {
  const struct {
    const char* what;
    std::vector<ConfigurationFile> looks;
    const char* told;      // a letter a look: c a configuration, a its absence, - nothing
    const char* how = "";  // a letter a look: d its writer is done, s soon after the one before
  } cases[] = {
      {"never a file", {kNone, kNone, kNone}, "---"},
      {"made, changed, touched", {kNone, holding("1"), holding("2"), holding("2")}, "-cc-"},
      {"written slowly",
       {holding(""), holding("{"), holding("{\"a\":"), holding("{\"a\":1}")},
       "---c"},
      {"rewritten slowly with what it held",
       {holding("{}"), holding("{"), holding("{}"), holding("{")},
       "c---"},
      {"left half written", {holding("{"), holding("{"), holding("{")}, "-a-"},
      {"gone for a moment", {holding("1"), kNone, holding("1")}, "c--"},
      {"gone, then back as it was", {holding("1"), kNone, kNone, kNone, holding("1")}, "c-a-c"},
      {"closed half written", {kNone, holding("{"), kUnreadable}, "-a-", "-dd"},
      {"closed empty, then written", {holding(""), holding("{}")}, "-c", "ds"},
      {"looked at again and again", {holding("{"), holding("{"), holding("{")}, "---", "-ss"},
      {"absent for one reason after another",
       {holding("1"), kNone, kNone, kUnreadable, kUnreadable},
       "c-a--"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    ConfigurationChanges changes;
    ConfigurationChanges::Time now{};
    std::string how = c.how;
    how.resize(c.looks.size(), '-');
    std::string told;
    for (size_t look = 0; look < c.looks.size(); ++look) {
      now += how[look] == 's' ? std::chrono::milliseconds{10} : ConfigurationChanges::kPatience;
      const auto report = changes.look(c.looks[look], now, how[look] == 'd');
      told += !report ? '-' : report->configuration ? 'c' : 'a';
    }
    EXPECT_EQ(told, c.told);
  }
}

using testing::TemporaryDirectory;

constexpr char kType[] = "com.vantor.performance.tessel_reporter_tasking";
constexpr std::chrono::seconds kDeadline{30};
// More than two looks long: nothing that was going to be called would come later.
constexpr std::chrono::milliseconds kQuiet{600};

// Keeps the text under "v" of every configuration that it is called with; "absent" for none.
class RecordingDelegate final : public ConfigurationObserverDelegate {
 public:
  void observerDidChangeConfiguration(
      ConfigurationObserver& /*observer*/,
      const std::shared_ptr<const ConfigurationValue>& configuration,
      const std::string& type) override {
    EXPECT_EQ(type, kType);
    {
      const std::lock_guard lock(mutex_);
      calls_.push_back(textOf(configuration));
    }
    called_.signal();
  }
  // The next call; "none" where there is none in time.
  std::string next(std::chrono::milliseconds deadline = kDeadline) {
    if (!called_.waitFor(deadline)) return "none";
    const std::lock_guard lock(mutex_);
    return calls_[taken_++];
  }

 private:
  static std::string textOf(const std::shared_ptr<const ConfigurationValue>& configuration) {
    if (!configuration) return "absent";
    const auto* dictionary = std::get_if<ConfigurationValue::Dictionary>(&configuration->value);
    if (dictionary == nullptr) return "no dictionary";
    const auto found = dictionary->find("v");
    return found == dictionary->end() ? "no v" : std::get<std::string>(found->second.value);
  }

  std::mutex mutex_;
  std::vector<std::string> calls_;
  size_t taken_ = 0;
  Semaphore called_{0};
};

class FileConfigurationServiceTest : public ::testing::Test {
 protected:
  static constexpr const char* kFile = "com.vantor.performance.tessel_reporter_tasking.json";

  void observe() { observe(directory_.path()); }
  void observe(const std::string& directory) {
    observer_ = FileConfigurationService(directory, testing::realThreads()).makeObserver();
    observer_->setDelegate(delegate_, queue_);
    observer_->startObserving(kType);
  }
  void replaceByRename(const std::string& text) {
    directory_.write("new", text);
    std::filesystem::rename(directory_.path("new"), directory_.path(kFile));
  }

  TemporaryDirectory directory_;
  std::shared_ptr<RecordingDelegate> delegate_ = std::make_shared<RecordingDelegate>();
  std::shared_ptr<WorkerQueue> queue_ =
      std::make_shared<WorkerQueue>("test", testing::realThreads());
  std::shared_ptr<ConfigurationObserver> observer_;
};

TEST_F(FileConfigurationServiceTest, CallsOnEachChange) {
  directory_.write(kFile, R"({"v":"one"})");
  observe();
  EXPECT_EQ(delegate_->next(), "one");
  directory_.write(kFile, R"({"v":"rewritten in place"})");
  EXPECT_EQ(delegate_->next(), "rewritten in place");
  replaceByRename(R"({"v":"replaced"})");
  EXPECT_EQ(delegate_->next(), "replaced");
  std::filesystem::remove(directory_.path(kFile));
  EXPECT_EQ(delegate_->next(), "absent");
  directory_.write(kFile, R"(["v"])");
  EXPECT_EQ(delegate_->next(), "no dictionary");
  directory_.write(kFile, R"({"v":)");
  EXPECT_EQ(delegate_->next(), "absent");
  directory_.write(kFile, R"({"v":"back"})");
  EXPECT_EQ(delegate_->next(), "back");
  replaceByRename(R"({"v":"back"})");
  directory_.write("another.json", R"({"v":"other"})");
  EXPECT_EQ(delegate_->next(kQuiet), "none") << "nothing changed";
}

TEST_F(FileConfigurationServiceTest, NoCallWithoutAFile) {
  observe(directory_.path("later/still"));
  EXPECT_EQ(delegate_->next(kQuiet), "none");
  std::filesystem::create_directories(directory_.path("later/still"));
  EXPECT_EQ(delegate_->next(kQuiet), "none");
  directory_.write(std::string("later/still/") + kFile, R"({"v":"made"})");
  EXPECT_EQ(delegate_->next(), "made");
}

TEST_F(FileConfigurationServiceTest, ReplacedLinksAreSeen) {
  for (const char* name : {"a", "b", "c"}) {
    std::filesystem::create_directory(directory_.path(name));
    directory_.write(std::string(name) + "/" + kFile, std::string(R"({"v":")") + name + "\"}");
  }
  std::filesystem::create_directory(directory_.path("config"));
  observe(directory_.path("config"));
  EXPECT_EQ(delegate_->next(kQuiet), "none");
  std::filesystem::remove(directory_.path("config"));
  std::filesystem::create_directory_symlink("a", directory_.path("config"));
  EXPECT_EQ(delegate_->next(), "a");
  std::filesystem::create_directory_symlink("b", directory_.path("link"));
  std::filesystem::rename(directory_.path("link"), directory_.path("config"));
  EXPECT_EQ(delegate_->next(), "b");
  std::filesystem::remove(directory_.path("config"));
  EXPECT_EQ(delegate_->next(), "absent");
  std::filesystem::rename(directory_.path("c"), directory_.path("config"));
  EXPECT_EQ(delegate_->next(), "c");
  directory_.write(std::string("config/") + kFile, R"({"v":"in c"})");
  EXPECT_EQ(delegate_->next(), "in c");
}

TEST_F(FileConfigurationServiceTest, NonsenseIsAbsent) {
  const std::string file = directory_.path(kFile);
  const struct {
    const char* what;
    std::function<void()> arrange;
  } cases[] = {
      {"empty", [&] { directory_.write(kFile, ""); }},
      {"over 1 MiB",
       [&] {
         directory_.write(
             kFile,
             "{\"v\":\"" + std::string(FileConfigurationService::kMaxFileBytes, 'x') + "\"}");
       }},
      {"a directory", [&] { std::filesystem::create_directory(file); }},
      {"a pipe", [&] { ASSERT_EQ(mkfifo(file.c_str(), 0600), 0); }},
      {"a link to itself", [&] { ASSERT_EQ(symlink(file.c_str(), file.c_str()), 0); }},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    std::filesystem::remove_all(file);
    c.arrange();
    observe();
    EXPECT_EQ(delegate_->next(), "absent");
  }
}

TEST_F(FileConfigurationServiceTest, NoThreadIsLeft) {
  const auto entries = [](const char* path) {
    return std::distance(std::filesystem::directory_iterator(path),
                         std::filesystem::directory_iterator());
  };
  directory_.write(kFile, R"({"v":"one"})");
  observe();
  EXPECT_EQ(delegate_->next(), "one");
  const auto descriptors = entries("/proc/self/fd");
  const auto threads = entries("/proc/self/task");  // the one that watches among them
  for (int i = 0; i < 1000; ++i) {
    observe();
    ASSERT_EQ(delegate_->next(), "one");
  }
  // The last observer stands for the first; the others' threads end on their own.
  const auto deadline = std::chrono::steady_clock::now() + kDeadline;
  while (entries("/proc/self/fd") > descriptors && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::yield();
  }
  EXPECT_EQ(entries("/proc/self/fd"), descriptors);
  observer_.reset();
  while (entries("/proc/self/task") >= threads && std::chrono::steady_clock::now() < deadline)
    std::this_thread::yield();
  EXPECT_LT(entries("/proc/self/task"), threads) << "nobody watches any more";
}

TEST_F(FileConfigurationServiceTest, AQueuedCallIsMade) {
  directory_.write(kFile, R"({"v":"one"})");
  Semaphore blocked(0);
  queue_->async([&blocked] { blocked.waitFor(kDeadline); });
  observe();
  const std::weak_ptr<ConfigurationObserver> watched = observer_;
  // The watching thread has submitted its call once it holds on to the observer.
  while (watched.use_count() < 2) std::this_thread::yield();
  observer_.reset();
  blocked.signal();
  EXPECT_EQ(delegate_->next(), "one");
}

}  // namespace
}  // namespace tessel
