// Receives and parses datagrams of the journal's native protocol.

#include "FakeJournal.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <stdexcept>

namespace {

// Reads the field at `at` and moves `at` behind it.
std::pair<std::string, std::string> parseField(const std::string& text, size_t& at) {
  const size_t lineEnd = text.find('\n', at);
  if (lineEnd == std::string::npos) throw std::runtime_error("field without line feed");
  const std::string line = text.substr(at, lineEnd - at);
  at = lineEnd + 1;
  const size_t equals = line.find('=');
  if (equals != std::string::npos) return {line.substr(0, equals), line.substr(equals + 1)};
  uint64_t size = 0;
  for (size_t i = 0; i < 8; ++i) {
    size |= static_cast<uint64_t>(static_cast<unsigned char>(text.at(at + i))) << 8 * i;
  }
  std::string value = text.substr(at + 8, size);
  at += 8 + size;
  if (text.at(at++) != '\n') throw std::runtime_error("value does not end where its size says");
  return {line, value};
}

std::string fileContent(int fd) {
  struct stat status {};
  fstat(fd, &status);
  std::string content(static_cast<size_t>(status.st_size), '\0');
  if (pread(fd, content.data(), content.size(), 0) != status.st_size) content.clear();
  return content;
}

int passedDescriptor(msghdr& message) {
  for (cmsghdr* part = CMSG_FIRSTHDR(&message); part != nullptr;
       part = CMSG_NXTHDR(&message, part)) {
    if (part->cmsg_level != SOL_SOCKET || part->cmsg_type != SCM_RIGHTS) continue;
    int fd = -1;
    std::memcpy(&fd, CMSG_DATA(part), sizeof fd);
    return fd;
  }
  return -1;
}

}  // namespace

std::string JournalEntry::operator[](const std::string& name) const {
  for (const auto& [key, value] : fields) {
    if (key == name) return value;
  }
  return kNone;
}

FakeJournal::FakeJournal() {
  std::array<char, 32> pattern{"/tmp/tessel-journal-XXXXXX"};
  if (mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("no directory");
  directory_ = pattern.data();
  path_ = directory_ + "/socket";
  setenv("TESSEL_JOURNAL_SOCKET", path_.c_str(), 1);
  start();
}

FakeJournal::~FakeJournal() {
  stop();
  rmdir(directory_.c_str());
}

void FakeJournal::start() {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path_.copy(address.sun_path, sizeof address.sun_path - 1);
  fd_ = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  if (bind(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    throw std::runtime_error("bind");
  }
}

void FakeJournal::stop() {
  if (fd_ >= 0) close(fd_);
  fd_ = -1;
  unlink(path_.c_str());
}

std::vector<JournalEntry> FakeJournal::take() {
  std::vector<JournalEntry> entries;
  std::string buffer(1 << 18, '\0');
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int))> control{};
  for (;;) {
    iovec part{buffer.data(), buffer.size()};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    const ssize_t size = recvmsg(fd_, &message, MSG_CMSG_CLOEXEC);
    if (size < 0) return entries;
    JournalEntry entry;
    std::string text = buffer.substr(0, static_cast<size_t>(size));
    if (const int fd = passedDescriptor(message); fd >= 0) {
      entry.wasFile = true;
      entry.seals = fcntl(fd, F_GET_SEALS);
      text = fileContent(fd);
      close(fd);
    }
    for (size_t at = 0; at < text.size();) entry.fields.push_back(parseField(text, at));
    entries.push_back(std::move(entry));
  }
}
