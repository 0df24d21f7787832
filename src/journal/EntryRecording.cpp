// The text of an entry, and the ways to hand it over.

#include "journal/EntryRecording.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <tessel/trace.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <ctime>
#include <filesystem>
#include <string>
#include <system_error>

#include "journal/EntryStream.h"
#include "os/Files.h"

namespace tessel {

namespace {

constexpr std::string_view kEntryStart = "\n\n__CURSOR=";
constexpr std::string_view kEntryEnd = "\n\n";
// Bytes. We look for the last entry at the end of the file. kFirstLook holds a usual entry; each
// further look takes four times as much. kLastLook is four times what a reader keeps of an entry.
// If that holds no beginning of an entry, the new one begins a sequence of its own, and readers
// cannot tell whether entries before it are missing.
constexpr off_t kFirstLook = off_t{64} * 1024;
constexpr off_t kLastLook = off_t{4} * 1024 * 1024;
constexpr size_t kPiece = TESSEL_BUFFER_SIZE;
constexpr const char* kSocket = "/run/systemd/journal/socket";

uint64_t microsecondsOf(clockid_t clock) {
  timespec now{};
  ::clock_gettime(clock, &now);
  return static_cast<uint64_t>(now.tv_sec) * 1'000'000 + static_cast<uint64_t>(now.tv_nsec) / 1000;
}

// Of a file in /proc; empty if it cannot be read.
std::string firstLineOf(const char* path) {
  const std::string text = readSmallFile(path, 4096).value_or("");
  return text.substr(0, text.find('\n'));
}

PlatformError failure(const std::string& path, const std::string& doing, int error) {
  return fileError("Cannot " + doing + " " + path, error);
}

// Our hash (FNV-1a) is not the daemon's, and need not be. It only has to be equal for equal
// entries, so that the merge recognises the entries of a copied export file as copies. XOR makes
// the order of the fields irrelevant.
uint64_t contentHashOf(const std::vector<RecordedField>& fields) {
  uint64_t all = 0;
  for (const RecordedField& field : fields) {
    uint64_t hash = 0xcbf29ce484222325u;
    for (const char c : field.name + "=" + field.value) {
      hash = (hash ^ static_cast<uint8_t>(c)) * 0x100000001b3u;
    }
    all ^= hash;
  }
  return all;
}

void appendField(std::string& out, std::string_view name, std::string_view value) {
  // A newline would end the field, and other control characters garble a terminal. So a value with
  // any of them is written with its length in front.
  const bool text = std::none_of(value.begin(), value.end(),
                                 [](char c) { return static_cast<uint8_t>(c) < ' ' && c != '\t'; });
  out += name;
  if (text) {
    out += '=';
  } else {
    out += '\n';
    for (int shift = 0; shift < 64; shift += 8) {
      out += static_cast<char>((uint64_t{value.size()} >> shift) & 0xff);
    }
  }
  out += value;
  out += '\n';
}

std::string readAt(int fd, off_t offset, size_t count) {
  std::string text(count, '\0');
  const ssize_t got = ::pread(fd, text.data(), count, offset);
  text.resize(got > 0 ? static_cast<size_t>(got) : 0);
  return text;
}

Id128 randomId() {
  Id128 id{};
  // The result is not checked: the kernel never returns fewer bytes than were asked for, up to 256.
  [[maybe_unused]] const ssize_t got = ::getrandom(id.data(), id.size(), 0);
  return id;
}

// The header of the last entry in `tail`, which may begin within an entry.
std::optional<EntryHeader> lastEntryIn(std::string_view tail) {
  // A value may hold text that looks like the start of an entry, so only a whole cursor counts.
  for (size_t at = tail.rfind(kEntryStart); at != std::string_view::npos;
       at = at == 0 ? std::string_view::npos : tail.rfind(kEntryStart, at - 1)) {
    std::string_view cursor = tail.substr(at + kEntryStart.size());
    cursor = cursor.substr(0, cursor.find('\n'));
    if (const auto header = parseCursor(cursor)) return header;
  }
  return std::nullopt;
}

// The header of the last entry in the file; nothing if there is none with a cursor.
std::optional<EntryHeader> lastEntry(int fd, off_t size) {
  for (off_t look = kFirstLook;; look *= 4) {
    const off_t from = std::max<off_t>(0, size - look);
    std::string tail = readAt(fd, from, static_cast<size_t>(size - from));
    if (from == 0) tail.insert(0, kEntryEnd);  // the first entry has no empty line before it
    if (const auto header = lastEntryIn(tail)) return header;
    if (from == 0 || look >= kLastLook) return std::nullopt;
  }
}

std::optional<PlatformError> appendLocked(int fd, const std::string& path,
                                          const RecordOrigin& origin,
                                          const std::vector<RecordedField>& fields) {
  struct stat status {};
  if (::fstat(fd, &status) != 0) return failure(path, "look at", errno);
  EntryHeader header;
  // All entries of one file belong to one sequence, so that readers can tell whether some are
  // missing.
  const std::optional<EntryHeader> last = lastEntry(fd, status.st_size);
  header.sequenceId = last ? last->sequenceId : randomId();
  header.sequenceNumber = last ? last->sequenceNumber + 1 : 1;
  header.bootId = origin.boot;
  header.monotonic = origin.monotonic;
  header.realtime = origin.realtime;
  header.contentHash = contentHashOf(fields);
  std::string text = exportText(header, origin, fields);
  // A writer that was killed may have left half an entry. An empty line ends it, so that ours does
  // not become part of it; the reader reports the half as bad.
  if (status.st_size > 0 && readAt(fd, std::max<off_t>(0, status.st_size - 2), 2) != kEntryEnd) {
    text.insert(0, kEntryEnd);
  }
  if (writeAll(fd, text)) return std::nullopt;
  // Readers would wait for the rest of half an entry, so we take back the part that was written.
  const int error = errno;
  if (::ftruncate(fd, status.st_size) != 0)
    return failure(path, "take back half an entry in", errno);
  return failure(path, "write to", error);
}

// In pieces, because a value that is not a trace point's may be longer than the buffer.
void putBytes(tessel_message_& message, std::string_view bytes) {
  for (; !bytes.empty(); bytes.remove_prefix(std::min(bytes.size(), kPiece))) {
    tessel_put_(&message, bytes.data(), std::min(bytes.size(), kPiece));
  }
}

void putField(tessel_message_& message, const RecordedField& field) {
  std::string text;
  appendField(text, field.name, field.value);
  putBytes(message, text);
}

}  // namespace

RecordOrigin currentOrigin() {
  RecordOrigin origin;
  origin.realtime = microsecondsOf(CLOCK_REALTIME);
  origin.monotonic = microsecondsOf(CLOCK_MONOTONIC);
  origin.boot = parseId128(firstLineOf("/proc/sys/kernel/random/boot_id")).value_or(Id128{});
  std::error_code error;
  const auto image = std::filesystem::read_symlink("/proc/self/exe", error);
  if (!error) origin.imagePath = image.string();
  // The daemon takes these three from the kernel too, so our entry looks like one of its own.
  origin.processName = firstLineOf("/proc/self/comm");
  origin.process = std::to_string(::getpid());
  origin.user = std::to_string(::getuid());
  return origin;
}

std::string exportText(const EntryHeader& header, const RecordOrigin& origin,
                       const std::vector<RecordedField>& fields) {
  std::string text;
  appendField(text, "__CURSOR", cursorOf(header));
  appendField(text, "__REALTIME_TIMESTAMP", std::to_string(header.realtime));
  appendField(text, "__MONOTONIC_TIMESTAMP", std::to_string(header.monotonic));
  appendField(text, "_BOOT_ID", textOf(header.bootId));
  for (const RecordedField& field : fields) appendField(text, field.name, field.value);
  if (origin.imagePath) appendField(text, "_EXE", *origin.imagePath);
  if (origin.processName) appendField(text, "_COMM", *origin.processName);
  if (origin.process) appendField(text, "_PID", *origin.process);
  if (origin.user) appendField(text, "_UID", *origin.user);
  return text + '\n';
}

std::optional<PlatformError> appendToExportFile(const std::string& directory,
                                                const RecordOrigin& origin,
                                                const std::vector<RecordedField>& fields) {
  const std::string path =
      directory.ends_with(".export") ? directory : directory + "/tessel.export";
  const UniqueFd file(::open(path.c_str(), O_RDWR | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
  if (!file.valid()) return failure(path, "open", errno);
  // The sequence number follows that of the last entry, so nobody else may append between our look
  // at the file and our write. The lock ends when the descriptor is closed.
  while (::flock(file.get(), LOCK_EX) != 0) {
    if (errno != EINTR) return failure(path, "lock", errno);
  }
  return appendLocked(file.get(), path, origin, fields);
}

bool recordingEnabled() { return tessel_enabled(); }

std::optional<PlatformError> sendToJournal(const std::vector<RecordedField>& fields) {
  tessel_message_ message;
  tessel_start_(&message);
  for (const RecordedField& field : fields) putField(message, field);
  const int error = tessel_hand_over_(&message, true);
  if (message.memfd >= 0) ::close(message.memfd);
  if (error == EAGAIN) return PlatformError{ErrorCode::failed, "the journal has no room"};
  if (error == ENOENT || error == ECONNREFUSED) {
    return PlatformError{ErrorCode::notFound, "no journal is running"};
  }
  if (error != 0) return failure(kSocket, "write to the journal at", error);
  return std::nullopt;
}

void countAsLost() { tessel_count_lost_(); }

}  // namespace tessel
