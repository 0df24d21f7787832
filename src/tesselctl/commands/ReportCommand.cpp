// report: a page about what was recorded, reported and held back.
//
// The page is built in memory and written once the whole store was read. A store that cannot be
// read therefore leaves the page of yesterday as it is.

#include <unistd.h>

#include <array>

#include "linux/RunRecordFile.h"
#include "tesselctl/commands/Command.h"
#include "tesselctl/judging/ReporterStatus.h"
#include "tesselctl/showing/HtmlReport.h"
#include "tesselctl/showing/OutputFile.h"

namespace tessel::ctl {

namespace {

struct ReportOptions {
  ReadingOptions reading;
  std::string html;
  bool lastRun = false;
  bool withoutValues = false;
};

// POSIX does not say that a name which is cut off ends with a NUL. The array starts with zeros and
// lends one byte less than it has, so the name always ends. A page without a name is still of use,
// so a failure is no error.
std::string machineName() {
  std::array<char, 256> name{};
  return ::gethostname(name.data(), name.size() - 1) == 0 ? name.data() : "this machine";
}

int write(const std::string& path, const std::string& page) {
  if (path == "-") {
    print(page);
    return kDone;
  }
  const auto error = writeOutputFile(path, page);
  return error ? failToWrite(*error) : kDone;
}

int makeReport(const ReportOptions& options, const Reading& reading, const ReportFacts& facts) {
  Judge judge(reading.machine);
  Tally tally(reading.period);
  DryRun run(reading.store, [&](const TesselObject& object, const EntryHeader& entry) {
    tally.count(object, judge.inspect(object), entry);
    return true;
  });
  if (const auto error = readWithProgress(run, reading.period))
    return failToRead(*error, reading.store);
  // Some files of the store may have been refused. We write the page all the same and only then
  // warn: its figures are too low but true for the files that were read.
  const int status = write(options.html, htmlReport(tally, run.report(), facts));
  return status == kDone ? warnOfUnreadFiles(run.report().store, reading.store) : status;
}

int runReport(const ReportOptions& options, const Surroundings& surroundings) {
  checkZone();
  auto reading = readingOf(options.reading, surroundings);
  if (!reading) return kUsage;
  ReportFacts facts{machineName(),
                    reading->store == kStandardInput
                        ? std::string(kStandardInputName)
                        : reading->store.value_or("the journal of this machine"),
                    std::string(nameForPlatform(reading->machine.platform)),
                    reading->machine.internal,
                    surroundings.now,
                    {},
                    {},
                    {},
                    options.withoutValues};
  // A store that the command line names may be a copy from elsewhere. The state of this machine
  // then says nothing about it.
  if (!options.reading.store) {
    ReporterStatus status = gatherStatus(surroundings.launch, surroundings.now);
    facts.findings = std::move(status.findings);
    if (status.tasking.isOff()) facts.reportingIsOff = status.taskingWords;
  }
  if (options.lastRun) {
    if (options.reading.period.given()) return fail(kUsage, "--last-run has a period of its own");
    const std::string& directory = surroundings.launch.stateDirectory;
    facts.run = readRunRecord(directory);
    if (!facts.run) return fail(kBad, "no record of a run in " + directory);
    // A run looks back 24 hours from its start. The same period lets the reader compare the dry run
    // with the books of the run on one page.
    reading->period = {facts.run->start - std::chrono::hours{24}, facts.run->start};
  }
  return makeReport(options, *reading, facts);
}

CommandText reportText() {
  return {
      "report", "Make a page about what was recorded, reported and held back",
      helpText("One self-contained page. Its figures are those of 'tesselctl explain --summary "
               "--json' for the same period. A file is replaced in one step and keeps its "
               "permissions; a new one is yours alone. A link, a device or a pipe is written "
               "through.") +
          helpEnvironment({"TESSEL_TRACE_STORE", "TESSEL_STATE_DIR", "TESSEL_OS_RELEASE", "TZ"}) +
          "Example:\n"
          "  tesselctl report --last 7d --html week.html"};
}

}  // namespace

void addReportCommand(CLI::App& app, Invocation& invocation) {
  const auto [command, options] = addCommand(app, invocation, reportText(), runReport);
  suggestsFiles(command.add_option("--html", options.html, "File to write, - for standard output"))
      ->required()
      ->type_name("FILE");
  command.add_flag("--last-run", options.lastRun,
                   "The 24 hours that the last run looked back on, with its own books");
  command.add_flag("--without-values", options.withoutValues,
                   "Leave out recorded values, users, executables, paths and the machine's name");
  addPeriodOptions(command, options.reading);
  addJudgeOptions(command, options.reading);
}

}  // namespace tessel::ctl
