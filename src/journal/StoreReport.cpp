#include "journal/StoreReport.h"

#include <algorithm>

namespace tessel {

void FileReport::addProblem(std::string_view reason, uint64_t place, uint64_t count) {
  const auto sameReason = [&](const FileProblem& known) { return known.reason == reason; };
  auto known = std::find_if(problems.begin(), problems.end(), sameReason);
  if (known == problems.end() && problems.size() >= kMaxProblems) {
    reason = "other";
    known = std::find_if(problems.begin(), problems.end(), sameReason);
  }
  if (known == problems.end()) {
    problems.push_back({std::string(reason), place, count});
  } else {
    known->count += count;
  }
}

}  // namespace tessel
