// Judging the facts of a status: which problems and notes there are.

#include <algorithm>

#include "tesselctl/judging/ReporterStatus.h"

namespace tessel::ctl {

void judge(ReporterStatus& status) {
  status.findings.clear();
  if (status.run) status.findings = findingsOf(*status.run);
  if (status.spoolState == SpoolReader::State::damaged) {
    status.findings.push_back(finding(FindingCode::spoolDamaged,
                                      "The spool is damaged: " + status.spoolFailure, status.now));
  }
  std::stable_sort(status.findings.begin(), status.findings.end(),
                   [](const Finding& a, const Finding& b) { return a.code < b.code; });
  status.checked.clear();
  for (size_t code = 0; code < kFindingCodes; ++code) {
    if (isProblem(static_cast<FindingCode>(code)))
      status.checked.push_back(static_cast<FindingCode>(code));
  }
}

}  // namespace tessel::ctl
