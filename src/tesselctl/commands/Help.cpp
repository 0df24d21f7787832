// How --help looks, and what several commands tell in it.
//
// Each --help answers alone: whoever reads a column of figures or a word like few_values has no
// manual at hand. The manual takes its notes from here.

#include <algorithm>
#include <array>
#include <sstream>

#include "platform/Invariant.h"
#include "tesselctl/commands/Command.h"

namespace tessel::ctl {

namespace {

constexpr size_t kColumn = 28;  // of the descriptions of options
constexpr size_t kWidth = 80;
// The manual indents the notes by five columns, and a line of it has 80 as well.
constexpr size_t kNotesWidth = 75;

// Help that fits 80 columns. The parser would not break a long description, and a terminal would
// continue it at the left edge, among the names of the options.
class NarrowFormatter final : public CLI::Formatter {
 public:
  NarrowFormatter() { column_width(kColumn); }
  std::string make_option_desc(const CLI::Option* option) const override {
    return wrapped(option->get_description(), kWidth - kColumn, 0);
  }
  // The parser would print "WORDS(1x)" for an argument of one to three words.
  std::string make_option_usage(const CLI::Option* option) const override {
    if (option->get_expected_max() <= 1) return CLI::Formatter::make_option_usage(option);
    return make_option_name(option, true) + "...";
  }
  std::string make_subcommand(const CLI::App* command) const override {
    std::ostringstream out;
    CLI::detail::format_help(out, command->get_name(),
                             wrapped(command->get_description(), kWidth - kColumn, 0), kColumn);
    return out.str();
  }
};

constexpr std::array<std::pair<std::string_view, std::string_view>, 14> kVariables = {{
    {"TESSEL_TRACE_STORE", "trace store, unless an option names one [the machine's journal]"},
    {"TESSEL_STATE_DIR",
     "the service's state directory, with the spool and the record of its runs "
     "[$STATE_DIRECTORY, else /var/lib/tessel]"},
    {"TESSEL_CONFIG_DIR",
     "directory of the tasking file [$CONFIGURATION_DIRECTORY, else /etc/tessel]"},
    {"TESSEL_OS_RELEASE",
     "file that says whether the build has internal diagnostics [/etc/os-release]"},
    {"TESSEL_DEFER_ON", "what may put a run off [file,battery,pressure]"},
    {"TESSEL_DEFER_RETRY", "seconds until a run that waits begins at the latest [900]"},
    {"TESSEL_ACTIVITY_INTERVAL", "seconds between runs, where no run has noted its own"},
    {"TESSEL_SPOOL_LIMIT", "bytes that the spool may take, where no run has noted its own"},
    {"TESSEL_TRACE", "0: record nothing; check: say on standard error what is wrong"},
    {"TESSEL_TRACE_WAIT", "milliseconds to wait for room in the journal's socket [20]"},
    {"TESSEL_JOURNAL_SOCKET", "socket of the journal [/run/systemd/journal/socket]"},
    {"TZ",
     "time zone of the dates that are read and shown; one that is unknown counts as UTC, and "
     "standard error says so [the machine's]"},
    {"COLUMNS", "width of the output, 1 to 9999 [the terminal's]"},
    {"NO_COLOR", "if not empty, no colours"},
}};

}  // namespace

void formatHelp(CLI::App& app) { app.formatter(std::make_shared<NarrowFormatter>()); }

std::string helpText(std::string_view text) { return wrapped(text, kNotesWidth, 0) + "\n\n"; }

std::string helpTable(std::string_view title, const std::vector<HelpRow>& rows) {
  size_t names = 0;
  for (const HelpRow& row : rows) names = std::max(names, row.name.size());
  std::string out = std::string(title) + ":\n";
  for (const HelpRow& row : rows) {
    std::string name = "  " + row.name;
    name.resize(names + 4, ' ');
    out += name + wrappedBeside(row.meaning, kNotesWidth, name.size()) + "\n";
  }
  return out + "\n";
}

std::string helpEnvironment(std::initializer_list<std::string_view> names) {
  std::vector<HelpRow> rows;
  for (const std::string_view name : names) {
    const auto* found =
        std::ranges::find(kVariables, name, [](const auto& row) { return row.first; });
    TESSEL_INVARIANT(found != kVariables.end());  // a variable without words
    rows.push_back({std::string(name), std::string(found->second)});
  }
  return helpTable("Environment", rows);
}

}  // namespace tessel::ctl
