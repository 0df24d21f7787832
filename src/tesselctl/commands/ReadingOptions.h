// What every command that reads a trace store takes: the store, the period, the judge.

#pragma once

#include <memory>
#include <optional>
#include <string>

#include "tesselctl/commands/Environment.h"
#include "tesselctl/judging/Judge.h"
#include "tesselctl/reading/DryRun.h"
#include "tesselctl/reading/TimeArguments.h"

namespace tessel::ctl {

// As given on the command line.
struct ReadingOptions {
  std::optional<std::string> store;
  PeriodArguments period;
  std::optional<std::string> platform;
  bool internal = false;  // whatever the machine says
  bool external = false;  // the opposite
};

// Adds --store, --since, --until and --last.
void addPeriodOptions(CLI::App& command, ReadingOptions& options);
// Adds --platform, --internal and --no-internal.
void addJudgeOptions(CLI::App& command, ReadingOptions& options);

// What is meant by them, the environment standing in for what is not given.
struct Reading {
  std::optional<std::string> store;  // absent: the machine's own journal
  Period period;
  JudgedMachine machine;
};
// Nothing, after a line that names the argument and its value, where they make no sense.
std::optional<Reading> readingOf(const ReadingOptions& options, const LaunchConfiguration& launch,
                                 Date now);

std::optional<TesselReporterPlatform> platformNamed(const std::string& name);

// Says what a reader should know before trusting the figures: files that could not be read.
// The status that this makes of `status`.
int warnOfUnreadFiles(const StoreReport& report, const std::optional<std::string>& store,
                      int status);

}  // namespace tessel::ctl
