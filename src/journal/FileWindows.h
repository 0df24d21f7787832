// Windows: the small pieces of files that are in memory while we read them.
//
// WindowedFile reads a regular file at any offset; ByteWindow reads a file, pipe or socket forward.
// Both copy with read and pread. A memory map would spare the copy. But journals are cut while we
// read them, and the kernel kills a process that touches a mapped page behind the cut. With pread
// such a file costs a failed read.
//
// A store can have thousands of files and reads all of them at once, because it merges them. So all
// windows share one WindowBudget, and memory does not grow with the number of files.
//
// Threads: one at a time, except for the stop flag.

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
#include "platform/Invariant.h"

namespace tessel {

// Divides a fixed amount of memory among the files that are read at once.
class WindowBudget {
 public:
  // On a usual machine a day has fewer than 96 files, and 12 MiB give each of them the largest
  // window. 8,192 files, the most that a store takes, get 1.5 KiB each. 12 MiB are a tenth of the
  // 128 MB that a run of the service may take.
  static constexpr size_t kTotal = size_t{12} << 20;
  // An entry and its usual data fit in this.
  static constexpr size_t kSmallest = size_t{1} << 10;
  // With so many bytes for each system call, the calls no longer show in the time of a run. The
  // window still fits the processor's second-level cache beside the token cache.
  static constexpr size_t kLargest = size_t{128} << 10;

  void join() { ++readers_; }
  void leave() {
    TESSEL_INVARIANT(readers_ > 0);  // otherwise the shares would no longer add up to kTotal
    --readers_;
  }
  // Bytes that the window of one file may take now.
  size_t share() const {
    return std::clamp(kTotal / std::max<size_t>(readers_, 1), kSmallest, kLargest);
  }

 private:
  size_t readers_ = 0;
};

// A regular file. Its window starts small and doubles each time it moves, up to the file's share.
class WindowedFile {
 public:
  // `budget` must outlive the file.
  WindowedFile(UniqueFd fd, uint64_t size, WindowBudget& budget);
  ~WindowedFile();
  WindowedFile(const WindowedFile&) = delete;
  WindowedFile& operator=(const WindowedFile&) = delete;

  // Bytes: the size when the file was opened, or less after a read found the file shorter.
  uint64_t size() const { return size_; }
  // Bytes that the window may take.
  size_t share() const { return budget_.share(); }
  // Whether the file has no name any more. It can be read whole until its blocks are freed.
  bool removed() const;
  // Whether a read failed or found the file shorter than it was. Stays true.
  bool failed() const { return failed_; }
  bool wasCut() const { return size_ < openedSize_; }

  // Returns the `size` bytes at `offset`, or null if the file does not hold them. If they are not
  // in the window, the window moves. A caller that will also look at bytes before them passes the
  // offset of these as `from`: the window then begins there if all fit. Valid until the next call
  // of at().
  const uint8_t* at(uint64_t offset, size_t size, uint64_t from) {
    if (const uint8_t* bytes = inWindow(offset, size)) [[likely]]
      return bytes;
    return atElsewhere(offset, size, from);
  }
  const uint8_t* at(uint64_t offset, size_t size) { return at(offset, size, offset); }
  // Returns the same without moving the window, or null if the bytes are not in it.
  const uint8_t* inWindow(uint64_t offset, size_t size) const {
    if (offset < windowStart_ || offset - windowStart_ > windowLength_) return nullptr;
    const size_t skipped = static_cast<size_t>(offset - windowStart_);
    return size <= windowLength_ - skipped ? window_.get() + skipped : nullptr;
  }
  // Drops what is in the window, so that bytes which others wrote meanwhile are read.
  void forget() { windowLength_ = 0; }
  // Bytes of the window from `offset` on; empty if `offset` is not in the window.
  std::span<const uint8_t> restOfWindow(uint64_t offset) const {
    const uint8_t* bytes = inWindow(offset, 0);
    if (bytes == nullptr) return {};
    return {bytes, windowLength_ - static_cast<size_t>(offset - windowStart_)};
  }
  // The first offset, `offset` or later, that is not in a hole of the file, rounded down to eight
  // bytes. The search skips the holes of sparse files with this.
  uint64_t nextWritten(uint64_t offset) const;
  // Reads without the window. Returns the number of bytes; fewer than asked for if the file ends.
  size_t read(uint64_t offset, std::span<uint8_t> target);

 private:
  const uint8_t* atElsewhere(uint64_t offset, size_t size, uint64_t from);
  void moveWindow(uint64_t start, size_t wanted);

  UniqueFd fd_;
  uint64_t size_;
  const uint64_t openedSize_ = size_;
  WindowBudget& budget_;
  bool failed_ = false;
  std::unique_ptr<uint8_t[]> window_;
  size_t windowCapacity_ = 0;
  uint64_t windowStart_ = 0;
  size_t windowLength_ = 0;
};

// A file, pipe or socket that is read forward. At the end of a file, a further call reads the bytes
// that were added since. The window has its share of the budget; it is larger only while a call of
// fill() needs more.
class ByteWindow {
 public:
  // Owns the descriptor. A wait for a pipe ends at most 20 ms after `stop` is set. `budget` and
  // `stop` must outlive the window.
  ByteWindow(int fd, const StopFlag& stop, WindowBudget& budget);
  ~ByteWindow();
  ByteWindow(const ByteWindow&) = delete;
  ByteWindow& operator=(const ByteWindow&) = delete;

  // Reads until `count` bytes are in the window; false if there are fewer, or if reading failed.
  bool fill(size_t count);
  // The bytes in the window. Valid until the next call that is not const.
  std::string_view bytes() const { return {buffer_.get() + begin_, end_ - begin_}; }
  // REQUIRES: count <= bytes().size().
  void consume(size_t count);
  // Passes over `count` bytes. False if there are fewer, and then the place is at the end; or after
  // a stop.
  bool skip(uint64_t count);
  // Goes back to an earlier place. False if the window no longer holds that place and the
  // descriptor cannot seek.
  bool rewind(uint64_t place);

  // The place of the first of bytes(): how many bytes were consumed since reading began.
  uint64_t place() const { return place_; }
  // The last error of reading, in words; empty if there was none.
  const std::string& error() const { return error_; }

 private:
  void makeRoom(size_t count);
  bool readMore();
  bool waitForInput();

  const int fd_;
  const StopFlag& stop_;
  WindowBudget& budget_;
  bool seekable_;
  int64_t base_ = 0;  // offset in the file where reading began
  std::unique_ptr<char[]> buffer_;
  size_t capacity_ = 0;
  size_t begin_ = 0;
  size_t end_ = 0;
  uint64_t place_ = 0;
  std::string error_;
};

}  // namespace tessel
