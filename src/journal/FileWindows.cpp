// Windows over files that others may cut or extend meanwhile.

#include "journal/FileWindows.h"

#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "os/Files.h"

namespace tessel {

namespace {
// The merge holds the first entry of every file long before it reads on in most of them. One page
// is enough for that entry.
constexpr size_t kFirstWindow = size_t{4} << 10;
constexpr uint64_t kPage = 4096;
// A stop must take effect within a few tens of milliseconds, and waking fifty times a second costs
// nothing that shows.
constexpr int kStopLatencyMilliseconds = 20;
}  // namespace

WindowedFile::WindowedFile(UniqueFd fd, uint64_t size, WindowBudget& budget)
    : fd_(std::move(fd)), size_(size), budget_(budget) {
  budget_.join();
}

WindowedFile::~WindowedFile() { budget_.leave(); }

bool WindowedFile::removed() const {
  struct stat status {};
  return ::fstat(fd_.get(), &status) == 0 && status.st_nlink == 0;
}

const uint8_t* WindowedFile::atElsewhere(uint64_t offset, size_t size, uint64_t from) {
  if (offset > size_ || size > size_ - offset) return nullptr;
  // The share bounds the memory of a run. moveWindow() below takes more only if the caller asked
  // for more bytes at once.
  const size_t capacity = std::min(std::max(windowCapacity_ * 2, kFirstWindow), budget_.share());
  const uint64_t end = offset + size;
  uint64_t start = std::min(from, offset);
  // The caller reads on from `offset`. So the bytes before it take at most half of the window;
  // otherwise a large distance from `from` would leave no room, and each entry would move it.
  if (end - start > capacity / 2)
    start = std::max(start, offset - std::min<uint64_t>(offset, capacity / 2));
  // A large window begins at a page, because the kernel copies whole pages faster. A small one
  // would waste too much of itself, so it begins at a multiple of eight, as objects do.
  start -= start % (capacity >= 8 * kPage ? kPage : 8);
  moveWindow(start, std::max(static_cast<size_t>(end - start), capacity));
  return inWindow(offset, size);
}

// If the size changes, we free the old window and read all bytes anew. To keep the old bytes we
// would need both windows at once; the kernel still has them in its cache.
void WindowedFile::moveWindow(uint64_t start, size_t wanted) {
  if (wanted != windowCapacity_) {
    window_.reset();  // before the new one is taken, so that there are never two
    window_ = std::make_unique_for_overwrite<uint8_t[]>(wanted);
    windowCapacity_ = wanted;
  }
  windowStart_ = start;
  windowLength_ = 0;
  const size_t length = static_cast<size_t>(std::min<uint64_t>(wanted, size_ - start));
  windowLength_ = read(start, {window_.get(), length});
  TESSEL_INVARIANT(windowLength_ <= windowCapacity_);
}

uint64_t WindowedFile::nextWritten(uint64_t offset) const {
  const off_t found = ::lseek(fd_.get(), static_cast<off_t>(offset), SEEK_DATA);
  // ENXIO: nothing but a hole is left. Other errors mean that the file system knows no holes.
  if (found < 0) return errno == ENXIO ? size_ : offset;
  return std::max(offset, static_cast<uint64_t>(found) & ~uint64_t{7});
}

size_t WindowedFile::read(uint64_t offset, std::span<uint8_t> target) {
  size_t done = 0;
  // pread and not read: the window and the chains of a file share one descriptor.
  while (done < target.size()) {
    const ssize_t got = ::pread(fd_.get(), target.data() + done, target.size() - done,
                                static_cast<off_t>(offset + done));
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) {
      // These bytes were there when the file was opened. Either it was cut, or it cannot be read.
      // From now on the smaller size bounds all offsets, so that we do not ask again and again.
      if (offset + done < size_) {
        failed_ = true;
        struct stat status {};
        if (::fstat(fd_.get(), &status) == 0)
          size_ = std::min(size_, static_cast<uint64_t>(status.st_size));
      }
      break;
    }
    done += static_cast<size_t>(got);
  }
  return done;
}

ByteWindow::ByteWindow(int fd, const StopFlag& stop, WindowBudget& budget)
    : fd_(fd), stop_(stop), budget_(budget) {
  budget_.join();
  // A pipe has no offset: it cannot go back, and reading it may have to wait.
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

// Makes room for `count` bytes, and moves the bytes that are held to the front. A long value may
// have made the buffer larger than the share; here it shrinks again.
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
    error_ = errorWords(errno);
    return false;
  }
}

bool ByteWindow::waitForInput() {
  // read() alone would sleep in the kernel, where the stop flag cannot wake it.
  while (!stop_.load(std::memory_order_relaxed)) {
    pollfd waited{fd_, POLLIN, 0};
    if (::poll(&waited, 1, kStopLatencyMilliseconds) != 0) return true;
  }
  return false;
}

void ByteWindow::consume(size_t count) {
  TESSEL_INVARIANT(count <= end_ - begin_);  // the place must stay within what was read
  begin_ += count;
  place_ += count;
  if (begin_ == end_) begin_ = end_ = 0;  // spares the next fill() from moving anything
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
  TESSEL_INVARIANT(place <= place_);
  // Bytes before begin_ stay in the buffer until makeRoom() moves the rest over them.
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
