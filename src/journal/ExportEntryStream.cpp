// Line by line over a window; only the heads of wanted fields are kept.

#include "journal/ExportEntryStream.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "journal/EntryStream.h"
#include "journal/JournalFormat.h"
#include "os/UniqueFd.h"
#include "platform/Invariant.h"

namespace tessel {

namespace {

// Bytes. The tokenizer sees no more of a line. So we read a longer line in pieces, and the window
// need not grow for it.
constexpr size_t kLongLine = kMaxFieldHead;

bool isFieldName(std::string_view name) {
  const auto valid = [](char c) {
    return (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_';
  };
  return !name.empty() && name.size() <= kMaxFieldNameLength &&
         std::all_of(name.begin(), name.end(), valid);
}

}  // namespace

ExportEntryStream::ExportEntryStream(int fd, ExportReadResources& resources,
                                     FieldTokenizer& tokenizer, const StopFlag& stop,
                                     FileReport& report)
    : resources_(resources),
      window_(fd, stop, resources.windows),
      tokenizer_(tokenizer),
      stop_(stop),
      report_(report) {}

bool ExportEntryStream::next() {
  while (!stop_.load(std::memory_order_relaxed)) {
    if (resynchronising_ && !resynchronise()) return false;
    startEntry();
    switch (readEntry()) {
      case Outcome::complete:
        return true;
      case Outcome::skipped:
        break;
      case Outcome::bad:
        resynchronising_ = true;
        break;
      case Outcome::ended:
        waitAtEntry();
        return false;
    }
  }
  return false;
}

// Each entry starts from nothing, so what a bad one left behind never becomes part of the next.
void ExportEntryStream::startEntry() {
  header_ = {};
  hasRealtime_ = false;
  dropKept();
  entryPlace_ = window_.place();
}

// How much this stream takes, with `added` more bytes, of the memory that all streams share.
size_t ExportEntryStream::keptBeyondUsual(size_t added) const {
  const size_t memory = kept_.size() + keptFields_.size() * sizeof(KeptField) + added;
  return memory - std::min(memory, kUsualEntry);
}

// Forgets the fields of the entry. clear() alone would keep their memory, and one large entry in
// each of thousands of files would add up. So only the memory of a usual entry stays.
void ExportEntryStream::dropKept() {
  TESSEL_INVARIANT(resources_.bytesKept >= keptBeyondUsual(0));  // the streams' shares add up
  resources_.bytesKept -= keptBeyondUsual(0);
  kept_.clear();
  keptFields_.clear();
  if (kept_.capacity() > kUsualEntry) kept_.shrink_to_fit();
  if (keptFields_.capacity() > kUsualEntry / sizeof(KeptField)) keptFields_.shrink_to_fit();
}

ExportEntryStream::Outcome ExportEntryStream::readEntry() {
  bool empty = true;
  for (Line line; readLine(line); empty = false) {
    // Further empty lines are no entry. The recorder writes two to end half an entry.
    if (line.size == 0) return empty ? Outcome::skipped : finishEntry();
    const Outcome outcome = readField(line);
    if (outcome != Outcome::complete) return outcome;
  }
  return Outcome::ended;
}

ExportEntryStream::Outcome ExportEntryStream::finishEntry() {
  // Without a time an entry is in no range and has no place in the merge.
  if (hasRealtime_) return Outcome::complete;
  report_.addProblem("entry without __REALTIME_TIMESTAMP", entryPlace_);
  return Outcome::skipped;
}

// Reads up to the next newline; false if there is none yet, or after a stop: an entry, and what
// lies between two, may be as long as the file. The bytes before `searched` hold no newline, so we
// do not look at them again each time the window has grown.
bool ExportEntryStream::readLine(Line& line) {
  if (stop_.load(std::memory_order_relaxed)) return false;
  for (size_t searched = 0; searched <= kLongLine; searched = window_.bytes().size()) {
    if (!window_.fill(searched + 1)) return false;
    const std::string_view bytes = window_.bytes();
    const size_t newline = bytes.find('\n', searched);
    if (newline == std::string_view::npos) continue;
    line = {bytes.substr(0, std::min(newline, kMaxFieldHead)), newline};
    window_.consume(newline + 1);
    return true;
  }
  return readLongLine(line);
}

// Reads a line of any length. Its beginning is copied first, because the window moves past it.
bool ExportEntryStream::readLongLine(Line& line) {
  resources_.longHead = window_.bytes().substr(0, kMaxFieldHead);
  uint64_t size = 0;
  while (!stop_.load(std::memory_order_relaxed) && window_.fill(1)) {
    const std::string_view bytes = window_.bytes();
    const size_t newline = bytes.find('\n');
    const size_t length = std::min(newline, bytes.size());
    size += length;
    window_.consume(newline == std::string_view::npos ? length : length + 1);
    if (newline == std::string_view::npos) continue;
    line = {resources_.longHead, size};
    return true;
  }
  return false;
}

ExportEntryStream::Outcome ExportEntryStream::readField(const Line& line) {
  const size_t equals = line.head.find('=');
  if (equals != std::string_view::npos) return takeField(equals, line.head, line.size);
  if (line.size == line.head.size() && isFieldName(line.head)) return readBinaryField(line.head);
  return bad("line that is no field");
}

ExportEntryStream::Outcome ExportEntryStream::readBinaryField(std::string_view name) {
  // Copied, because fill() for the value may move the window, and `name` points into it.
  std::string head(name);
  head += '=';
  const uint64_t lengthPlace = window_.place();
  if (!window_.fill(8)) return Outcome::ended;
  const uint64_t length =
      journal_format::load<uint64_t>(reinterpret_cast<const uint8_t*>(window_.bytes().data()));
  // Checked before consume(): the search for the next empty line then begins at the wrong length.
  if (length > kMaxValueLength) return bad("value longer than any");
  window_.consume(8);
  const auto shown = static_cast<size_t>(std::min<uint64_t>(length, kMaxFieldValueLength + 1));
  if (!window_.fill(shown)) return Outcome::ended;
  head.append(window_.bytes().substr(0, shown));
  if (!window_.skip(length) || !window_.fill(1)) return Outcome::ended;
  if (window_.bytes().front() != '\n') {
    goBackWithin(lengthPlace);
    return bad("value of another length than stated");
  }
  window_.consume(1);
  const size_t nameLength = head.find('=');
  return takeField(nameLength, head, nameLength + 1 + length);
}

// After a wrong length the next empty line may lie in the bytes that we took for the value, so we
// go back to `place`. A file full of wrong lengths could make us read it as often as it has fields.
// So all ways back together may be at most eight times as long as the file so far; after that we go
// on behind the value, as we do in a pipe that cannot go back.
void ExportEntryStream::goBackWithin(uint64_t place) {
  constexpr uint64_t kTimesOver = 8;
  const uint64_t distance = window_.place() - place;
  if (wentBack_ + distance > kTimesOver * window_.place()) return;
  wentBack_ += distance;
  window_.rewind(place);
}

ExportEntryStream::Outcome ExportEntryStream::takeField(size_t nameLength, std::string_view head,
                                                        uint64_t size) {
  const std::string_view name = head.substr(0, nameLength);
  if (name.starts_with("__") || name == "_BOOT_ID") {
    return takeAddress(name, head.substr(nameLength + 1));
  }
  if (!tokenizer_.wants(name)) return Outcome::complete;
  if (keptFields_.size() == kMaxFieldsKept || kept_.size() + head.size() > kMaxBytesKept) {
    return bad("entry with too many fields");
  }
  // Memory is bounded, so one of the entries must go. It is this one; the report names it.
  const size_t more = keptBeyondUsual(head.size() + sizeof(KeptField)) - keptBeyondUsual(0);
  if (resources_.bytesKept + more > kMaxBytesKeptByAll) {
    return bad("entry too large beside those of other files");
  }
  resources_.bytesKept += more;
  const uint64_t valueSize = size - nameLength - 1;
  keptFields_.push_back({static_cast<uint32_t>(kept_.size()), static_cast<uint32_t>(nameLength),
                         static_cast<uint32_t>(head.size()),
                         static_cast<uint32_t>(std::min<uint64_t>(valueSize, UINT32_MAX))});
  kept_ += head;
  return Outcome::complete;
}

// Takes a field of the entry's header: its time, boot, sequence or number. The cursor holds all of
// them, but some writers leave it out. It comes first in an entry, so the single fields overwrite
// its parts.
ExportEntryStream::Outcome ExportEntryStream::takeAddress(std::string_view name,
                                                          std::string_view value) {
  if (name == "__CURSOR") {
    if (const auto place = parseCursor(value)) header_ = *place;
  } else if (name == "__REALTIME_TIMESTAMP") {
    // A second timestamp means that the empty line between two entries was lost. If we read on, the
    // fields of both would become one entry.
    if (hasRealtime_) return bad("two entries without an empty line between");
    if (!parseNumber(value, 10, header_.realtime)) return bad("invalid __REALTIME_TIMESTAMP");
    hasRealtime_ = true;
  } else if (name == "__MONOTONIC_TIMESTAMP") {
    if (!parseNumber(value, 10, header_.monotonic)) return bad("invalid __MONOTONIC_TIMESTAMP");
  } else if (name == "__SEQNUM") {
    if (!parseNumber(value, 10, header_.sequenceNumber)) return bad("invalid __SEQNUM");
  } else if (const auto id = parseId128(value)) {
    if (name == "__SEQNUM_ID") header_.sequenceId = *id;
    if (name == "_BOOT_ID") header_.bootId = *id;
  }
  return Outcome::complete;
}

ExportEntryStream::Outcome ExportEntryStream::bad(std::string_view reason) {
  report_.addProblem(reason, entryPlace_);
  return Outcome::bad;
}

// Passes over everything up to the next empty line; false if it is not there yet.
bool ExportEntryStream::resynchronise() {
  for (Line line; readLine(line);) {
    if (line.size == 0) {
      resynchronising_ = false;
      return true;
    }
  }
  return false;
}

// Goes back to the beginning of an incomplete entry, so that the next call of next() reads it
// again. However often it is still incomplete, the report counts it once.
void ExportEntryStream::waitAtEntry() {
  if (!window_.error().empty()) report_.addProblem("read error: " + window_.error(), entryPlace_);
  const bool stopped = stop_.load(std::memory_order_relaxed);
  if (stopped || (window_.place() == entryPlace_ && window_.bytes().empty())) return;
  if (incompletePlace_ != entryPlace_) report_.addProblem("incomplete last entry", entryPlace_);
  incompletePlace_ = entryPlace_;
  window_.rewind(entryPlace_);
}

std::span<const FieldToken> ExportEntryStream::tokens() {
  // We make the tokens here and not in next(): the merge may hold an entry for a long time, and
  // tokens become void when the tokenizer starts a new generation.
  resources_.tokens.clear();
  for (const KeptField& field : keptFields_) {
    const std::string_view head = std::string_view(kept_).substr(field.offset, field.length);
    const FieldToken token = tokenizer_.tokenFor(head.substr(0, field.nameLength),
                                                 head.substr(field.nameLength + 1), field.size);
    if (token != kNoToken) resources_.tokens.push_back(token);
  }
  return resources_.tokens;
}

namespace {

// journalctl prints a million entries in some eight seconds of processor time and 300 MB of memory.
// A child that needs much more is busy with damage.
constexpr rlim_t kProcessorSeconds = 120;
constexpr rlim_t kMemory = rlim_t{1} << 30;

void limit(pid_t child, __rlimit_resource resource, rlim_t value) {
  const rlimit both{value, value};
  ::prlimit(child, resource, &both, nullptr);
}

// Waits for `child`. Returns whether it exited with status 0.
bool endedWell(pid_t child) {
  int status = 0;
  while (::waitpid(child, &status, 0) < 0)
    if (errno != EINTR) return false;
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// journalctl takes a pattern for a path, so a file named "[a].journal" would be another one.
std::string asPattern(std::string_view path) {
  std::string pattern;
  for (const char c : path) {
    if (std::string_view("*?[\\").find(c) != std::string_view::npos) pattern += '\\';
    pattern += c;
  }
  return pattern;
}

// Starts journalctl with `output` as its standard output; 0 if it cannot be started. A spawn
// instead of a fork, because other threads may hold locks that a forked child would wait for.
pid_t startJournalctl(const std::string& path, int output) {
  std::string file = "--file=" + asPattern(path);
  std::array<std::string, 5> words = {"journalctl", "--output=export", "--all", "--quiet", file};
  std::array<char*, 6> arguments{};
  for (size_t i = 0; i < words.size(); ++i) arguments[i] = words[i].data();
  posix_spawn_file_actions_t actions;
  ::posix_spawn_file_actions_init(&actions);
  ::posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  ::posix_spawn_file_actions_adddup2(&actions, output, STDOUT_FILENO);
  ::posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
  pid_t child = 0;
  const int error =
      ::posix_spawnp(&child, words[0].c_str(), &actions, nullptr, arguments.data(), environ);
  ::posix_spawn_file_actions_destroy(&actions);
  return error == 0 ? child : 0;
}

}  // namespace

std::unique_ptr<ForeignJournalStream> ForeignJournalStream::start(
    const std::string& path, uint64_t entryCount, ExportReadResources& resources,
    FieldTokenizer& tokenizer, const StopFlag& stop, FileReport& report) {
  // Close-on-exec: if a later child inherited our end, this child would never learn that we stopped
  // reading, and would wait forever to write.
  std::array<int, 2> ends{};
  if (::pipe2(ends.data(), O_CLOEXEC) != 0) return nullptr;
  UniqueFd input(ends[0]);
  const UniqueFd output(ends[1]);
  const pid_t child = startJournalctl(path, output.get());
  if (child == 0) return nullptr;
  // A spawn cannot set limits before the child runs, so we set them now. The child cannot have read
  // much yet.
  limit(child, RLIMIT_CPU, kProcessorSeconds);
  limit(child, RLIMIT_AS, kMemory);
  return std::unique_ptr<ForeignJournalStream>(new ForeignJournalStream(
      child, input.release(), entryCount, resources, tokenizer, stop, report));
}

ForeignJournalStream::~ForeignJournalStream() {
  if (child_ == 0) return;
  // The child may be busy with damage for minutes, and it has nothing to save. So we kill it.
  ::kill(child_, SIGKILL);
  endedWell(child_);
}

bool ForeignJournalStream::next() {
  if (entries_.next()) {
    // A damaged header may count fewer entries than there are; the difference must not wrap.
    missing_ -= missing_ != 0;
    return true;
  }
  // After a stop the child is still busy, and waiting for it would delay the stop.
  if (child_ == 0 || stop_.load(std::memory_order_relaxed)) return false;
  if (!endedWell(std::exchange(child_, 0))) report_.addProblem("journalctl failed", 0);
  // If journalctl does not know the layout either, it prints nothing and still exits with 0. The
  // header's count then tells what was not read.
  if (missing_ != 0) report_.addProblem("entries that journalctl did not read", 0, missing_);
  return false;
}

}  // namespace tessel
