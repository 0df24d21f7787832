// The look of the report page and how it behaves: light and dark, wide and narrow, screen and
// paper.
//
// Colours are named after verdicts, so the page needs no table from verdicts to colours. Bars set
// `fill` and the keys of a legend set `background`, so each rule sets both. Style and script stand
// in the page itself, because the page may load nothing.

#pragma once

#include <algorithm>
#include <cstddef>
#include <iterator>
#include <string_view>

#include "objects/TesselReporterClassification.h"

namespace tessel::ctl {

// The browser applies only the style and the script with these hashes. Whoever changes one of the
// two takes its new hash from the failing test of the page.
inline constexpr char kReportPolicy[] =
    "default-src 'none'; base-uri 'none'; form-action 'none'; "
    "style-src 'sha256-28VYbHUPnkwbVGPKgHELCl7Ie309OGc1KxTMkbelUio='; "
    "script-src 'sha256-m2u+VN63Q+5MEGW73E/aZIPNV0AM5ftH+Aw+mNX2tdE='";

// In each of the three palettes text has a contrast of 4.5:1 to what is behind it. Colours of
// verdicts have 3:1 to the card that they stand on, and to the next one in the order of verdicts.
inline constexpr char kReportStyle[] = R"css(
:root {
  color-scheme: light dark;
  --page: #f6f7f9; --card: #ffffff; --ink: #1c2430; --soft: #566170; --line: #dfe3e8; --edge: #7d8794;
  --good: #0b6e4f; --bad: #b3380b; --focus: #1f5fae; --code: #eef1f5;
  --reported: #055039; --telemetry_disabled: #8e949c; --string_whitelist: #7a2a0a;
  --duration: #ca7aa0; --downsampled: #1d3f8f; --class_not_supported: #bb8a00;
}
@media (prefers-color-scheme: dark) {
  :root {
    --page: #12161c; --card: #1b2129; --ink: #e6eaf0; --soft: #a3aebb; --line: #2e3742; --edge: #7c8896;
    --good: #6fe3b5; --bad: #ffb38a; --focus: #8cc0ff; --code: #262e38;
    --reported: #6fe3b5; --telemetry_disabled: #64707c; --string_whitelist: #ffbf9c;
    --duration: #9d5690; --downsampled: #a9d0ff; --class_not_supported: #866a0f;
  }
}
@media print {
  :root {
    color-scheme: light;
    --page: #ffffff; --card: #ffffff; --ink: #000000; --soft: #444444; --line: #bbbbbb; --edge: #777777;
    --good: #0b6e4f; --bad: #b3380b; --focus: #1f5fae; --code: #ffffff;
    --reported: #055039; --telemetry_disabled: #8e949c; --string_whitelist: #7a2a0a;
    --duration: #ca7aa0; --downsampled: #1d3f8f; --class_not_supported: #bb8a00;
  }
}
* { box-sizing: border-box; }
body {
  margin: 0; padding: 2rem 1rem 3rem; background: var(--page); color: var(--ink);
  font: 16px/1.5 system-ui, -apple-system, "Segoe UI", "DejaVu Sans", sans-serif;
}
main, header, footer { max-width: 64rem; margin: 0 auto; }
header { margin-bottom: 1.5rem; }
h1 { font-size: 1.7rem; line-height: 1.2; margin: 0 0 .3rem; letter-spacing: -.01em; overflow-wrap: anywhere; }
h2 { font-size: 1.1rem; margin: 0 0 .2rem; }
h3 { font-size: 1rem; margin: .5rem 0 .2rem; }
p { margin: .2rem 0 .8rem; overflow-wrap: anywhere; }
.soft, header p, footer, caption { color: var(--soft); }
section {
  background: var(--card); border: 1px solid var(--line); border-radius: 12px;
  padding: 1.1rem 1.25rem 1.25rem; margin: 0 0 1rem;
}
.tiles { display: grid; grid-template-columns: repeat(auto-fit, minmax(9.5rem, 1fr)); gap: 1rem; margin: 0 0 1rem; }
.tile { background: var(--card); border: 1px solid var(--line); border-radius: 12px; padding: .9rem 1.1rem; }
.tile b { display: block; font-size: 1.75rem; line-height: 1.2; font-weight: 650; font-variant-numeric: tabular-nums; }
.tile.main b { color: var(--good); }
table { width: 100%; border-collapse: collapse; font-variant-numeric: tabular-nums; }
table + table { margin-top: 1.2rem; }
caption { text-align: left; font-size: .88rem; padding-bottom: .3rem; }
.scroll { overflow-x: auto; }
th, td { padding: .38rem .9rem .38rem 0; border-bottom: 1px solid var(--line); vertical-align: top; text-align: left; }
thead th { font-weight: 600; font-size: .82rem; color: var(--soft); vertical-align: bottom; }
tbody th { font-weight: 400; min-width: 12rem; }
tbody tr:last-child > * { border-bottom: 0; }
th.n, td.n { text-align: right; white-space: nowrap; }
th:last-child, td:last-child { padding-right: 0; }
tbody th, td:not(.n) { overflow-wrap: anywhere; contain: paint; }
td.bar, th.chart { width: 32%; min-width: 6rem; }
.scroll td.bar, .scroll th.chart { width: 24%; }
.share { white-space: nowrap; }
bdi { white-space: pre-wrap; }
bdi[title] { text-decoration: underline dotted var(--edge); text-underline-offset: .2em; }
code { font: .92em ui-monospace, "DejaVu Sans Mono", monospace; }
th code, #findings code { background: var(--code); border-radius: 4px; padding: .1em .3em; box-decoration-break: clone; -webkit-box-decoration-break: clone; }
.key { display: inline-block; width: .75em; height: .75em; border-radius: 3px; margin-right: .55em; forced-color-adjust: none; }
svg { display: block; width: 100%; }
svg.page { height: 22px; margin: .6rem 0 .9rem; }
svg.row { height: 12px; margin: .35rem 0; }
.chart { display: grid; grid-template-columns: auto 1fr; column-gap: .6rem; margin-top: .6rem; }
th.chart { display: table-cell; }
.chart svg { height: 190px; }
.ticks { display: flex; flex-direction: column; justify-content: space-between; text-align: right; }
.ticks, .times { font-size: .78rem; color: var(--soft); font-variant-numeric: tabular-nums; line-height: 1; }
.times { grid-column: 2; display: flex; justify-content: space-between; padding-top: .5rem; }
.grid { stroke: var(--line); stroke-width: 1; vector-effect: non-scaling-stroke; }
.legend { display: flex; flex-wrap: wrap; gap: .25rem 1.2rem; margin: .5rem 0 .8rem; padding: 0; list-style: none; font-size: .88rem; }
.reported { fill: var(--reported); background: var(--reported); }
.telemetry_disabled { fill: var(--telemetry_disabled); background: var(--telemetry_disabled); }
.string_whitelist { fill: var(--string_whitelist); background: var(--string_whitelist); }
.duration { fill: var(--duration); background: var(--duration); }
.downsampled { fill: var(--downsampled); background: var(--downsampled); }
.class_not_supported { fill: var(--class_not_supported); background: var(--class_not_supported); }
svg.spread { fill: var(--focus); height: 1.6em; margin: 0; }
#findings li { margin-bottom: .5rem; overflow-wrap: anywhere; }
#findings ul { margin: .2rem 0 .6rem; padding-left: 1.2rem; }
details { margin-top: .9rem; }
td details { margin: 0; }
td summary { font-size: 1em; }
td ul { margin: .2rem 0; padding-left: 1.2rem; }
summary { cursor: pointer; color: var(--focus); font-size: .92rem; width: fit-content; }
th button { all: unset; cursor: pointer; }
th button::after { content: "\2195"; content: "\2195" / ""; padding-left: .3em; color: var(--edge); }
th[aria-sort=ascending] button::after { content: "\2191"; content: "\2191" / ""; color: var(--ink); }
th[aria-sort=descending] button::after { content: "\2193"; content: "\2193" / ""; color: var(--ink); }
.filter { display: flex; flex-wrap: wrap; align-items: center; gap: .3rem .6rem; margin: .6rem 0; font-size: .92rem; }
.filter input {
  font: inherit; color: var(--ink); background: var(--card); border: 1px solid var(--edge);
  border-radius: 8px; padding: .3rem .6rem; min-width: 0; width: 18rem;
}
td summary:focus-visible { outline-offset: -2px; }
:focus-visible, th button:focus-visible { outline: 2px solid var(--focus); outline-offset: 2px; border-radius: 4px; }
.good { color: var(--good); font-weight: 600; }
.bad { color: var(--bad); font-weight: 600; }
footer { font-size: .85rem; padding: .5rem 0; overflow-wrap: anywhere; }
@media (max-width: 34rem) {
  body { padding: 1.1rem .7rem 2rem; font-size: 15px; }
  section { padding: .9rem .9rem 1rem; }
  .tiles { grid-template-columns: 1fr 1fr; gap: .7rem; }
  .tile { padding: .8rem .8rem; }
  .tile b { font-size: 1.4rem; }
  table { font-size: .92em; }
  th, td { padding-right: .45rem; }
  thead th { font-size: .72rem; }
  th button::after { padding-left: .1em; }
  tbody th { width: 46%; min-width: 6rem; }
  .scroll tbody th { min-width: 8rem; }
  td.bar, th.chart { width: 18%; min-width: 3rem; }
}
@media print {
  * { print-color-adjust: exact; -webkit-print-color-adjust: exact; }
  body { padding: 0; font-size: 10pt; }
  section, .tile { border-radius: 0; }
  tr, .chart { break-inside: avoid; }
  details:not([open]), .filter { display: none; }
}
)css";

// The controls are made here and not in the page. So where scripts are off, the page shows none
// that do nothing. Sorting compares the number of a cell if it has one, and else its text. The
// filter looks at whole names, also where only a title has the whole.
inline constexpr char kReportScript[] = R"js(
'use strict';
for (const table of document.querySelectorAll('table.search')) {
  const body = table.tBodies[0];
  const rows = [...body.rows];
  if (rows.length < 2) continue;
  const heads = [...table.tHead.rows[0].cells];
  const number = (row, at) => {
    const data = row.cells[at].querySelector(':scope > data');
    return data ? Number(data.value) : null;
  };
  const names = new Intl.Collator(undefined, {numeric: true});
  const sort = (at) => {
    const numbers = number(rows[0], at) !== null;
    const now = heads[at].getAttribute('aria-sort');
    const down = now ? now === 'ascending' : numbers;
    for (const head of heads) head.removeAttribute('aria-sort');
    heads[at].setAttribute('aria-sort', down ? 'descending' : 'ascending');
    const keys = new Map(rows.map((row) => [row, numbers ? number(row, at) : row.cells[at].textContent]));
    const compare = numbers ? (a, b) => keys.get(a) - keys.get(b) : (a, b) => names.compare(keys.get(a), keys.get(b));
    rows.sort((a, b) => down ? compare(b, a) : compare(a, b));
    body.append(...rows);
  };
  heads.forEach((head, at) => {
    if (head.classList.contains('chart')) return;
    const button = document.createElement('button');
    button.type = 'button';
    button.append(...head.childNodes);
    button.addEventListener('click', () => sort(at));
    head.append(button);
  });

  if (rows.length < 8) continue;
  const filter = document.createElement('div');
  filter.className = 'filter';
  const label = document.createElement('label');
  const input = document.createElement('input');
  input.type = 'search';
  const found = document.createElement('output');
  label.append('Filter ', input);
  filter.append(label, found);
  table.before(filter);
  let texts;
  input.addEventListener('input', () => {
    texts ??= new Map(rows.map((row) => {
      const titles = [...row.querySelectorAll('bdi[title]')].map((name) => name.title);
      return [row, [row.textContent, ...titles].join(' ').toLowerCase()];
    }));
    const words = input.value.toLowerCase().split(/\s+/);
    let shown = 0;
    for (const row of rows) {
      row.hidden = !words.every((word) => texts.get(row).includes(word));
      if (!row.hidden) ++shown;
    }
    found.value = input.value.trim() ? shown.toLocaleString('en') + ' of ' + rows.length.toLocaleString('en') : '';
  });
}
)js";

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
