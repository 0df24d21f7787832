// Observing a file, whatever is done to it.

#include "statora/FileConfigurationService.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <system_error>
#include <thread>
#include <utility>

#include "os/Files.h"
#include "os/UniqueFd.h"
#include "statora/ConfigurationChanges.h"

namespace tessel {

namespace {

constexpr std::chrono::milliseconds kLookInterval{250};

// What stands at the path.
ConfigurationFile readFile(const std::string& path) {
  auto text = readSmallFile(path, FileConfigurationService::kMaxFileBytes);
  if (text) return {true, std::move(text)};
  struct stat facts {};
  const bool missing = ::stat(path.c_str(), &facts) != 0 && (errno == ENOENT || errno == ENOTDIR);
  return {!missing, {}};
}

// What the watching thread works on. Shared with the observer, which only ends it.
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

  // Watches the directory that the path leads to now. The kernel knows a directory that is watched
  // already, and forgets one that is gone.
  void watchDirectory() const {
    ::inotify_add_watch(
        inotify.get(), directory.c_str(),
        IN_CLOSE_WRITE | IN_MODIFY | IN_CREATE | IN_DELETE | IN_MOVE | IN_ATTRIB | IN_ONLYDIR);
  }

  // True when something happened or `timeout` passed, false when it is over.
  bool wait(std::chrono::milliseconds timeout, bool heedEvents) const {
    std::array<pollfd, 2> waited{
        {{ended.get(), POLLIN, 0}, {heedEvents ? inotify.get() : -1, POLLIN, 0}}};
    if (::poll(waited.data(), waited.size(), static_cast<int>(timeout.count())) < 0 &&
        errno != EINTR)
      return false;
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
    if (watch_ || type.find('/') != std::string::npos) return;
    watch_ = std::make_shared<Watch>(directory_, type);
    try {
      std::thread([watch = watch_, observer = weak_from_this()] {
        observe(*watch, observer);
      }).detach();
    } catch (const std::system_error&) {
      // No thread to be had: the delegate is never called, as where there is no configuration.
    }
  }

 private:
  static void observe(const Watch& watch, const std::weak_ptr<FileObserver>& observer) {
    ConfigurationChanges changes;
    do {
      watch.watchDirectory();
      if (auto report = changes.look(readFile(watch.path))) {
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
