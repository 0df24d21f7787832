// Reading configurations and watching their files.
//
// A file is watched in two ways at once. inotify on its directory tells of a change within a
// millisecond; while the directory is missing, inotify on the nearest one above it tells of its
// making. That matters, because the gate waits only 5 s, and what is written in their last moments
// must still arrive. inotify misses some changes: in a file that a link leads to, on a file system
// without notifications. So we also look every 50 ms, which costs one read of a small file. An
// observer lives for one wait of the gate, so that is at most 100 reads a run.

#include "statora/ConfigurationFiles.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <filesystem>
#include <utility>

#include "os/Files.h"
#include "os/UniqueFd.h"
#include "platform/Log.h"

namespace tessel {

std::optional<ConfigurationChanges::Report> ConfigurationChanges::look(ConfigurationFile seen,
                                                                       Time now, bool done) {
  if (seen == told_) {
    doubt_.reset();
    return {};
  }
  auto configuration = seen.text ? parseConfiguration(*seen.text) : nullptr;
  // Some make an empty file first and open it once more to write it, so an empty one is never done.
  const bool final = done && seen.text && !seen.text->empty();
  if (!configuration && !final) {
    if (!doubt_ || doubt_->seen != seen) doubt_ = {std::move(seen), now};
    if (now < *confirmsAt()) return {};
    seen = std::move(doubt_->seen);
  }
  doubt_.reset();
  told_ = std::move(seen);
  // The delegate knows of one absence only, so another reason for it is no change.
  if (std::exchange(absenceTold_, !configuration) && !configuration) return {};
  return Report{std::move(configuration)};
}

std::optional<ConfigurationChanges::Time> ConfigurationChanges::confirmsAt() const {
  return doubt_ ? std::optional(doubt_->since + kPatience) : std::nullopt;
}

// An error of the kernel's that is about this process or the machine, and not about the file.
std::variant<ConfigurationFile, PlatformError> lookAtConfiguration(const std::string& path) {
  errno = 0;
  auto text = readSmallFile(path, FileConfigurationService::kMaxFileBytes);
  if (text) return ConfigurationFile{true, std::move(text)};
  if (errno == EMFILE || errno == ENFILE || errno == ENOMEM || errno == EINTR)
    return fileError(path, errno);
  // A file that cannot be read is kept apart from a missing one. A file that is replaced may be
  // unreadable, then missing, then there: each of these looks begins the doubt anew.
  struct stat facts {};
  const bool missing = ::stat(path.c_str(), &facts) != 0 && (errno == ENOENT || errno == ENOTDIR);
  return ConfigurationFile{!missing, {}};
}

namespace {

constexpr std::chrono::milliseconds kLookInterval{50};

// How long the first look may wait for a thread. The tasking gate waits 5 s for a configuration, so
// a lack of threads that passes within this time costs no run.
constexpr std::chrono::milliseconds kPatienceForAThread{2000};

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
  // Whether the last look failed for a lack of this process' own.
  std::atomic<bool> blind{false};

  // Watches the directory that the path leads to now, or the nearest one above it that is there.
  // Called before every look, because a link on the path may have changed. A second call for the
  // same directory adds nothing, and the kernel drops the watch of a directory that is gone.
  void watchDirectory() {
    std::filesystem::path nearest, before;
    do {
      // A directory that was made after we had looked for it, and before we watched the one above
      // it, would stay unseen. So we look until nothing new turns up.
      before = nearest;
      nearest = directory;
      watched_ = watch(nearest, IN_CLOSE_WRITE | IN_MODIFY | IN_DELETE | IN_ATTRIB | kNewNames);
      // Above the directory only new names matter. Busy directories have many other events.
      for (int above = watched_; above < 0 && nearest.has_relative_path();) {
        nearest = nearest.parent_path();
        above = watch(nearest, kNewNames);
      }
    } while (watched_ < 0 && nearest != before);
  }

  // False if the observer is gone or waiting fails. Otherwise something happened or `until` came.
  bool waitUntil(ConfigurationChanges::Time until) {
    // Rounded up: a wait that ends too early would end again and again.
    const auto timeout =
        std::chrono::ceil<std::chrono::milliseconds>(until - std::chrono::steady_clock::now());
    std::array<pollfd, 2> waited{{{ended.get(), POLLIN, 0}, {inotify.get(), POLLIN, 0}}};
    if (::poll(waited.data(), waited.size(), std::max(static_cast<int>(timeout.count()), 0)) < 0 &&
        errno != EINTR)
      return false;
    readEvents();
    return waited[0].revents == 0;
  }

  // Whether the last event of the file was its writer's last: he closed it or moved it here.
  bool writerIsDone() const { return writerIsDone_; }

 private:
  static constexpr uint32_t kNewNames = IN_CREATE | IN_MOVE;

  int watch(const std::filesystem::path& place, uint32_t events) const {
    return ::inotify_add_watch(inotify.get(), place.c_str(), events | IN_ONLYDIR);
  }

  void readEvents() {
    writerIsDone_ = false;
    alignas(inotify_event) std::array<char, 4096> buffer{};
    ssize_t size = 0;
    while ((size = ::read(inotify.get(), buffer.data(), buffer.size())) > 0) {
      for (ssize_t place = 0; place < size;) {
        const auto* event = reinterpret_cast<const inotify_event*>(buffer.data() + place);
        if (event->wd == watched_ && event->len != 0 && type + ".json" == event->name)
          writerIsDone_ = (event->mask & (IN_CLOSE_WRITE | IN_MOVED_TO)) != 0;
        place += static_cast<ssize_t>(sizeof *event + event->len);
      }
    }
  }

  int watched_ = -1;  // the watch of the directory itself; -1 if only one above it is watched
  bool writerIsDone_ = false;
};

class FileObserver final : public ConfigurationObserver,
                           public std::enable_shared_from_this<FileObserver> {
 public:
  FileObserver(std::string directory, Threads& threads)
      : directory_(std::move(directory)), threads_(threads) {}
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
    const auto watching = [watch = watch_, observer = weak_from_this()] {
      observe(*watch, observer);
    };
    // Without a thread the delegate is never called. That is no word on the configuration.
    if (!startThread(threads_, watching, kPatienceForAThread))
      sayBlind(*watch_, {ErrorCode::failed, "there is no thread for it"});
  }

  bool blind() const override { return watch_ && watch_->blind; }

 private:
  static void observe(Watch& watch, const std::weak_ptr<FileObserver>& observer) {
    ConfigurationChanges changes;
    ConfigurationChanges::Time next;
    do {
      watch.watchDirectory();
      auto seen = lookAtConfiguration(watch.path);
      const auto now = std::chrono::steady_clock::now();
      next = now + kLookInterval;
      if (const auto* error = std::get_if<PlatformError>(&seen)) {
        sayBlind(watch, *error);
        continue;
      }
      watch.blind = false;
      auto report =
          changes.look(std::get<ConfigurationFile>(std::move(seen)), now, watch.writerIsDone());
      if (report) {
        // The thread must not keep the observer alive, or dropping it would never end the thread.
        const auto target = observer.lock();
        if (!target) return;
        target->deliver(std::move(report->configuration), watch.type);
      }
      if (const auto confirms = changes.confirmsAt()) next = std::min(next, *confirms);
    } while (watch.waitUntil(next) && !observer.expired());
  }

  static void sayBlind(Watch& watch, const PlatformError& error) {
    if (!watch.blind.exchange(true))
      platformLog().warning("The configuration cannot be looked at: %@", error.words);
  }

  void deliver(std::shared_ptr<const ConfigurationValue> configuration, const std::string& type) {
    queue_->async([self = shared_from_this(), configuration = std::move(configuration), type] {
      self->delegate_->observerDidChangeConfiguration(*self, configuration, type);
    });
  }

  const std::string directory_;
  Threads& threads_;
  std::shared_ptr<ConfigurationObserverDelegate> delegate_;
  std::shared_ptr<SerialQueue> queue_;
  std::shared_ptr<Watch> watch_;
};

}  // namespace

std::shared_ptr<ConfigurationObserver> FileConfigurationService::makeObserver() {
  return std::make_shared<FileObserver>(directory_, threads_);
}

}  // namespace tessel
