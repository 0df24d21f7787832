// The report page: the figures of a dry run for people, in one self-contained HTML file.
//
// The page has no script and loads nothing from elsewhere. A policy in the page forbids both.
// Stateless.

#pragma once

#include <optional>
#include <string>

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
};

std::string htmlReport(const Tally& tally, const ExtractionReport& report,
                       const ReportFacts& facts);

}  // namespace tessel::ctl
