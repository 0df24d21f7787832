// record: writes trace points to the journal, or to an export file for trying things out.
//
// The journal accepts any point. A mistake would show a day later, as a number in the books of a
// run. So we refuse each point that a reader would count as malformed, and say why.

#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <csignal>
#include <memory>

#include "journal/EntryRecording.h"
#include "journal/EntryStream.h"
#include "os/Files.h"
#include "tesselctl/commands/Command.h"
#include "tesselctl/commands/RecordLines.h"
#include "tesselctl/commands/RecordedPoint.h"
#include "trace/TracePointFields.h"

extern char** environ;

namespace tessel::ctl {

namespace {

constexpr const char* kDescription =
    "Record an event, the begin or end of an interval, or one around a command";

std::string recordNotes() {
  return helpText(
             "A begin and its end match on subsystem, category, name and --id, and in process "
             "scope on the process. 'record begin' and 'record end' are two processes, so their "
             "scope is 'system' unless --scope says otherwise.") +
         helpText(
             "The process that records is tesselctl itself, around a command too: reports name "
             "it, not the command.") +
         helpText(
             "Each line of --stdin is an object with the keys kind (without it: event), "
             "subsystem, category, name, telemetry, string1, string2, number1, number2, id, "
             "scope, duration, frame_rate, attributes, fields and message. A line that cannot "
             "be recorded is named by its number, and the next one is read.") +
         helpText(
             "Exit status: 0 recorded, 2 the point makes no sense, 4 it could not be handed to "
             "the journal or written. 'record -- COMMAND' exits with the status of the command, "
             "128 and the number of the signal that killed it, 127 where it is not found, 126 "
             "where it cannot be run.") +
         helpEnvironment({"TESSEL_TRACE", "TESSEL_TRACE_WAIT", "TESSEL_JOURNAL_SOCKET"}) +
         "Examples:\n"
         "  tesselctl record event com.vantor.Calendar View Open --telemetry \\\n"
         "    --string1 period=week\n"
         "  tesselctl record begin com.vantor.Render Frame Draw --id 7\n"
         "  tesselctl record end   com.vantor.Render Frame Draw --id 7 --frame-rate 59.9\n"
         "  tesselctl record --subsystem com.vantor.Backup --category Job -- \\\n"
         "    rsync -a /home /mnt\n"
         "  echo '{\"subsystem\": \"com.vantor.Calendar\", \"category\": \"View\",\n"
         "    \"telemetry\": true, \"string1\": {\"period\": \"week\"}}' | tr -d '\\n' |\n"
         "    tesselctl record --stdin";
}

// The journal daemon notes who wrote an entry and when. With --store there is no daemon, so these
// options give the facts. Without them the writer is this process and the time is now.
struct OriginOptions {
  std::optional<uint64_t> at, monotonic;
  std::optional<double> ago;
  std::optional<std::string> imagePath, processName, process, boot;
};

struct RecordOptions {
  RecordedPoint point;
  bool lines = false;  // --stdin
  OriginOptions origin;
  std::optional<std::string> store;
};

// The monotonic time at `realtime`. Intervals are measured with it, so it must move along with the
// time of day. Absent where `realtime` is before the boot.
std::optional<uint64_t> movedMonotonic(const RecordOrigin& now, uint64_t realtime) {
  const auto distance = static_cast<int64_t>(realtime - now.realtime);
  if (distance < 0 && now.monotonic < static_cast<uint64_t>(-distance)) return std::nullopt;
  return now.monotonic + static_cast<uint64_t>(distance);
}

// Checked before the file is opened: a store must not grow by an entry whose times contradict each
// other.
std::variant<RecordOrigin, Failure> originOf(const OriginOptions& options) {
  const RecordOrigin now = currentOrigin();
  RecordOrigin origin = now;
  if (options.at) origin.realtime = *options.at;
  if (options.ago) origin.realtime -= static_cast<uint64_t>(*options.ago * 1e6);
  if (options.boot) {
    const auto boot = parseId128(*options.boot);
    if (!boot)
      return Failure{kUsage,
                     "--boot: '" + *options.boot + "' is no boot id: 32 hexadecimal digits"};
    origin.boot = *boot;
  }
  // Nobody knows when a made-up boot began. We let it begin in 1970: distances within it are right,
  // and only distances matter.
  const std::optional<uint64_t> monotonic = options.monotonic ? options.monotonic
                                            : options.boot    ? std::optional(origin.realtime)
                                                           : movedMonotonic(now, origin.realtime);
  if (!monotonic) {
    return Failure{kUsage,
                   "the time is before this machine's boot: give --boot with 32 hexadecimal "
                   "digits, or --monotonic"};
  }
  origin.monotonic = *monotonic;
  if (options.imagePath) origin.imagePath = options.imagePath;
  if (options.processName) origin.processName = options.processName;
  if (options.process) origin.process = options.process;
  // An empty value stands for a field that the daemon could not find out and left away.
  for (auto* text : {&origin.imagePath, &origin.processName, &origin.process}) {
    if (*text && (*text)->empty()) text->reset();
  }
  return origin;
}

// Absent where the point was recorded, or recording is off.
std::optional<Failure> record(const RecordOptions& options, const RecordedPoint& point) {
  if (!recordingEnabled()) return std::nullopt;
  auto fields = fieldsOf(point);
  if (auto* complaint = std::get_if<std::string>(&fields)) return Failure{kUsage, *complaint};
  const auto& list = std::get<std::vector<RecordedField>>(fields);
  std::optional<PlatformError> error;
  if (options.store) {
    auto origin = originOf(options.origin);
    if (auto* failure = std::get_if<Failure>(&origin)) return *failure;
    // The facts that a daemon would have noted go into the same entry, so a reader sees no
    // difference.
    error = appendToExportFile(*options.store, std::get<RecordOrigin>(origin), list);
  } else {
    error = sendToJournal(list);
    // A container has no journal socket more often than a machine has a broken one.
    if (error && error->code == ErrorCode::notFound) {
      error->words += " (--store DIR records without a journal)";
    }
  }
  // Every error has this status: scripts need only know that the point was not recorded.
  if (error) return Failure{kNoAccess, error->words};
  return std::nullopt;
}

// As in a shell: the status of the command, or 128 plus the number of the signal that ended it.
int exitStatusOf(int waitStatus) {
  return WIFEXITED(waitStatus) ? WEXITSTATUS(waitStatus) : 128 + WTERMSIG(waitStatus);
}

// Runs the command and returns its exit status. A key such as Ctrl-C sends its signal to the
// command and to us. We ignore it: if we died, nobody would record the end of the interval. The
// command would inherit the ignored signals, SIGXFSZ among them, so it gets the defaults back.
int runCommand(const std::vector<std::string>& command) {
  std::vector<char*> arguments;
  arguments.reserve(command.size() + 1);
  for (const std::string& argument : command)
    arguments.push_back(const_cast<char*>(argument.c_str()));
  arguments.push_back(nullptr);
  sigset_t defaults;
  sigemptyset(&defaults);
  sigaddset(&defaults, SIGINT);
  sigaddset(&defaults, SIGQUIT);
  sigaddset(&defaults, SIGXFSZ);
  posix_spawnattr_t attributes;
  // posix_spawn() and not fork(): it tells whether the command could be run at all, which a child
  // of fork() could only tell by an exit status that the command may have, too.
  posix_spawnattr_init(&attributes);
  posix_spawnattr_setsigdefault(&attributes, &defaults);
  posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGDEF);
  std::signal(SIGINT, SIG_IGN);
  std::signal(SIGQUIT, SIG_IGN);
  pid_t child = 0;
  const int error =
      ::posix_spawnp(&child, arguments[0], nullptr, &attributes, arguments.data(), environ);
  posix_spawnattr_destroy(&attributes);
  if (error != 0) {
    fail(kBad, fileError(command[0], error).words);
    // The statuses that a shell uses: not found, and found but not to be run.
    return error == ENOENT ? 127 : 126;
  }
  int status = 0;
  while (::waitpid(child, &status, 0) < 0 && errno == EINTR) {
  }
  return exitStatusOf(status);
}

int recordAround(const RecordOptions& options, const std::vector<std::string>& command) {
  RecordedPoint point = options.point;
  point.kind = "begin";
  if (const auto failure = record(options, point)) {
    fail(failure->status, failure->message);
    // Nobody's backup waits for our journal. Where the begin is lost, so is the end: alone it would
    // pair with nothing.
    if (failure->status != kNoAccess || options.store) return failure->status;
    countAsLost();
    return runCommand(command);
  }
  const int status = runCommand(command);
  // The command has done its work. A script wants its status, even if we could not record the end.
  point.kind = "end";
  if (const auto failure = record(options, point)) fail(failure->status, failure->message);
  return status;
}

int recordPoint(const RecordOptions& options, const std::string& kind) {
  RecordedPoint point = options.point;
  point.kind = kind;
  // `record begin` and `record end` are two processes. In process scope they would never match.
  if (kind != "event" && !point.scope) point.scope = "system";
  const auto failure = record(options, point);
  return failure ? fail(failure->status, failure->message) : kDone;
}

void addPointOptions(CLI::App& app, RecordedPoint& point) {
  app.add_flag("--telemetry", point.telemetry,
               "Mark it for telemetry; what is not marked is never reported");
  addSlotOptions(app, "--string", point.strings, "Labelled string");
  addSlotOptions(app, "--number", point.numbers, "Labelled number, decimal");
  app.add_option("--duration", point.duration, "Duration to state in place of the measured one")
      ->type_name("SECONDS");
  app.add_option("--frame-rate", point.frameRate,
                 "Frames per second; makes it an animation interval")
      ->type_name("RATE");
  app.add_option("--id", point.id, "Which begin an end belongs to, where several are open")
      ->type_name("ID");
  takesOneOf(app.add_option("--scope", point.scope, "Whether begin and end come from one process"),
             {std::begin(kScopeWords), std::end(kScopeWords)})
      ->type_name("SCOPE");
  app.add_option("--attribute", point.attributes, "Attribute of an interval; may be repeated")
      ->type_name("KEY=VALUE")
      ->allow_extra_args(false);
  app.add_option("--field", point.fields, "Any other journal field; may be repeated")
      ->type_name("NAME=VALUE")
      ->allow_extra_args(false);
  app.add_option("--message", point.message,
                 "Text of the journal entry; without one 'journalctl' does not show the entry")
      ->type_name("TEXT");
}

// The last microsecond of the year 9999, the last one that four digits can show.
constexpr uint64_t kLatest = 253'402'300'799'999'999;

// Before 1970 no entry has a time, and every machine is younger than this many seconds.
std::string whyNotAgo(const std::string& text) {
  constexpr double kMost = 1e9;
  double seconds = -1;
  const char* end = text.data() + text.size();
  const auto [stop, error] = std::from_chars(text.data(), end, seconds, std::chars_format::fixed);
  if (error == std::errc() && stop == end && seconds >= 0 && seconds <= kMost) return {};
  return "'" + text + "' is no number of seconds from 0 to 1000000000";
}

std::string whyNoProcess(const std::string& text) {
  // Ten digits hold each 32-bit number. The journal keeps the text as it is, so more would be read
  // as no number a day later.
  if (text.size() <= 10 && text.find_first_not_of("0123456789") == std::string::npos) return {};
  return "'" + text + "' is no id of a process: digits, or nothing";
}

void addStoreOptions(CLI::App& app, RecordOptions& options) {
  const std::string group = "With --store, in place of what is true";
  OriginOptions& origin = options.origin;
  auto* store =
      suggestsFiles(
          app.add_option(
              "--store", options.store,
              "Append to an .export file in this directory, which must exist, instead of the "
              "journal; for machines without a journal, and for trying things out"))
          ->type_name("DIR");
  // To the journal, the daemon itself gives these facts, and nobody can replace them.
  const auto add = [&](const char* name, auto& value, const char* type, const char* help) {
    return app.add_option(name, value, help)->type_name(type)->group(group)->needs(store);
  };
  auto* at = add("--at", origin.at, "MICROSECONDS", "Time of the entry, since 1970");
  takesWhole(at, 0, kLatest, "microseconds");
  add("--ago", origin.ago, "SECONDS", "Time of the entry, before now; before boot with --boot")
      ->excludes(at)
      ->check(whyNotAgo);
  takesWhole(add("--monotonic", origin.monotonic, "MICROSECONDS", "Time of the entry, since boot"),
             0, kLatest, "microseconds");
  add("--boot", origin.boot, "ID", "Boot, 32 hexadecimal digits");
  add("--exe", origin.imagePath, "PATH", "Executable of the writer; empty: not known");
  add("--comm", origin.processName, "NAME", "Name of the writing process; empty: not known");
  add("--pid", origin.process, "PID", "Id of the writing process; empty: not known")
      ->check(whyNoProcess);
}

void addKind(CLI::App& app, Invocation& invocation, RecordOptions& options, const std::string& kind,
             const std::string& description) {
  CLI::App* command = app.add_subcommand(kind, description);
  // Options may stand before the kind and behind the name, since both orders are typed.
  command->fallthrough();
  command->footer("The options are those of 'tesselctl record'.");
  command
      ->add_option("subsystem", options.point.subsystem, "Subsystem, such as com.vantor.Calendar")
      ->required();
  command->add_option("category", options.point.category, "Category within the subsystem")
      ->required();
  command->add_option("name", options.point.name, "Name of the trace point");
  command->callback([&invocation, &options, kind] {
    const char* other = invocation.command ? "a command after '--'" : "--stdin";
    invocation.status = invocation.command || options.lines
                            ? fail(kUsage, "either '" + kind + "' or " + other + ", not both")
                            : recordPoint(options, kind);
  });
}

int recordCommandLine(const CLI::App& app, const Invocation& invocation,
                      const RecordOptions& options) {
  if (options.lines) {
    if (invocation.command) return fail(kUsage, "either --stdin or a command after '--', not both");
    return recordLines(STDIN_FILENO, options.point,
                       [&](const RecordedPoint& point) { return record(options, point); });
  }
  if (!invocation.command || invocation.command->empty()) {
    return fail(kUsage,
                "record needs event, begin or end, --stdin, or a command after '--'; see --help");
  }
  if (app.count("--subsystem") == 0 || app.count("--category") == 0) {
    return fail(kUsage, "record around a command needs --subsystem and --category");
  }
  return recordAround(options, *invocation.command);
}

}  // namespace

void addRecordCommand(CLI::App& app, Invocation& invocation) {
  auto options = std::make_shared<RecordOptions>();
  CLI::App* record = app.add_subcommand("record", kDescription);
  record->footer(recordNotes());
  record->require_subcommand(0, 1);
  addKind(*record, invocation, *options, "event", "One moment");
  addKind(*record, invocation, *options, "begin", "An interval begins");
  addKind(*record, invocation, *options, "end", "An interval ends");
  record->add_flag("--stdin", options->lines,
                   "Record one point for each line of standard input, a JSON object");
  const std::string group = "Around a command, or where a line of --stdin has none";
  record->add_option("--subsystem", options->point.subsystem, "Subsystem")
      ->type_name("TEXT")
      ->group(group);
  record->add_option("--category", options->point.category, "Category")
      ->type_name("TEXT")
      ->group(group);
  record->add_option("--name", options->point.name, "Name")->type_name("TEXT")->group(group);
  addPointOptions(*record, options->point);
  addStoreOptions(*record, *options);
  record->final_callback([record, options, &invocation] {
    if (!record->get_subcommands().empty()) return;
    invocation.status = recordCommandLine(*record, invocation, *options);
  });
}

}  // namespace tessel::ctl
