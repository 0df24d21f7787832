// Reading configurations and watching their files.
//
// A file is watched in two ways at once. inotify on its directory tells of a change within a
// millisecond. It misses some changes: a directory that is made later, a link on the path that is
// replaced, a file system without notifications. So we also look every quarter of a second, which
// costs one read of a small file. Watching every directory of the path was discarded: it needs far
// more code and would still miss the third kind.

#include "statora/ConfigurationFiles.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <limits>
#include <nlohmann/json.hpp>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

#include "os/Files.h"
#include "os/UniqueFd.h"

namespace tessel {

namespace {

using Json = nlohmann::json;

// Builds the value from the parser's events. A finished document was discarded, because it would be
// built before we could bound its depth. Each handler answers whether parsing goes on.
class Builder final : public nlohmann::json_sax<Json> {
 public:
  bool null() override { return add({}); }
  bool boolean(bool value) override { return add({Number{value}}); }
  bool number_integer(int64_t value) override { return add({Number{value}}); }
  bool number_unsigned(uint64_t value) override {
    const bool fitsSigned = value <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max());
    return add({fitsSigned ? Number{static_cast<int64_t>(value)} : Number{value}});
  }
  bool number_float(double value, const std::string& /*text*/) override {
    return add({Number{value}});
  }
  bool string(std::string& value) override { return add({std::move(value)}); }
  bool binary(Json::binary_t& /*value*/) override { return false; }

  bool start_object(size_t /*size*/) override { return open({ConfigurationValue::Dictionary{}}); }
  bool start_array(size_t /*size*/) override { return open({ConfigurationValue::List{}}); }
  bool end_object() override { return closeInnermost(); }
  bool end_array() override { return closeInnermost(); }
  bool key(std::string& name) override {
    open_.back().key = std::move(name);
    return true;
  }
  bool parse_error(size_t /*position*/, const std::string& /*token*/,
                   const Json::exception& /*error*/) override {
    return false;
  }

  ConfigurationValue take() { return std::move(root_); }

 private:
  struct Open {
    ConfigurationValue value;
    std::string key;  // of the member that is being read
  };

  bool open(ConfigurationValue container) {
    if (open_.size() == kMaxConfigurationDepth) return false;
    open_.push_back({std::move(container), {}});
    return true;
  }
  bool closeInnermost() {
    ConfigurationValue finished = std::move(open_.back().value);
    open_.pop_back();
    return add(std::move(finished));
  }
  bool add(ConfigurationValue value) {
    if (open_.empty()) {
      root_ = std::move(value);
    } else if (auto* list = std::get_if<ConfigurationValue::List>(&open_.back().value.value)) {
      list->push_back(std::move(value));
    } else {
      auto& dictionary = std::get<ConfigurationValue::Dictionary>(open_.back().value.value);
      dictionary.insert_or_assign(std::move(open_.back().key), std::move(value));
    }
    return true;
  }

  std::vector<Open> open_;
  ConfigurationValue root_;
};

}  // namespace

std::shared_ptr<const ConfigurationValue> parseConfiguration(std::string_view text) {
  // The parser takes a null byte for the end and would accept whatever follows.
  if (text.find('\0') != std::string_view::npos) return nullptr;
  Builder builder;
  if (!Json::sax_parse(text.begin(), text.end(), &builder)) return nullptr;
  return std::make_shared<const ConfigurationValue>(builder.take());
}

std::optional<ConfigurationChanges::Report> ConfigurationChanges::look(ConfigurationFile seen) {
  if (seen == told_) {
    unconfirmed_.reset();
    return {};
  }
  auto configuration = seen.text ? parseConfiguration(*seen.text) : nullptr;
  if (!configuration && unconfirmed_ != seen) {
    unconfirmed_ = std::move(seen);
    return {};
  }
  unconfirmed_.reset();
  told_ = std::move(seen);
  // The delegate knows of one absence only, so another reason for it is no change.
  if (std::exchange(absenceTold_, !configuration) && !configuration) return {};
  return Report{std::move(configuration)};
}

namespace {

constexpr std::chrono::milliseconds kLookInterval{250};

// Keeps a file that cannot be read apart from a missing one. An absence needs two equal looks, so a
// file that is replaced (unreadable, then missing, then there) is not taken for absent.
ConfigurationFile readFile(const std::string& path) {
  auto text = readSmallFile(path, FileConfigurationService::kMaxFileBytes);
  if (text) return {true, std::move(text)};
  struct stat facts {};
  const bool missing = ::stat(path.c_str(), &facts) != 0 && (errno == ENOENT || errno == ENOTDIR);
  return {!missing, {}};
}

// What the watching thread works on. The observer shares it, to end the thread through `ended`.
struct Watch {
  Watch(std::string directoryIn, std::string typeIn)
      : directory(std::move(directoryIn)),
        type(std::move(typeIn)),
        path(directory + "/" + type + ".json") {}

  const std::string directory;
  const std::string type;
  const std::string path;
  const UniqueFd inotify{::inotify_init1(IN_NONBLOCK | IN_CLOEXEC)};
  const UniqueFd ended{::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC)};

  // Watches the directory that the path leads to now. Called before every look, because a link on
  // the path may have changed. A second call for the same directory adds nothing, and the kernel
  // drops the watch of a directory that is gone.
  void watchDirectory() const {
    ::inotify_add_watch(
        inotify.get(), directory.c_str(),
        IN_CLOSE_WRITE | IN_MODIFY | IN_CREATE | IN_DELETE | IN_MOVE | IN_ATTRIB | IN_ONLYDIR);
  }

  // True if something happened or `timeout` passed. False if the observer is gone or waiting fails.
  // Without `heedEvents` only time counts: a burst of events must not confirm an absence too soon.
  bool wait(std::chrono::milliseconds timeout, bool heedEvents) const {
    std::array<pollfd, 2> waited{
        {{ended.get(), POLLIN, 0}, {heedEvents ? inotify.get() : -1, POLLIN, 0}}};
    if (::poll(waited.data(), waited.size(), static_cast<int>(timeout.count())) < 0 &&
        errno != EINTR)
      return false;
    // The events are discarded unread, because the look that follows shows what has changed.
    std::array<char, 4096> discarded{};
    while (::read(inotify.get(), discarded.data(), discarded.size()) > 0) {
    }
    return waited[0].revents == 0;
  }
};

class FileObserver final : public ConfigurationObserver,
                           public std::enable_shared_from_this<FileObserver> {
 public:
  explicit FileObserver(std::string directory) : directory_(std::move(directory)) {}
  FileObserver(const FileObserver&) = delete;
  FileObserver& operator=(const FileObserver&) = delete;
  ~FileObserver() override {
    if (watch_) ::eventfd_write(watch_->ended.get(), 1);
  }

  void setDelegate(std::shared_ptr<ConfigurationObserverDelegate> delegate,
                   std::shared_ptr<SerialQueue> queue) override {
    delegate_ = std::move(delegate);
    queue_ = std::move(queue);
  }

  void startObserving(const std::string& type) override {
    // A type with a slash would lead out of the directory.
    if (watch_ || type.find('/') != std::string::npos) return;
    watch_ = std::make_shared<Watch>(directory_, type);
    try {
      std::thread([watch = watch_, observer = weak_from_this()] {
        observe(*watch, observer);
      }).detach();
    } catch (const std::system_error&) {
      // Without a thread the delegate is never called, as if there were no configuration. The
      // service then works without it.
    }
  }

 private:
  static void observe(const Watch& watch, const std::weak_ptr<FileObserver>& observer) {
    ConfigurationChanges changes;
    do {
      watch.watchDirectory();
      if (auto report = changes.look(readFile(watch.path))) {
        // The thread must not keep the observer alive, or dropping it would never end the thread.
        const auto target = observer.lock();
        if (!target) return;
        target->deliver(std::move(report->configuration), watch.type);
      }
    } while (watch.wait(kLookInterval, !changes.unconfirmed()) && !observer.expired());
  }

  void deliver(std::shared_ptr<const ConfigurationValue> configuration, const std::string& type) {
    queue_->async([self = shared_from_this(), configuration = std::move(configuration), type] {
      self->delegate_->observerDidChangeConfiguration(*self, configuration, type);
    });
  }

  const std::string directory_;
  std::shared_ptr<ConfigurationObserverDelegate> delegate_;
  std::shared_ptr<SerialQueue> queue_;
  std::shared_ptr<Watch> watch_;
};

}  // namespace

std::shared_ptr<ConfigurationObserver> FileConfigurationService::makeObserver() {
  return std::make_shared<FileObserver>(directory_);
}

}  // namespace tessel
