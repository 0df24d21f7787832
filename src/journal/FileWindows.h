// WindowedFile: a file read with pread through a window that moves forward.
//
// No memory map, so a file that is cut short or fails under the reader costs a failed read and not
// the process. The windows of all files that are read at once share one budget; a window starts
// small and doubles while it is used, up to the share of its file.
//
// Threads: one at a time.
//
// ByteWindow: a file, pipe or socket read forward through a window.
//
// Nothing is mapped, so a file that is truncated meanwhile just ends early. At the end of what is
// there now, a later call sees what was added. The window takes its share of a budget, and more
// only while it is asked for more at once.
//
// Threads: one at a time, but for the stop flag.

#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <string_view>

#include "journal/EntryStream.h"
#include "os/UniqueFd.h"

namespace tessel {

// Shares a fixed amount of memory among the files that are read at once.
class WindowBudget {
 public:
  static constexpr size_t kTotal = size_t{12} << 20;
  static constexpr size_t kSmallest = size_t{1} << 10;
  static constexpr size_t kLargest = size_t{128} << 10;

  void join() { ++readers_; }
  void leave() { --readers_; }
  // Bytes that the window of one file may take.
  size_t share() const {
    return std::clamp(kTotal / std::max<size_t>(readers_, 1), kSmallest, kLargest);
  }

 private:
  size_t readers_ = 0;
};

class WindowedFile {
 public:
  // `budget` must outlive the file.
  WindowedFile(UniqueFd fd, uint64_t size, WindowBudget& budget);
  ~WindowedFile();
  WindowedFile(const WindowedFile&) = delete;
  WindowedFile& operator=(const WindowedFile&) = delete;

  // Bytes that the file had when it was opened, less once a read found it shorter.
  uint64_t size() const { return size_; }
  // Bytes that the window may take.
  size_t share() const { return budget_.share(); }
  // Whether a read failed or found the file shorter than it was.
  bool failed() const { return failed_; }

  // `size` bytes at `offset` by way of the window, which moves there if it must, keeping in view
  // what lies behind `from`, as far as that fits; null where the file does not hold them. Valid
  // until the next call of either at().
  const uint8_t* at(uint64_t offset, size_t size, uint64_t from);
  const uint8_t* at(uint64_t offset, size_t size) { return at(offset, size, offset); }
  // The same, only where the bytes are in the window; the window stays.
  const uint8_t* inWindow(uint64_t offset, size_t size) const {
    if (offset < windowStart_ || offset - windowStart_ > windowLength_) return nullptr;
    const size_t skipped = static_cast<size_t>(offset - windowStart_);
    return size <= windowLength_ - skipped ? window_.get() + skipped : nullptr;
  }
  // Bytes of the window from `offset` on; empty where it is not in the window.
  std::span<const uint8_t> restOfWindow(uint64_t offset) const;
  // The first place from `offset` on that is not a hole of the file, rounded down to eight bytes.
  uint64_t nextWritten(uint64_t offset) const;
  // Reads beside the window. Returns the number of bytes read, fewer than asked for at the end.
  size_t read(uint64_t offset, std::span<uint8_t> target);

 private:
  void moveWindow(uint64_t start, size_t least);

  UniqueFd fd_;
  uint64_t size_;
  WindowBudget& budget_;
  bool failed_ = false;
  std::unique_ptr<uint8_t[]> window_;
  size_t windowCapacity_ = 0;
  uint64_t windowStart_ = 0;
  size_t windowLength_ = 0;
};

class ByteWindow {
 public:
  // Takes the descriptor and closes it. A wait for a pipe ends soon after `stop` is set. `budget`
  // must outlive the window.
  ByteWindow(int fd, const StopFlag& stop, WindowBudget& budget);
  ~ByteWindow();
  ByteWindow(const ByteWindow&) = delete;
  ByteWindow& operator=(const ByteWindow&) = delete;

  // Tries to have `count` bytes in the window; false where there are fewer.
  bool fill(size_t count);
  // The bytes in the window; valid until the next call that is not const.
  std::string_view bytes() const { return {buffer_.get() + begin_, end_ - begin_}; }
  // REQUIRES: count <= bytes().size().
  void consume(size_t count);
  // Passes over `count` bytes; false where there are fewer, and the place is then the end.
  bool skip(uint64_t count);
  // Goes back to a place passed before; false where the descriptor cannot.
  bool rewind(uint64_t place);

  // Bytes from where reading began to the first in the window.
  uint64_t place() const { return place_; }
  // The last reading error, in words; empty where there was none.
  const std::string& error() const { return error_; }

 private:
  void makeRoom(size_t count);
  bool readMore();
  bool waitForInput();

  const int fd_;
  const StopFlag& stop_;
  WindowBudget& budget_;
  bool seekable_;
  int64_t base_ = 0;  // offset in the file of place 0
  std::unique_ptr<char[]> buffer_;
  size_t capacity_ = 0;
  size_t begin_ = 0;
  size_t end_ = 0;
  uint64_t place_ = 0;
  std::string error_;
};

}  // namespace tessel
