// The status in the text format of Prometheus, for the node exporter's textfile collector.
//
// Names follow its conventions: base units, counters end in _total, and a label tells one of a set.
// Every value of a label is a name of ours, so no text of a stranger can stand in the file. A
// figure that nobody knows is left out: a zero would look like a fact, and an alert can ask for
// absence.

#include <algorithm>
#include <cstdio>
#include <utility>

#include "tesselctl/showing/StatusScreen.h"

namespace tessel::ctl {

namespace {

class Metrics {
 public:
  // Begins a metric; its samples follow. `type` is "gauge" or "counter".
  void metric(std::string_view name, std::string_view type, std::string_view help) {
    name_ = "tessel_" + std::string(name);
    out_ += "# HELP " + name_ + " " + std::string(help) + "\n";
    out_ += "# TYPE " + name_ + " " + std::string(type) + "\n";
  }
  void sample(uint64_t value) { line("", std::to_string(value)); }
  void sample(std::string_view label, std::string_view labelled, uint64_t value) {
    line("{" + std::string(label) + "=\"" + std::string(labelled) + "\"}", std::to_string(value));
  }
  // A share in parts of a million would need a rule in each dashboard. By the conventions of
  // Prometheus a ratio goes from 0 to 1.
  void ratio(std::string_view label, std::string_view labelled, uint64_t part, uint64_t whole) {
    line("{" + std::string(label) + "=\"" + std::string(labelled) + "\"}",
         std::to_string(static_cast<double>(part) / static_cast<double>(whole)));
  }
  void gauge(std::string_view name, std::string_view help, uint64_t value) {
    metric(name, "gauge", help);
    sample(value);
  }
  void counter(std::string_view name, std::string_view help, uint64_t value) {
    metric(name, "counter", help);
    sample(value);
  }
  // Seconds since 1970, as Prometheus counts time. Nothing for a time that is not known.
  void time(std::string_view name, std::string_view help, std::optional<Date> date) {
    if (!date || date->time_since_epoch().count() <= 0) return;
    metric(name, "gauge", help);
    const auto microseconds = static_cast<uint64_t>(date->time_since_epoch().count());
    char text[40];
    // Written as integers: a double of microseconds since 1970 would lose the last digits in its
    // usual form.
    std::snprintf(text, sizeof text, "%llu.%06llu",
                  static_cast<unsigned long long>(microseconds / 1'000'000),
                  static_cast<unsigned long long>(microseconds % 1'000'000));
    line("", text);
  }
  std::string take() { return std::move(out_); }

 private:
  void line(const std::string& labels, std::string_view value) {
    out_ += name_ + labels + " " + std::string(value) + "\n";
  }

  std::string name_;  // of the metric that was begun
  std::string out_;
};

std::optional<Date> dateOf(std::optional<int64_t> microseconds) {
  if (!microseconds) return {};
  return Date{std::chrono::microseconds{*microseconds}};
}

// A code that was looked for has a sample, also where it was not found. So a rule can tell a
// problem that is gone from one that nobody could look for.
void addFindings(Metrics& metrics, const ReporterStatus& status) {
  const auto found = [&](FindingCode code) {
    return std::any_of(status.findings.begin(), status.findings.end(),
                       [&](const Finding& each) { return each.code == code; });
  };
  metrics.metric("problem", "gauge", "Whether this problem was found. No sample: not looked for.");
  for (const FindingCode code : status.checked)
    metrics.sample("code", findingName(code), found(code));
  metrics.metric("note", "gauge", "Whether this note was found. A note is no problem.");
  for (size_t at = 0; at < kFindingCodes; ++at) {
    const auto code = static_cast<FindingCode>(at);
    if (!isProblem(code)) metrics.sample("code", findingName(code), found(code));
  }
}

void addTasking(Metrics& metrics, const Tasking& tasking) {
  metrics.gauge("tasked", "Whether this machine reports.", tasking.decision.on());
  if (!tasking.rollout) return;
  metrics.metric("rollout_share_ratio", "gauge", "The share of the machines that report.");
  metrics.ratio("cohort", tasking.rollout->cohort, tasking.rollout->share, kWholeFleet);
}

void addRun(Metrics& metrics, const ReporterStatus& status) {
  const RunRecord& run = *status.run;
  metrics.time("last_run_start_timestamp_seconds", "When the last run began.", run.start);
  metrics.time("last_run_end_timestamp_seconds", "When the last run ended.", run.end);
  // A sample for each outcome, so that an alert can name one that has never occurred here.
  metrics.metric("last_run_outcome", "gauge", "How the last run ended: 1 for its outcome.");
  for (size_t at = 0; at < kRunOutcomeNames.size(); ++at)
    metrics.sample("outcome", kRunOutcomeNames[at], static_cast<size_t>(run.outcome) == at);
  metrics.gauge("last_run_log_entries", "Journal entries that the last run read.", run.logEvents);
  metrics.metric("last_run_objects", "gauge", "Trace objects of the last run, by verdict.");
  for (const ClassificationRow& row : kClassifications)
    metrics.sample("verdict", row.name, run.classified[row.code]);
  metrics.gauge("last_run_rows_sent", "Rows that the last run handed to the spool.",
                run.sums().sent);
  metrics.gauge("last_run_rows_stored", "Of those, the rows in the spool.", run.rowsStored);
  metrics.counter("rows_expired_total", "Rows that were removed because of their age.",
                  run.totals.expired);
  // Each reason has a sample from the first run on, also where it is zero. A counter that appears
  // only with its first loss has no increase that an alert could see.
  metrics.metric("rows_refused_total", "counter", "Rows that no run could store, by reason.");
  for (const auto& [reason, count] : run.rowsFailed) {
    const auto total = run.totals.failed.find(reason);
    metrics.sample("reason", reason, total == run.totals.failed.end() ? 0 : total->second);
  }
}

void addSpool(Metrics& metrics, const ReporterStatus& status) {
  const SpoolContents& spool = status.spool;
  metrics.gauge("spool_rows_waiting", "Rows that wait for delivery.",
                static_cast<uint64_t>(spool.rows));
  metrics.gauge("spool_rows_set_aside", "Rows that a collector refused, kept for a look.",
                static_cast<uint64_t>(spool.setAside));
  // Without delivered rows, which give way to new ones: with them the spool would look full when it
  // is not.
  metrics.gauge("spool_used_bytes", "Bytes of the spool that new rows cannot have.",
                spool.bytesOfWaiting);
  metrics.gauge("spool_limit_bytes", "Bytes that the spool may have.", status.spoolLimitBytes);
  metrics.time("spool_oldest_row_timestamp_seconds", "When the oldest waiting row was stored.",
               dateOf(spool.oldest));
}

void addForwarder(Metrics& metrics, const ForwarderCounters& counters) {
  const auto at = [](uint64_t time) { return dateOf(static_cast<int64_t>(time)); };
  metrics.counter("forwarder_rows_delivered_total", "Rows that a collector took.",
                  counters.delivered);
  metrics.counter("forwarder_rows_rejected_total",
                  "Of the delivered rows, those that the collector threw away.", counters.rejected);
  metrics.counter("forwarder_requests_total", "Requests to the collector.", counters.requests);
  metrics.counter("forwarder_retries_total", "Requests that repeat one that failed.",
                  counters.retries);
  metrics.counter("forwarder_sent_bytes_total", "Bytes of request bodies, as sent.",
                  counters.bytesSent);
  metrics.time("forwarder_last_success_timestamp_seconds", "When a collector last took rows.",
               at(counters.lastSuccess));
  metrics.time("forwarder_last_error_timestamp_seconds", "When a collector last took none.",
               at(counters.lastErrorAt));
}

}  // namespace

std::string statusMetrics(const ReporterStatus& status) {
  Metrics metrics;
  metrics.metric("build_info", "gauge", "The version of the package, always 1.");
  metrics.sample("version", TESSEL_VERSION, uint64_t{1});
  metrics.time("status_timestamp_seconds", "When this was looked at.", status.now);
  metrics.gauge("good", "Whether there is no problem.", status.good());
  addFindings(metrics, status);
  addTasking(metrics, status.tasking);
  if (status.run) addRun(metrics, status);
  if (status.spoolState == SpoolReader::State::open) addSpool(metrics, status);
  if (status.spool.forwarder) addForwarder(metrics, *status.spool.forwarder);
  return metrics.take();
}

}  // namespace tessel::ctl
