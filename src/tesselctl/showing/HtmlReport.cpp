// Writing the report page.
//
// Programs recorded the texts on the page, and a hostile program may record a script. Escaping
// keeps recorded text from becoming markup. The policy is the second line: should markup slip
// through one day, the browser runs nothing but our script, sends no form and loads nothing. The
// script makes long lists easy to search. Nothing depends on it, so the page is whole where scripts
// are off.

#include "tesselctl/showing/HtmlReport.h"

#include <algorithm>

#include "tesselctl/showing/HtmlCharts.h"
#include "tesselctl/showing/HtmlLists.h"
#include "tesselctl/showing/Losses.h"
#include "tesselctl/showing/ReportStyle.h"

namespace tessel::ctl {

namespace {

// What is wrong with the machine and what is worth knowing, in the order of the list. A finding
// that follows from another one says so: whoever removes the cause is done with both.
Html findingItem(const Finding& finding, const ReportFacts& facts) {
  Html html;
  html << "<li><code>" << findingName(finding.code) << "</code> ";
  // The words and the command may name a user, a program or a path.
  if (!facts.withoutValues) html << "<bdi>" << finding.words << "</bdi> ";
  html << "<span class=\"soft\">since " << dateText(finding.since) << "</span>";
  if (finding.because) {
    html << "<br>This follows from <code>" << findingName(*finding.because) << "</code>.</li>\n";
    return html;
  }
  if (!facts.withoutValues) {
    html << "<br>" << finding.advice;
    if (!finding.command.empty()) html << "<br><code>" << finding.command << "</code>";
  }
  return html << "</li>\n";
}

// The page is often looked at in place of `tesselctl status`, so it must not seem well where that
// command says otherwise. Both take the findings from one list.
Html findingSection(const ReportFacts& facts) {
  Html html;
  if (!facts.findings) return html;
  Html problems;
  Html notes;
  for (const Finding& finding : *facts.findings)
    (isProblem(finding.code) ? problems : notes) << findingItem(finding, facts);
  html << "<section id=\"findings\">\n<h2>This machine, when the page was made</h2>\n";
  // Without this line, "reported" on the page would be taken for what left the machine.
  if (facts.reportingIsOff) {
    html << "<p id=\"tasking\"><span class=\"bad\">Reporting is off.</span> ";
    if (!facts.withoutValues) html << "<bdi>" << *facts.reportingIsOff << "</bdi>. ";
    html << "&quot;Reported&quot; tells what a run would report if it were on.</p>\n";
  }
  if (problems.text().empty())
    html << "<p><span class=\"good\">No problem was found.</span></p>\n";
  else
    html << "<h3 class=\"bad\">Problems</h3>\n<ul class=\"problems\">\n" << problems << "</ul>\n";
  if (!notes.text().empty())
    html << "<h3>Worth knowing</h3>\n<ul class=\"notes\">\n" << notes << "</ul>\n";
  return html << "</section>\n";
}

// Paths are shown whole: people copy them. A path has at most 4,096 bytes.
constexpr size_t kWhole = 4096;

// Each tile has an id, and its count stands plain in an attribute. So a program can read the
// figures although people see them in groups of three digits.
Html tiles(const Tally& tally, const ExtractionReport& report) {
  const uint64_t objects = tally.traceObjects();
  const uint64_t reported = tally.verdicts()[TesselReporterClassificationTelemetryReported];
  Html html;
  html << "<div class=\"tiles\">\n<div class=\"tile\" id=\"log_events\"><b>" << report.entriesRead
       << "</b>log events read</div>\n<div class=\"tile\" id=\"trace_objects\"><b>" << objects
       << "</b>trace objects</div>\n<div class=\"tile main\" id=\"reported\"><b>" << reported
       << "</b>reported, <span class=\"share\">" << percent(reported, objects)
       << "</span></div>\n<div class=\"tile\" id=\"held_back\"><b>" << (objects - reported)
       << "</b>held back, <span class=\"share\">" << percent(objects - reported, objects)
       << "</span></div>\n</div>\n";
  return html;
}

Html verdictSection(const Tally& tally) {
  const VerdictCounts& counts = tally.verdicts();
  Html html;
  html << "<section>\n<h2>What became of them</h2>\n";
  if (tally.traceObjects() != 0) html << verdictBar(counts, BarSize::page) << "\n";
  html << tableHead(
      "verdicts", Html() << "Trace objects by verdict",
      {{"Verdict"}, {"Objects", Column::Kind::number}, {"Share", Column::Kind::number}});
  for (const auto verdict : kVerdictOrder) {
    html << "<tr id=\"verdict-" << verdictName(verdict) << "\"><th scope=\"row\"><span class=\"key "
         << verdictName(verdict) << "\"></span>" << verdictTitle(verdict) << "</th><td class=\"n\">"
         << counts[verdict] << "</td><td class=\"n\">"
         << percent(counts[verdict], tally.traceObjects()) << "</td></tr>\n";
  }
  return html << tableEnd() << "</section>\n";
}

Html timeSection(const Tally& tally) {
  Html html;
  return html << "<section>\n<h2>Over time</h2>\n<p class=\"soft\">Trace objects; a column is "
              << durationText(tally.sliceLength()) << "</p>\n"
              << timeChart(tally) << "</section>\n";
}

Html kindSection(const Tally& tally) {
  Html html;
  html << "<section>\n<h2>By kind</h2>\n"
       << tableHead("kinds", Html() << "Trace objects by kind",
                    {{"Kind"},
                     {"Reported", Column::Kind::number},
                     {"Not reported", Column::Kind::number}});
  for (size_t kind = 0; kind < Tally::kKinds.size(); ++kind) {
    html << "<tr><th scope=\"row\">" << Tally::kKinds[kind] << "</th><td class=\"n\">"
         << tally.kinds()[kind].reported << "</td><td class=\"n\">"
         << tally.kinds()[kind].unreported << "</td></tr>\n";
  }
  return html << tableEnd() << "</section>\n";
}

void addCount(Html& html, std::string_view what, uint64_t count) {
  html << "<tr><th scope=\"row\">" << what << "</th><td class=\"n\">" << count << "</td></tr>\n";
}

// These counts explain why there are fewer objects than entries, which is the first thing that
// people wonder about.
Html readingSection(const ExtractionReport& report, const ReportFacts& facts, Names& names) {
  Html html;
  html << "<section>\n<h2>What was read</h2>\n";
  if (!facts.withoutValues) html << "<p class=\"soft\">" << names(facts.store, kWhole) << "</p>\n";
  html << tableHead("reading", Html() << "Entries of the trace store",
                    {{"What"}, {"Count", Column::Kind::number}});
  addCount(html, "log events", report.entriesRead);
  addCount(html, "trace points among them", report.assembly.tracePoints);
  const std::pair<std::string_view, uint64_t> rest[] = {
      {"ends whose begin was not read", report.assembly.unmatchedEnds},
      {"begins replaced by a second one", report.assembly.replacedBegins},
      {"begins that wait for their end", report.assembly.openIntervals},
      {"entries that stand in two files", report.store.reading.duplicateEntries},
  };
  for (const auto& [what, count] : rest) {
    if (count != 0) addCount(html, what, count);
  }
  return html << tableEnd() << "</section>\n";
}

// Losses of one reading. The page may show two readings, that of the run and ours, so the ids of
// the tables begin with one of the reading.
class LossSection {
 public:
  LossSection(const StoreReading& reading, std::string_view title, std::string_view id,
              const ReportFacts& facts, Names& names)
      : reading_(reading), title_(title), id_(id), facts_(facts), names_(names) {}

  // Empty if nothing was lost.
  Html html() {
    Html html;
    const std::string part = partOfPeriod(reading_);
    const std::string unread = unreadPart(reading_);
    const std::string programs = unknownPrograms(reading_.losses);
    const bool lost = std::ranges::any_of(reading_.losses.all(),
                                          [](const Loss& loss) { return isLost(loss.code); });
    const bool partial = lost || !part.empty() || !unread.empty();
    if (!partial && programs.empty()) return html;
    html << "<section>\n<h2>" << (partial ? title_ : std::string_view("What is not known"))
         << "</h2>\n";
    for (const std::string& sentence : {part, unread, programs})
      if (!sentence.empty()) html << "<p>" << sentence << ".</p>\n";
    return html << table("losses", "Losses by reason", "Where",
                         [](LossCode code) { return isLost(code) && !isOfWriter(code); })
                << table("lost_at_source",
                         "Trace points that programs could not hand to the journal",
                         "User and program",
                         [](LossCode code) { return isOfWriter(code) && !isOverShare(code); })
                << table("over_share",
                         "Writers who had more than their share; only they lost by it",
                         "User and program", isOverShare)
                << "</section>\n";
  }

 private:
  // What belongs to a writer is no fault of the machine, so it stands in tables of its own.
  Html table(std::string_view id, std::string_view caption, std::string_view place,
             bool (*belongs)(LossCode)) {
    Html rows;
    for (const Loss& loss : reading_.losses.all()) {
      if (!belongs(loss.code)) continue;
      rows << "<tr><th scope=\"row\"><code>" << lossName(loss.code) << "</code> " << loss.words
           << "</th><td class=\"n\">" << loss.count << "</td><td>";
      if (!facts_.withoutValues && !loss.where().empty()) rows << names_(loss.where(), kWhole);
      rows << "</td></tr>\n";
    }
    if (rows.text().empty()) return rows;
    Html html;
    return html << tableHead(std::string(id_).append(id), Html() << caption,
                             {{"What"}, {"Lost", Column::Kind::number}, {place}})
                << rows << tableEnd();
  }

  const StoreReading& reading_;
  const std::string_view title_;
  const std::string_view id_;
  const ReportFacts& facts_;
  Names& names_;
};

Html runSection(const ReportFacts& facts, Names& names) {
  Html html;
  if (!facts.run) return html;
  const RunRecord& run = *facts.run;
  html << "<section>\n<h2>The run's own books</h2>\n"
       << tableHead(
              "run",
              Html() << "The run of " << dateText(run.start) << ", " << runOutcomeName(run.outcome),
              {{"What"}, {"Count", Column::Kind::number}});
  addCount(html, "trace objects inspected", run.inspected);
  for (const auto verdict : kVerdictOrder)
    addCount(html, verdictTitle(verdict), run.classified[verdict]);
  addCount(html, "rows stored in the spool", run.rowsStored);
  html << tableEnd();
  // A run that reported nothing by design has no sums, and "do not balance" would accuse it.
  if (run.hasBooks()) {
    const bool balanced = run.objectsBalance() && run.rowsBalance();
    html << "<p>The books "
         << (balanced ? Html() << "<span class=\"good\">balance</span>"
                      : Html() << "<span class=\"bad\">do not balance</span>")
         << ".</p>\n";
  }
  html << "</section>\n";
  if (run.reading)
    html << LossSection(*run.reading, "What the run lost", "run_", facts, names).html();
  return html;
}

// What the titles of names had no room for, if anything.
Html namesNote(const Names& names) {
  Html html;
  if (names.withoutTitle() == 0) return html;
  return html << "<p class=\"soft\">To keep this page small, " << names.withoutTitle()
              << " long names are shown only in part. <code>tesselctl explain --summary "
                 "--json</code> has the whole of them.</p>\n";
}

}  // namespace

std::string htmlReport(const Tally& tally, const ExtractionReport& report,
                       const ReportFacts& facts) {
  Names names;
  const Html machine = facts.withoutValues ? Html() << "a machine" : Html() << facts.machine;
  Html html;
  html << "<!DOCTYPE html>\n<html lang=\"en\">\n<head>\n<meta charset=\"utf-8\">\n"
          "<meta http-equiv=\"Content-Security-Policy\" content=\""
       << kReportPolicy
       << "\">\n<meta name=\"viewport\" content=\"width=device-width, "
          "initial-scale=1\">\n<title>Trace points of "
       << machine << ", " << dateText(tally.period().end).substr(0, 10) << "</title>\n<style>"
       << kReportStyle << "</style>\n</head>\n<body>\n<header>\n<h1>Trace points of <bdi>"
       << machine << "</bdi></h1>\n<p>" << periodText(tally.period()) << " &middot; "
       << (facts.run ? std::string_view("the last run") : std::string_view("a dry run"))
       << ", judged as on " << facts.platform
       << (facts.internal ? std::string_view(" with internal diagnostics") : std::string_view())
       << "</p>\n</header>\n<main>\n"
       << tiles(tally, report) << findingSection(facts) << verdictSection(tally);
  // Charts without an object would be empty frames. The tables of zeros above say as much.
  if (tally.traceObjects() != 0) {
    html << timeSection(tally) << pairSection(tally, names)
         << missSection(
                tally, facts.withoutValues ? RecordedValues::leftOut : RecordedValues::shown, names)
         << durationSection(tally, names) << kindSection(tally);
  }
  html << runSection(facts, names) << readingSection(report, facts, names)
       << LossSection(report.store.reading, "What was lost", "", facts, names).html()
       << namesNote(names) << "</main>\n<footer>tesselctl made this page on "
       << zonedText(facts.made) << " and sent it nowhere.";
  if (facts.withoutValues)
    html << " Recorded values, users, programs, paths and the machine's name are left out.";
  html << "</footer>\n<script>" << kReportScript << "</script>\n</body>\n</html>\n";
  return html.text();
}

}  // namespace tessel::ctl
