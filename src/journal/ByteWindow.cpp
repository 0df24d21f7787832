#include "journal/ByteWindow.h"

#include <poll.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <system_error>
#include <utility>

namespace tessel {

namespace {

constexpr int kStopLatencyMilliseconds = 20;

}  // namespace

ByteWindow::ByteWindow(int fd, const StopFlag& stop, WindowBudget& budget)
    : fd_(fd), stop_(stop), budget_(budget) {
  budget_.join();
  const off_t offset = ::lseek(fd, 0, SEEK_CUR);
  seekable_ = offset >= 0;
  if (seekable_) base_ = offset;
}

ByteWindow::~ByteWindow() {
  budget_.leave();
  ::close(fd_);
}

bool ByteWindow::fill(size_t count) {
  if (end_ - begin_ >= count) return true;
  makeRoom(count);
  while (end_ - begin_ < count) {
    if (!readMore()) return false;
  }
  return true;
}

// Brings what is held to the front of a buffer for `count` bytes, more than are held. A buffer that
// had to be larger than its share is given back here.
void ByteWindow::makeRoom(size_t count) {
  const size_t wanted = std::max(count, budget_.share());
  if (begin_ + count <= capacity_ && capacity_ <= wanted) return;
  const size_t held = end_ - begin_;
  if (wanted == capacity_) {
    std::memmove(buffer_.get(), buffer_.get() + begin_, held);
  } else {
    auto buffer = std::make_unique_for_overwrite<char[]>(wanted);
    if (held != 0) std::memcpy(buffer.get(), buffer_.get() + begin_, held);
    buffer_ = std::move(buffer);
    capacity_ = wanted;
  }
  begin_ = 0;
  end_ = held;
}

bool ByteWindow::readMore() {
  for (;;) {
    if (!seekable_ && !waitForInput()) return false;
    const ssize_t got = ::read(fd_, buffer_.get() + end_, capacity_ - end_);
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
