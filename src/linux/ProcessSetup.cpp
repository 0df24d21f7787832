// Signals, standard descriptors and heap at process start.

#include "linux/ProcessSetup.h"

#include <fcntl.h>
#include <malloc.h>
#include <unistd.h>

#include <csignal>

namespace tessel {

namespace {

void fillStandardDescriptors() {
  // open() answers the lowest free number, so each call fills one gap or lands above them.
  for (;;) {
    const int fd =
        ::open("/dev/null", O_RDWR);  // kept open: inherited like any standard descriptor
    if (fd > STDERR_FILENO) ::close(fd);
    if (fd < 0 || fd > STDERR_FILENO) return;
  }
}

// A run's large blocks are mapped apart and go back when they are freed, where the C library would
// move its threshold up and keep them; and the few threads share two heaps, so that what one thread
// frees is used by the next.
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
  fillStandardDescriptors();
  keepHeapSmall();
}

}  // namespace tessel
