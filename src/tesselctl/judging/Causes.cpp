// Which finding follows from which.
//
// Somebody who reads two problems looks for two causes. So what follows from another finding names
// it, and the screen shows it below that one.

#include <algorithm>
#include <array>

#include "tesselctl/judging/ReporterStatus.h"

namespace tessel::ctl {

namespace {

bool found(const ReporterStatus& status, FindingCode code) {
  return std::any_of(status.findings.begin(), status.findings.end(),
                     [&](const Finding& each) { return each.code == code; });
}

// What may have caused what, most direct first. A cause counts only where it is found, too.
constexpr struct {
  FindingCode effect;
  std::array<FindingCode, 6> causes;  // filled up with noAccess, which causes nothing
} kCauses[] = {
    {FindingCode::forwarderStuck, {FindingCode::spoolDamaged}},
    {FindingCode::spoolFilling, {FindingCode::forwarderStuck}},
    {FindingCode::bailedOut, {FindingCode::markerStuck}},
    {FindingCode::rowsExpired, {FindingCode::forwarderStuck}},
    {FindingCode::noCompletedRun,
     {FindingCode::deferred, FindingCode::taskingUnreadable, FindingCode::runFailed,
      FindingCode::bailedOut, FindingCode::markerStuck, FindingCode::recordUnwritable}},
};

std::optional<FindingCode> causeOfRefusal(const ReporterStatus& status, const std::string& words) {
  if (words.ends_with("reason limit") && found(status, FindingCode::spoolFilling))
    return FindingCode::spoolFilling;
  if (words.ends_with("reason damaged") && found(status, FindingCode::spoolDamaged))
    return FindingCode::spoolDamaged;
  return {};
}

// The run says in words why it failed. The first two begin with words of service/ReportingRun.cpp,
// and the last is what the journal reader says of the same store now.
std::optional<FindingCode> causeOfFailure(const ReporterStatus& status) {
  const std::string& failure = status.run->failure;
  if (failure.starts_with("the run marker") && found(status, FindingCode::markerStuck))
    return FindingCode::markerStuck;
  if (failure.starts_with("the tasking configuration") &&
      found(status, FindingCode::taskingUnreadable))
    return FindingCode::taskingUnreadable;
  if (status.journal.failure && status.journal.failure->words == failure &&
      found(status, FindingCode::storeUnreadable))
    return FindingCode::storeUnreadable;
  return {};
}

}  // namespace

void nameCauses(ReporterStatus& status) {
  for (Finding& each : status.findings) {
    if (each.code == FindingCode::rowsRefused) each.because = causeOfRefusal(status, each.words);
    if (each.code == FindingCode::runFailed) each.because = causeOfFailure(status);
    for (const auto& row : kCauses) {
      if (row.effect != each.code) continue;
      const auto cause = std::find_if(row.causes.begin(), row.causes.end(), [&](FindingCode code) {
        return code != FindingCode::noAccess && found(status, code);
      });
      if (cause != row.causes.end()) each.because = *cause;
    }
  }
}

}  // namespace tessel::ctl
