#include "journal/ForeignJournalStream.h"

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <utility>

#include "os/UniqueFd.h"

namespace tessel {

namespace {

constexpr rlim_t kProcessorSeconds = 120;
constexpr rlim_t kMemory = rlim_t{1} << 30;

void limit(pid_t child, __rlimit_resource resource, rlim_t value) {
  const rlimit both{value, value};
  ::prlimit(child, resource, &both, nullptr);
}

// Waits for `child`; whether it ended well.
bool endedWell(pid_t child) {
  int status = 0;
  while (::waitpid(child, &status, 0) < 0)
    if (errno != EINTR) return false;
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// Starts journalctl with its output going to `output`; 0 where it cannot be started.
pid_t startJournalctl(const std::string& path, int output) {
  std::string file = "--file=" + path;
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
  std::array<int, 2> ends{};
  if (::pipe2(ends.data(), O_CLOEXEC) != 0) return nullptr;
  UniqueFd input(ends[0]);
  const UniqueFd output(ends[1]);
  const pid_t child = startJournalctl(path, output.get());
  if (child == 0) return nullptr;
  limit(child, RLIMIT_CPU, kProcessorSeconds);
  limit(child, RLIMIT_AS, kMemory);
  return std::unique_ptr<ForeignJournalStream>(new ForeignJournalStream(
      child, input.release(), entryCount, resources, tokenizer, stop, report));
}

ForeignJournalStream::~ForeignJournalStream() {
  if (child_ == 0) return;
  ::kill(child_, SIGKILL);
  endedWell(child_);
}

bool ForeignJournalStream::next() {
  if (entries_.next()) {
    missing_ -= missing_ != 0;
    return true;
  }
  if (child_ == 0 || stop_.load(std::memory_order_relaxed)) return false;
  if (!endedWell(std::exchange(child_, 0))) report_.addProblem("journalctl failed", 0);
  // For a layout that it does not know either, it ends well and prints nothing.
  if (missing_ != 0) report_.addProblem("entries that journalctl did not read", 0, missing_);
  return false;
}

}  // namespace tessel
