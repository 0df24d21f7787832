// Drawing the bar.

#include "tesselctl/showing/Progress.h"

#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <string>

#include "tesselctl/showing/ShownText.h"

namespace tessel::ctl {

namespace {

constexpr std::chrono::seconds kPatience{1};
constexpr std::chrono::milliseconds kRedrawInterval{100};
constexpr size_t kBarWidth = 30;

}  // namespace

ProgressBar::ProgressBar(bool wanted)
    : wanted_(wanted),
      terminal_(terminalBehind(STDERR_FILENO)),
      nextLook_(std::chrono::steady_clock::now() + kPatience) {}

void ProgressBar::update(double part, uint64_t entries) {
  if (!wanted_ || !terminal_.interactive) return;
  const auto now = std::chrono::steady_clock::now();
  if (now < nextLook_) return;
  nextLook_ = now + kRedrawInterval;
  const double done = std::clamp(part, 0.0, 1.0);
  const auto filled = static_cast<size_t>(std::lround(done * static_cast<double>(kBarWidth)));
  std::string line = "\r[" + std::string(filled, '#') + std::string(kBarWidth - filled, '-') + "] ";
  line += std::to_string(std::lround(done * 100)) + " %  " + counted(entries, "entry", "entries");
  printError(cutOff(line, terminal_.width) + "\x1b[K");
  visible_ = true;
}

void ProgressBar::clear() {
  if (visible_) printError("\r\x1b[K");
  visible_ = false;
}

}  // namespace tessel::ctl
