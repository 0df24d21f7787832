// Signals and standard descriptors at process start.

#include "linux/ProcessSetup.h"

#include <fcntl.h>
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
}

}  // namespace tessel
