// File descriptors and errno.

#include "os/Files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string_view>
#include <system_error>

#include "os/UniqueFd.h"

namespace tessel {

std::string errorWords(int errnoValue) { return std::generic_category().message(errnoValue); }

namespace {

ssize_t readSome(int fd, char* buffer, size_t size) {
  for (;;) {
    const ssize_t count = ::read(fd, buffer, size);
    if (count >= 0 || errno != EINTR) return count;
  }
}

}  // namespace

std::optional<std::string> readSmallFile(const std::string& path, size_t maximum) {
  const UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  struct stat facts {};
  if (!file.valid() || ::fstat(file.get(), &facts) != 0 || !S_ISREG(facts.st_mode)) return {};
  std::string text;
  char buffer[4096];
  for (;;) {
    const ssize_t count = readSome(file.get(), buffer, sizeof buffer);
    if (count == 0) return text;
    if (count < 0) return {};
    text.append(buffer, static_cast<size_t>(count));
    if (text.size() > maximum) return {};
  }
}

bool writeAll(int fd, std::string_view text) {
  while (!text.empty()) {
    const ssize_t count = ::write(fd, text.data(), text.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return false;
    text.remove_prefix(static_cast<size_t>(count));
  }
  return true;
}

}  // namespace tessel
