// The program statora_forwarder: reads the spool and sends it to a collector.
//
// It is a program of its own, under a user of its own, so that the service needs no network and the
// network reaches nothing but the spool. A signal may end it in the middle of a request. The rows
// of that request then stay in the spool and are sent again at the next start.

#include <curl/curl.h>
#include <signal.h>
#include <sysexits.h>

#include <CLI/CLI.hpp>
#include <cerrno>
#include <cstdio>
#include <ctime>
#include <iostream>
#include <random>

#include "forwarder/Collector.h"
#include "forwarder/Forwarder.h"
#include "forwarder/Health.h"
#include "forwarder/Settings.h"
#include "linux/LogSinks.h"
#include "linux/ServiceRuntime.h"
#include "linux/SystemFacts.h"
#include "platform/Queues.h"
#include "statora/ForwarderLock.h"

namespace tessel {
namespace {

constexpr char kText[] = "text";
constexpr char kRaw[] = "raw";

// Written by hand, because the parser would show "--dry-run{text}:{text,raw}". A test holds it
// against the manual.
constexpr char kHelp[] =
    R"(Sends the events of the spool to a collector (OTLP over HTTP), or as
newline-delimited JSON to any URL.
Usage: /usr/lib/tessel/statora_forwarder [OPTION]

Without an option it stays and sends what comes, as the service
statora-forwarder.service does.

Options:
  --once             Send what waits now, then end
  --dry-run[=raw]    Print what would be sent, as text or as the very bytes;
                     send and change nothing
  --requeue          Let the rows that a collector refused wait again, then end
  -h,--help          Print this help message and exit
  --version          Print the version

Settings are environment variables; statora_forwarder(8) lists them. The one
that it needs is OTEL_EXPORTER_OTLP_ENDPOINT, the URL of the collector. Those of
the service stand in /etc/statora/forwarder.env, and a shell does not have them.
See what the service would send:
  systemd-run -qP -p User=statora-forwarder \
    -p EnvironmentFile=-/etc/statora/forwarder.env \
    /usr/lib/tessel/statora_forwarder --dry-run

Exit status: 0 sent, or asked to end; 64 no such option; 66 the spool cannot
be used; 69 the collector takes nothing; 74 the output cannot be written; 75
no answer, or another forwarder is at work; 78 a variable makes no sense.
)";

struct Arguments {
  bool once = false;
  std::string dryRun;  // empty, kText or kRaw
  bool requeue = false;
};

// The seed is random on purpose: a fleet that drew the same numbers would send at the same time.
double chance() {
  static std::mt19937_64 random{std::random_device{}()};
  return std::uniform_real_distribution<double>(0, 1)(random);
}

// Prints the bodies that would be sent if no request failed. It opens the spool only for reading,
// so that it can run beside the service and the forwarder.
int dryRun(const LaunchConfiguration& launch, const Encoder& encoder) {
  const ForwarderOptions options;
  ForwarderState state(launch.stateDirectory);
  if (const SqliteStatus status = state.openReadOnly(); !status.ok()) {
    std::cerr << "The spool cannot be read: " << status.reason << '\n';
    return EX_NOINPUT;
  }
  bool printed = false;
  for (int64_t after = 0;;) {
    std::vector<SpooledEvent> events = state.oldest(options.maxRecords, options.maxBytes, after);
    if (events.empty()) break;
    const Batch batch = cutBatch(std::move(events), encoder, state.spoolId(), options.maxBytes);
    after = batch.lastId;
    if (batch.records.empty()) continue;
    printed = true;
    std::cout << encoder.body(batch.records) << std::flush;
    // A reader that goes, as `head` does, has seen enough. Else it is a disk without room.
    if (!std::cout && errno == EPIPE) return EX_IOERR;
    if (!std::cout) break;
  }
  if (state.status().ok() && std::cout) {
    if (!printed) std::cerr << "No event waits.\n";
    return 0;
  }
  std::cerr << (std::cout ? state.status().reason : "The output cannot be written") << '\n';
  return EX_IOERR;
}

// Both of the following are short and change nothing halfway, so signals may end them at once.
void letSignalsEndUs() {
  sigset_t signals;
  sigemptyset(&signals);
  for (const int signalNumber : {SIGTERM, SIGINT}) sigaddset(&signals, signalNumber);
  pthread_sigmask(SIG_UNBLOCK, &signals, nullptr);
}

// It takes the lock of forwarders: a forwarder at work would not count these rows.
int requeue(const std::string& stateDirectory) {
  ForwarderState state(stateDirectory);
  SqliteStatus status = state.open();
  const auto rows = status.ok() ? state.requeue() : std::nullopt;
  if (!rows) {
    std::cerr << "Nothing was put back: " << (status.ok() ? state.status() : status).reason << '\n';
    return status.code == kHeldByAnotherForwarder ? EX_TEMPFAIL : EX_IOERR;
  }
  std::cout << *rows << " events wait again\n";
  return 0;
}

// Makes SIGTERM and SIGINT end every wait and the present request. Otherwise a collector that hangs
// would keep the process until the timeout.
void stopOnSignals(Semaphore& stop, CurlCollector& collector, Threads& threads) {
  const auto queue = std::make_shared<WorkerQueue>("statora_forwarder signal queue", threads);
  for (const int signalNumber : {SIGTERM, SIGINT}) {
    const auto source = std::make_shared<ThreadSignalSource>(signalNumber, queue, threads);
    source->setHandler([&stop, &collector] {
      collector.cancel();
      stop.signal();
    });
    source->resume();
  }
}

// The statuses of sysexits.h. By them a timer or a script can tell "try again" (75) from a fault
// that an operator must repair.
int exitStatus(ForwarderOutcome outcome) {
  switch (outcome) {
    case ForwarderOutcome::delivered:
    case ForwarderOutcome::stopped:
      return 0;
    case ForwarderOutcome::unreachable:
    case ForwarderOutcome::lockedOut:
      return EX_TEMPFAIL;
    case ForwarderOutcome::held:
      return EX_UNAVAILABLE;
    case ForwarderOutcome::spoolFailed:
      return EX_NOINPUT;
  }
  return EX_SOFTWARE;
}

// Tells the log why nothing moves. An outage of days gives one line and not one every 30 seconds.
class Complaints {
 public:
  void tell(const std::string& words) {
    if (words != last_ && !words.empty()) kForwarderLog.error("%@", words);
    last_ = words;
  }

 private:
  std::string last_;
};

class Service {
 public:
  Service(const LaunchConfiguration& launch, const ForwarderSettings& settings,
          const Encoder& encoder, Semaphore& stop, CurlCollector& collector, Threads& threads)
      : settings_(settings),
        stop_(stop),
        threads_(threads),
        state_(launch.stateDirectory),
        health_(launch.stateDirectory, state_),
        manager_(connectServiceManager(clock_)),
        collector_(collector),
        forwarder_({state_, encoder, collector, clock_, threads, *manager_, stop, chance},
                   optionsFor(settings)) {}

  int runOnce() {
    ForwarderOutcome outcome = round();
    for (uint32_t rounds = 1; rounds < kRoundsAtOnce && mayHelpToWait(outcome); ++rounds) {
      outcome = threads_.wait(stop_, forwarder_.pause()) ? ForwarderOutcome::stopped : round();
    }
    end();
    return exitStatus(outcome);
  }

  int runForEver() {
    manager_->ready();
    // A fleet that starts in the same minute must not reach the collector in the same second.
    const std::chrono::nanoseconds turn{
        std::chrono::duration_cast<std::chrono::nanoseconds>(settings_.spread * chance())};
    manager_->say("Waiting for its turn in the fleet, until " + clockTime(turn));
    // A note takes the lock of forwarders. For the usual minutes somebody's --once may go first.
    if (turn >= ForwarderCounters::kLongRest) forwarder_.noteRest(turn);
    bool stopped = threads_.wait(stop_, turn);
    while (!stopped) {
      const ForwarderOutcome outcome = round();
      stopped = outcome == ForwarderOutcome::stopped || pause(outcome);
    }
    manager_->stopping();
    end();
    return 0;
  }

 private:
  // With --once, something else starts the next attempt. By default eight attempts take five to ten
  // minutes with their waits.
  static constexpr uint32_t kRoundsAtOnce = 8;

  static ForwarderOptions optionsFor(const ForwarderSettings& settings) {
    ForwarderOptions options;
    options.firstRetry = settings.retry;
    options.interval = settings.interval;
    options.hold = settings.hold;
    options.recordsPerSecond = settings.recordsPerSecond;
    options.destination = settings.destination;
    return options;
  }

  bool mayHelpToWait(ForwarderOutcome outcome) const {
    return outcome == ForwarderOutcome::unreachable || forwarder_.owesAcknowledgement();
  }

  ForwarderOutcome round() {
    // A record of a time when health was still wanted must not leave.
    if (!settings_.sendHealth && isSpoolOpen()) health_.withdraw();
    ForwarderOutcome outcome = forwarder_.deliverAll();
    // After the rows, so that the record tells what became of them.
    const bool added = settings_.sendHealth && isSpoolOpen() && health_.look(clock_.now());
    if (added && outcome == ForwarderOutcome::delivered) outcome = forwarder_.deliverAll();
    const std::string& words = forwarder_.reason();
    complaints_.tell(words);
    manager_->say(words.empty() ? "Delivered what there was"
                                : words + "; next attempt at " + clockTime(forwarder_.pause()));
    return outcome;
  }

  // The time of day when such a wait ends. Whoever reads the status does not know when it began.
  std::string clockTime(std::chrono::nanoseconds wait) {
    const auto end = clock_.now() + std::chrono::ceil<std::chrono::microseconds>(wait);
    const std::time_t seconds =
        std::chrono::system_clock::to_time_t(std::chrono::ceil<std::chrono::seconds>(end));
    std::tm parts{};
    ::localtime_r(&seconds, &parts);
    char text[sizeof "23:59:59"];
    return {text, std::strftime(text, sizeof text, "%H:%M:%S", &parts)};
  }

  bool isSpoolOpen() { return state_.exists() && state_.open().ok(); }

  // Waits for the next round. A renewed credential ends the wait early, because an old one may be
  // why the collector refuses or why no connection comes about. True if somebody asked to stop.
  bool pause(ForwarderOutcome outcome) {
    std::chrono::nanoseconds left = forwarder_.pause();
    const bool byCollector =
        outcome == ForwarderOutcome::held || outcome == ForwarderOutcome::unreachable;
    while (byCollector && left > settings_.interval) {
      if (threads_.wait(stop_, settings_.interval)) return true;
      if (collector_.hasNewCredentials()) return false;
      left -= settings_.interval;
    }
    return threads_.wait(stop_, left);
  }

  // What the collector has taken and the spool still holds would be sent again by the next start.
  void end() {
    if (!forwarder_.acknowledgeTaken()) complaints_.tell(forwarder_.reason());
  }

  const ForwarderSettings& settings_;
  Semaphore& stop_;
  Threads& threads_;
  SystemClock clock_;
  ForwarderState state_;
  Health health_;
  std::unique_ptr<ServiceManager> manager_;
  CurlCollector& collector_;
  Forwarder forwarder_;
  Complaints complaints_;
};

int forward(const LaunchConfiguration& launch, const ForwarderSettings& settings, bool once) {
  curl_global_init(CURL_GLOBAL_DEFAULT);
  // Never deleted: the signal threads use them for as long as the process lives.
  auto& threads = *new StandardThreads;
  auto& stop = *new Semaphore(0);
  const auto encoder = settings.output->makeEncoder(
      readResources(launch.osReleasePath, settings.resourceAttributes, settings.sendInstanceId));
  auto& collector = *new CurlCollector(settings, encoder->contentType());
  stopOnSignals(stop, collector, threads);
  Service service(launch, settings, *encoder, stop, collector, threads);
  return once ? service.runOnce() : service.runForEver();
}

int complain(const LaunchError& error) {
  std::cerr << error.line() << '\n';
  return EX_CONFIG;
}

int run(const Arguments& arguments) {
  const EnvironmentReader environment = processEnvironment();
  const auto launch = readLaunchConfiguration(environment);
  if (const auto* error = std::get_if<LaunchError>(&launch)) return complain(*error);
  const auto& configuration = std::get<LaunchConfiguration>(launch);
  static LogSink* const sink =
      makeLogSink(configuration.logDestination, "statora_forwarder").release();
  setLogSink(sink, configuration.logLevel);
  // Neither --requeue nor --dry-run needs a collector, so the settings of one are not read for
  // them.
  if (arguments.requeue || !arguments.dryRun.empty()) letSignalsEndUs();
  if (arguments.requeue) return requeue(configuration.stateDirectory);
  if (!arguments.dryRun.empty()) {
    const auto encoding = readEncodingSettings(environment);
    if (const auto* error = std::get_if<LaunchError>(&encoding)) return complain(*error);
    const auto& settings = std::get<EncodingSettings>(encoding);
    const Resources resources = readResources(configuration.osReleasePath,
                                              settings.resourceAttributes, settings.sendInstanceId);
    const auto encoder = arguments.dryRun == kRaw ? settings.output->makeEncoder(resources)
                                                  : makeTextEncoder(resources);
    return dryRun(configuration, *encoder);
  }
  const auto settings = readForwarderSettings(environment);
  if (const auto* error = std::get_if<LaunchError>(&settings)) return complain(*error);
  return forward(configuration, std::get<ForwarderSettings>(settings), arguments.once);
}

}  // namespace
}  // namespace tessel

int main(int argc, char** argv) {
  tessel::prepareProcess();
  tessel::blockSignal(SIGTERM);
  CLI::App app;
  app.formatter_fn([](const CLI::App*, std::string, CLI::AppFormatMode) -> std::string {
    return tessel::kHelp;
  });
  app.set_version_flag("--version", "statora_forwarder " TESSEL_VERSION);
  tessel::Arguments arguments;
  auto* const once = app.add_flag("--once", arguments.once);
  auto* const dryRun = app.add_flag("--dry-run{text}", arguments.dryRun)
                           ->check(CLI::IsMember({tessel::kText, tessel::kRaw}));
  auto* const requeue = app.add_flag("--requeue", arguments.requeue);
  once->excludes(dryRun, requeue);
  dryRun->excludes(requeue);
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    return app.exit(error) == 0 ? 0 : EX_USAGE;
  }
  return tessel::run(arguments);
}
