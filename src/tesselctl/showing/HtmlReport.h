// The report page: the figures of a dry run for people, in one self-contained HTML file.
//
// The page loads nothing from elsewhere and runs no script but its own, which only adds a filter
// and sorting to long lists. A policy in the page forbids everything else. Stateless.

#pragma once

#include <optional>
#include <string>
#include <vector>

#include "linux/Findings.h"
#include "objects/RunRecord.h"
#include "tesselctl/judging/Tally.h"
#include "trace/JournalExtractor.h"

namespace tessel::ctl {

struct ReportFacts {
  std::string machine;
  std::string store;
  std::string platform;
  bool internal = false;
  Date made{};
  std::optional<RunRecord> run;  // absent unless the page shows the period of a run
  // What is wrong with this machine. Absent if the store may be that of another machine.
  std::optional<std::vector<Finding>> findings;
  // Why this machine reports nothing, in words. Absent if it does report, or nobody knows.
  std::optional<std::string> reportingIsOff;
  // The page is to be passed on to people outside: it names neither the machine nor its users,
  // programs and files, and shows no recorded value.
  bool withoutValues = false;
};

std::string htmlReport(const Tally& tally, const ExtractionReport& report,
                       const ReportFacts& facts);

}  // namespace tessel::ctl
