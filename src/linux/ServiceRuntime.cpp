// Process setup, the notification protocol, signals on a thread, the life of the process.
//
// A thread waits for a signal in sigwait() and submits a closure to a queue. A signal handler was
// discarded, because it may call next to nothing. signalfd was discarded too: it needs an event
// loop, for which the service has no other use.
//
// runMainLoop() ends the process by exit(0), and so may the closure of a signal. Detached threads
// may still run then; see Queues.cpp for why that is safe.

#include "linux/ServiceRuntime.h"

#include <fcntl.h>
#include <malloc.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <utility>

#include "platform/Invariant.h"
#include "platform/Text.h"

namespace tessel {

namespace {

void fillStandardDescriptors() {
  // open() answers the lowest free number. So each call fills one gap, or there is none left.
  for (;;) {
    // Without O_CLOEXEC: children inherit it like any standard descriptor.
    const int fd = ::open("/dev/null", O_RDWR);
    if (fd > STDERR_FILENO) ::close(fd);
    if (fd < 0 || fd > STDERR_FILENO) return;
  }
}

// A block of 128 KiB or more gets a mapping of its own, which goes back to the system when it is
// freed. The C library would raise this threshold after the first large block; setting it keeps it
// fixed. All threads share two heaps, so that a thread can reuse memory that another thread freed.
void keepHeapSmall() {
  constexpr int kLargeBlockBytes = 128 << 10;
  constexpr int kHeaps = 2;
  mallopt(M_MMAP_THRESHOLD, kLargeBlockBytes);
  mallopt(M_ARENA_MAX, kHeaps);
}

}  // namespace

void blockSignal(int signalNumber) {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, signalNumber);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
}

void prepareProcess() {
  blockSignal(SIGINT);
  std::signal(SIGPIPE, SIG_IGN);
  std::signal(SIGXFSZ, SIG_IGN);
  fillStandardDescriptors();
  keepHeapSmall();
}

namespace {
// The manager advises two signs of life a period. With four, one or two late ones do no harm.
constexpr int kFeedsPerWatchdogPeriod = 4;

// A disk that is busy for others answers within seconds. One that has not answered for a minute may
// never do so, and then only a restart helps.
constexpr std::chrono::seconds kLongestHonestWait{60};
}  // namespace

ServiceManager::ServiceManager(Clock& clock, Notify notify, std::chrono::nanoseconds watchdog)
    : clock_(clock),
      notify_(std::move(notify)),
      feedInterval_(watchdog / kFeedsPerWatchdogPeriod) {}

void ServiceManager::ready() { notify_("READY=1"); }

void ServiceManager::stopping() { notify_("STOPPING=1"); }

void ServiceManager::say(std::string_view words) {
  {
    const std::lock_guard lock(wordsMutex_);
    if (words != words_) {
      words_ = words;
      notify_("STATUS=" + plainText(words, " "));
    }
  }
  progress();
}

void ServiceManager::progress() {
  if (feedInterval_.count() == 0) return;
  const uint64_t now = clock_.continuousTicks();
  lastProgress_.store(now, std::memory_order_relaxed);
  feed(now);
}

void ServiceManager::standInForProgress() {
  if (feedInterval_.count() == 0) return;
  const uint64_t now = clock_.continuousTicks();
  if (now <= lastProgress_.load(std::memory_order_relaxed) + ticksOf(kLongestHonestWait)) feed(now);
}

uint64_t ServiceManager::ticksOf(std::chrono::nanoseconds time) const {
  const Timebase base = clock_.timebase();
  return static_cast<uint64_t>(time.count()) * base.denominator / base.numerator;
}

// Sends once per feed interval, for one caller only. It has no lock, because a run calls it for
// every trace object. Relaxed order is enough, because the threads share nothing but this one
// number.
void ServiceManager::feed(uint64_t now) {
  uint64_t due = nextFeed_.load(std::memory_order_relaxed);
  if (now < due) return;
  if (nextFeed_.compare_exchange_strong(due, now + ticksOf(feedInterval_),
                                        std::memory_order_relaxed))
    notify_("WATCHDOG=1");
}

std::unique_ptr<ServiceManager> connectServiceManager(Clock& clock) {
  uint64_t watchdog = 0;
  if (sd_watchdog_enabled(0, &watchdog) <= 0) watchdog = 0;
  return std::make_unique<ServiceManager>(
      clock, [](const std::string& message) { sd_notify(0, message.c_str()); },
      std::chrono::microseconds{watchdog});
}

namespace {

void deliverForEver(int signalNumber, const std::shared_ptr<SerialQueue>& queue,
                    const Closure& handler) {
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, signalNumber);
  for (;;) {
    int received = 0;
    if (sigwait(&signals, &received) == 0) queue->async(handler);
  }
}

}  // namespace

ThreadSignalSource::ThreadSignalSource(int signalNumber, std::shared_ptr<SerialQueue> queue,
                                       Threads& threads)
    : signalNumber_(signalNumber), queue_(std::move(queue)), threads_(threads) {}

void ThreadSignalSource::setHandler(Closure handler) { handler_ = std::move(handler); }

void ThreadSignalSource::resume() {
  if (!queue_) return;
  TESSEL_INVARIANT(handler_ != nullptr);
  startThread(threads_, [number = signalNumber_, queue = std::exchange(queue_, nullptr),
                         handler = std::exchange(handler_, nullptr)] {
    deliverForEver(number, queue, handler);
  });
}

// Holds one of the runtime's two counters up by one for as long as it lives.
class ServiceRuntime::Hold final : public KeepAliveTransaction {
 public:
  Hold(ServiceRuntime& runtime, size_t& counter) : runtime_(runtime), counter_(counter) {
    const std::lock_guard lock(runtime_.mutex_);
    ++counter_;
  }
  Hold(const Hold&) = delete;
  Hold& operator=(const Hold&) = delete;
  ~Hold() override {
    const std::lock_guard lock(runtime_.mutex_);
    // A counter that wrapped around would keep the process alive for ever. One that reached zero
    // too early would end it in the middle of a run.
    TESSEL_INVARIANT(counter_ > 0);
    --counter_;
    runtime_.changed_.signal();
  }

 private:
  ServiceRuntime& runtime_;
  size_t& counter_;
};

ServiceRuntime::ServiceRuntime(ServiceManager& manager, Threads& threads)
    : manager_(manager), threads_(threads) {}

std::unique_ptr<KeepAliveTransaction> ServiceRuntime::openTransaction(const std::string& /*name*/) {
  // From here on the work itself must send the signs of life. After this call it has at least three
  // quarters of a watchdog period for the first one.
  manager_.progress();
  return std::make_unique<Hold>(*this, transactions_);
}

std::unique_ptr<KeepAliveTransaction> ServiceRuntime::expectDelivery() {
  return std::make_unique<Hold>(*this, deliveries_);
}

void ServiceRuntime::requestCleanExit() {
  const std::lock_guard lock(mutex_);
  cleanExitRequested_ = true;
  changed_.signal();
}

std::shared_ptr<SignalSource> ServiceRuntime::makeSignalSource(int signalNumber,
                                                               std::shared_ptr<SerialQueue> queue) {
  return std::make_shared<ThreadSignalSource>(signalNumber, std::move(queue), threads_);
}

bool ServiceRuntime::mayExit() const {
  const std::lock_guard lock(mutex_);
  return exitAllowed();
}

bool ServiceRuntime::exitAllowed() const {
  return cleanExitRequested_ && transactions_ == 0 && deliveries_ == 0;
}

// While work is under way this loop wakes twice per feed interval. The work may have sent the last
// sign at any moment in between, and then the next one still comes within half a watchdog period.
void ServiceRuntime::waitUntilExitAllowed() {
  const std::chrono::nanoseconds feedInterval = manager_.feedInterval();
  std::unique_lock lock(mutex_);
  while (!exitAllowed()) {
    const bool working = transactions_ > 0;
    lock.unlock();
    const std::chrono::nanoseconds patience = working ? feedInterval / 2 : feedInterval;
    const bool changed =
        threads_.wait(changed_, feedInterval.count() == 0 ? Threads::kForEver : patience);
    if (!changed) working ? manager_.standInForProgress() : manager_.progress();
    lock.lock();
  }
}

void ServiceRuntime::serve() {
  manager_.ready();
  waitUntilExitAllowed();
  manager_.stopping();
}

void ServiceRuntime::runMainLoop() {
  serve();
  std::exit(0);
}

}  // namespace tessel
