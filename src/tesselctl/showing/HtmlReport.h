// The report page: the figures of a dry run for people, in one self-contained HTML file.
//
// No script, nothing from elsewhere, and a policy in the page that forbids both. Stateless.

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
  std::optional<RunRecord> run;  // the run whose period this is, where it is one's
};

std::string htmlReport(const Tally& tally, const ExtractionReport& report,
                       const ReportFacts& facts);

}  // namespace tessel::ctl
