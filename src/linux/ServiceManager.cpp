// The notification protocol of the service manager.

#include "linux/ServiceManager.h"

#include <systemd/sd-daemon.h>

#include <utility>

#include "platform/PlainText.h"

namespace tessel {

namespace {
constexpr int kFeedsPerWatchdogPeriod = 4;
}

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
  if (feedInterval_.count() > 0 && takeFeed()) notify_("WATCHDOG=1");
}

// True for one of the callers, once a feed interval has passed since the last true.
bool ServiceManager::takeFeed() {
  const Timebase base = clock_.timebase();
  const uint64_t now = clock_.continuousTicks();
  uint64_t due = nextFeed_.load(std::memory_order_relaxed);
  if (now < due) return false;
  const uint64_t interval =
      static_cast<uint64_t>(feedInterval_.count()) * base.denominator / base.numerator;
  return nextFeed_.compare_exchange_strong(due, now + interval, std::memory_order_relaxed);
}

std::unique_ptr<ServiceManager> connectServiceManager(Clock& clock) {
  uint64_t watchdog = 0;
  if (sd_watchdog_enabled(0, &watchdog) <= 0) watchdog = 0;
  return std::make_unique<ServiceManager>(
      clock, [](const std::string& message) { sd_notify(0, message.c_str()); },
      std::chrono::microseconds{watchdog});
}

}  // namespace tessel
