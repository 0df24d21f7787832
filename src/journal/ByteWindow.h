// ByteWindow: a file, pipe or socket read forward through a window.
//
// Nothing is mapped, so a file that is truncated meanwhile just ends early. At the end of what is
// there now, a later call sees what was added. The window takes its share of a budget, and more
// only while it is asked for more at once.
//
// Threads: one at a time, but for the stop flag.

#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "journal/EntryStream.h"
#include "journal/WindowedFile.h"

namespace tessel {

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
