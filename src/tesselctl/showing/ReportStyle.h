// The look of the report page: light and dark, wide and narrow, screen and paper.
//
// Colours are named after verdicts, so the page needs no table from verdicts to colours. Bars set
// `fill` and the keys of a legend set `background`, so each rule sets both. The style stands in the
// page itself, because the page may load nothing.

#pragma once

#include <algorithm>
#include <cstddef>
#include <iterator>
#include <string_view>

#include "objects/TesselReporterClassification.h"

namespace tessel::ctl {

inline constexpr char kReportStyle[] = R"css(
:root {
  color-scheme: light dark;
  --page: #f6f7f9; --card: #ffffff; --ink: #1c2430; --soft: #5b6675; --line: #dfe3e8; --track: #eceff3;
  --reported: #12855f; --telemetry_disabled: #9aa3ad; --string_whitelist: #d2601a;
  --duration: #b0568f; --downsampled: #2a6fb8; --class_not_supported: #c99700;
}
@media (prefers-color-scheme: dark) {
  :root {
    --page: #12161c; --card: #1b2129; --ink: #e6eaf0; --soft: #9aa6b4; --line: #2e3742; --track: #262e38;
    --reported: #3fbf8f; --telemetry_disabled: #77828f; --string_whitelist: #f08a4b;
    --duration: #d88abb; --downsampled: #62a5e8; --class_not_supported: #e3bd4a;
  }
}
* { box-sizing: border-box; }
body {
  margin: 0; padding: 2rem 1rem 3rem; background: var(--page); color: var(--ink);
  font: 16px/1.5 system-ui, -apple-system, "Segoe UI", "DejaVu Sans", sans-serif;
}
main, header, footer { max-width: 64rem; margin: 0 auto; }
header { margin-bottom: 1.5rem; }
h1 { font-size: 1.7rem; line-height: 1.2; margin: 0 0 .3rem; letter-spacing: -.01em; }
h2 { font-size: 1.1rem; margin: 0 0 .2rem; }
p { margin: .2rem 0 .8rem; }
.soft, header p, footer { color: var(--soft); }
section {
  background: var(--card); border: 1px solid var(--line); border-radius: 12px;
  padding: 1.1rem 1.25rem 1.25rem; margin: 0 0 1rem; break-inside: avoid-page;
}
.tiles { display: grid; grid-template-columns: repeat(auto-fit, minmax(9.5rem, 1fr)); gap: 1rem; margin: 0 0 1rem; }
.tile { background: var(--card); border: 1px solid var(--line); border-radius: 12px; padding: .9rem 1.1rem; }
.tile b { display: block; font-size: 1.75rem; line-height: 1.2; font-weight: 650; font-variant-numeric: tabular-nums; }
.tile.main b { color: var(--reported); }
table { width: 100%; border-collapse: collapse; font-variant-numeric: tabular-nums; }
.scroll { overflow-x: auto; }
th { text-align: left; font-weight: 600; font-size: .82rem; color: var(--soft); }
th, td { padding: .38rem .9rem .38rem 0; border-bottom: 1px solid var(--line); vertical-align: top; }
tr:last-child td { border-bottom: 0; }
th.n, td.n { text-align: right; white-space: nowrap; }
th:last-child, td:last-child { padding-right: 0; }
td.name { overflow-wrap: anywhere; min-width: 9rem; }
td.bar { width: 34%; min-width: 7rem; vertical-align: middle; }
code { font: .92em ui-monospace, "DejaVu Sans Mono", monospace; overflow-wrap: anywhere; }
.key { display: inline-block; width: .75em; height: .75em; border-radius: 3px; margin-right: .55em; }
svg { display: block; width: 100%; overflow: visible; }
svg.share { height: 22px; margin: .6rem 0 .9rem; }
svg.pair { height: 12px; }
.chart { display: grid; grid-template-columns: auto 1fr; column-gap: .6rem; margin-top: .6rem; }
.chart svg { height: 190px; }
.ticks { display: flex; flex-direction: column; justify-content: space-between; text-align: right; }
.ticks, .times { font-size: .78rem; color: var(--soft); font-variant-numeric: tabular-nums; line-height: 1; }
.times { grid-column: 2; display: flex; justify-content: space-between; padding-top: .5rem; }
.grid { stroke: var(--line); stroke-width: 1; vector-effect: non-scaling-stroke; }
.legend { display: flex; flex-wrap: wrap; gap: .25rem 1.2rem; margin: .9rem 0 0; padding: 0; list-style: none; font-size: .88rem; }
.track { fill: var(--track); }
.reported { fill: var(--reported); background: var(--reported); }
.telemetry_disabled { fill: var(--telemetry_disabled); background: var(--telemetry_disabled); }
.string_whitelist { fill: var(--string_whitelist); background: var(--string_whitelist); }
.duration { fill: var(--duration); background: var(--duration); }
.downsampled { fill: var(--downsampled); background: var(--downsampled); }
.class_not_supported { fill: var(--class_not_supported); background: var(--class_not_supported); }
details { margin-top: .9rem; }
summary { cursor: pointer; color: var(--soft); font-size: .88rem; }
.good { color: var(--reported); font-weight: 600; }
.bad { color: var(--string_whitelist); font-weight: 600; }
footer { font-size: .85rem; padding: .5rem 0; }
@media (max-width: 34rem) {
  body { padding: 1.1rem .7rem 2rem; font-size: 15px; }
  section { padding: .9rem .9rem 1rem; }
  th, td { padding-right: .6rem; }
  .tiles { grid-template-columns: 1fr 1fr; gap: .7rem; }
  .tile b { font-size: 1.4rem; }
  .wide { display: none; }
  td.bar { width: 20%; min-width: 2.8rem; }
  td.name { min-width: 7rem; }
}
@media print {
  :root {
    color-scheme: light;
    --page: #fff; --card: #fff; --ink: #000; --soft: #444; --line: #bbb; --track: #eee;
    --reported: #12855f; --telemetry_disabled: #9aa3ad; --string_whitelist: #d2601a;
    --duration: #b0568f; --downsampled: #2a6fb8; --class_not_supported: #c99700;
  }
  * { print-color-adjust: exact; -webkit-print-color-adjust: exact; }
  body { padding: 0; font-size: 10pt; }
  section, .tile { border-radius: 0; }
  details:not([open]) { display: none; }
}
)css";

// Whether `text` stands in the style at `at`. By index and not by string_view::find(): GCC 12 does
// not take the pointers of that for constants where it instruments the code.
constexpr bool isInStyle(size_t at, std::string_view text) {
  for (const char wanted : text) {
    if (at == std::size(kReportStyle) || kReportStyle[at++] != wanted) return false;
  }
  return true;
}
// How often `text` stands in the style between `before` and `end`.
constexpr size_t timesInStyle(std::string_view before, std::string_view text,
                              std::string_view end) {
  size_t times = 0;
  for (size_t at = 0; at < std::size(kReportStyle); ++at) {
    // Compilers bound the steps of a constant expression, so most places must cost few.
    if (kReportStyle[at] != before[0]) continue;
    times += isInStyle(at, before) && isInStyle(at + before.size(), text) &&
             isInStyle(at + before.size() + text.size(), end);
  }
  return times;
}
// A verdict without a colour would be missing from each chart, and nobody would notice. So each
// verdict must have a colour in the light, the dark and the printed page, and one rule that uses
// it.
static_assert(std::ranges::all_of(kClassifications, [](const ClassificationRow& row) {
  return timesInStyle("--", row.name, ":") == 3 && timesInStyle("\n.", row.name, " {") == 1;
}));

}  // namespace tessel::ctl
