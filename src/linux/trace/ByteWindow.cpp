#include "linux/trace/ByteWindow.h"

#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <system_error>

namespace tessel {

namespace {

constexpr int kStopLatencyMilliseconds = 20;

}  // namespace

ByteWindow::ByteWindow(int fd, const StopFlag& stop)
    : fd_(fd), stop_(stop), buffer_(std::make_unique_for_overwrite<char[]>(kCapacity)) {
  const off_t offset = ::lseek(fd, 0, SEEK_CUR);
  seekable_ = offset >= 0;
  if (seekable_) base_ = offset;
}

ByteWindow::~ByteWindow() { ::close(fd_); }

bool ByteWindow::fill(size_t count) {
  if (end_ - begin_ >= count) return true;
  if (begin_ + count > kCapacity) {
    std::memmove(buffer_.get(), buffer_.get() + begin_, end_ - begin_);
    end_ -= begin_;
    begin_ = 0;
  }
  while (end_ - begin_ < count) {
    if (!readMore()) return false;
  }
  return true;
}

bool ByteWindow::readMore() {
  for (;;) {
    if (!seekable_ && !waitForInput()) return false;
    const ssize_t got = ::read(fd_, buffer_.get() + end_, kCapacity - end_);
    if (got > 0) {
      end_ += static_cast<size_t>(got);
      return true;
    }
    if (got == 0) return false;
    if (errno == EINTR || errno == EAGAIN) continue;
    error_ = std::generic_category().message(errno);
    return false;
  }
}

bool ByteWindow::waitForInput() {
  while (!stop_.load(std::memory_order_relaxed)) {
    pollfd waited{fd_, POLLIN, 0};
    if (::poll(&waited, 1, kStopLatencyMilliseconds) != 0) return true;
  }
  return false;
}

void ByteWindow::consume(size_t count) {
  begin_ += count;
  place_ += count;
  if (begin_ == end_) begin_ = end_ = 0;
}

bool ByteWindow::skip(uint64_t count) {
  while (count > 0) {
    if (stop_.load(std::memory_order_relaxed) || (bytes().empty() && !fill(1))) return false;
    const size_t step = static_cast<size_t>(std::min<uint64_t>(count, bytes().size()));
    consume(step);
    count -= step;
  }
  return true;
}

bool ByteWindow::rewind(uint64_t place) {
  if (place_ - place <= begin_) {
    begin_ -= static_cast<size_t>(place_ - place);
    place_ = place;
    return true;
  }
  if (!seekable_ || ::lseek(fd_, base_ + static_cast<off_t>(place), SEEK_SET) < 0) return false;
  begin_ = end_ = 0;
  place_ = place;
  return true;
}

}  // namespace tessel
