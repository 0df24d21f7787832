// Waiting for a signal on a thread.

#include "linux/ThreadSignalSource.h"

#include <cassert>
#include <csignal>
#include <thread>
#include <utility>

namespace tessel {

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

ThreadSignalSource::ThreadSignalSource(int signalNumber, std::shared_ptr<SerialQueue> queue)
    : signalNumber_(signalNumber), queue_(std::move(queue)) {}

void ThreadSignalSource::setHandler(Closure handler) { handler_ = std::move(handler); }

void ThreadSignalSource::resume() {
  if (!queue_) return;
  assert(handler_);
  std::thread([number = signalNumber_, queue = std::exchange(queue_, nullptr),
               handler = std::exchange(handler_, nullptr)] {
    deliverForEver(number, queue, handler);
  }).detach();
}

}  // namespace tessel
