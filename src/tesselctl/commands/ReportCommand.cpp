// report: a page about what was recorded, reported and held back.

#include <unistd.h>

#include <CLI/CLI.hpp>
#include <array>
#include <memory>

#include "linux/RunRecordFile.h"
#include "linux/SystemFacts.h"
#include "os/DurableFile.h"
#include "tesselctl/commands/ReadingOptions.h"
#include "tesselctl/showing/HtmlReport.h"
#include "tesselctl/showing/Terminal.h"

namespace tessel::ctl {

namespace {

struct ReportOptions {
  ReadingOptions reading;
  std::string html;
  bool lastRun = false;
};

std::string machineName() {
  std::array<char, 256> name{};
  return ::gethostname(name.data(), name.size() - 1) == 0 ? name.data() : "this machine";
}

int write(const std::string& path, const std::string& page) {
  constexpr unsigned kReadableByAll = 0644;
  if (path == "-") {
    print(page);
    return kDone;
  }
  const auto reason = replaceFileDurably(path, page, kReadableByAll);
  return reason ? failToWrite(*reason) : kDone;
}

int makeReport(const ReportOptions& options, const Reading& reading, ReportFacts facts) {
  Judge judge(reading.machine);
  Tally tally(reading.period);
  DryRun run(reading.store, [&](const TesselObject& object, const EntryHeader& entry) {
    tally.count(object, judge.inspect(object), entry);
    return true;
  });
  ProgressBar bar(true);
  const auto error =
      run.read(reading.period, [&](double part, uint64_t entries) { bar.update(part, entries); });
  bar.clear();
  if (error) return failToRead(error->words, reading.store);
  facts.store = reading.store.value_or("the journal of this machine");
  facts.platform = nameForPlatform(reading.machine.platform);
  facts.internal = reading.machine.internal;
  const int status = write(options.html, htmlReport(tally, run.report(), facts));
  return status == kDone ? warnOfUnreadFiles(run.report().store, reading.store, kDone) : status;
}

int runReport(const ReportOptions& options) {
  const auto launch = launchConfiguration();
  if (!launch) return kUsage;
  ReportFacts facts;
  facts.machine = machineName();
  facts.made = SystemClock().now();
  auto reading = readingOf(options.reading, *launch, facts.made);
  if (!reading) return kUsage;
  if (options.lastRun) {
    if (options.reading.period.given()) return fail(kUsage, "--last-run has a period of its own");
    facts.run = readRunRecord(launch->stateDirectory);
    if (!facts.run) return fail(kBad, "no record of a run in " + launch->stateDirectory);
    reading->period = {facts.run->start - std::chrono::hours{24}, facts.run->start};
  }
  return makeReport(options, *reading, std::move(facts));
}

}  // namespace

void addReportCommand(CLI::App& app, Invocation& invocation) {
  const auto options = std::make_shared<ReportOptions>();
  CLI::App* command =
      app.add_subcommand("report", "Make a page about what was recorded, reported and held back");
  command->add_option("--html", options->html, "File to write, - for standard output")
      ->required()
      ->type_name("FILE");
  command->add_flag("--last-run", options->lastRun,
                    "The 24 hours that the last run looked back on, with its own books");
  addPeriodOptions(*command, options->reading);
  addJudgeOptions(*command, options->reading);
  command->footer(
      "One self-contained page without scripts. Its figures are those of 'tesselctl explain "
      "--summary\n"
      "--json' for the same period.\n\n"
      "Example:\n"
      "  tesselctl report --last 7d --html week.html");
  command->callback([&invocation, options] { invocation.status = runReport(*options); });
}

}  // namespace tessel::ctl
