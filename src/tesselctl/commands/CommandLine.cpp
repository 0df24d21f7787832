// What options take, and what is said about a command line that makes no sense.
//
// The parser's own words count ("1 required TEXT missing") and turn the order of the arguments
// round. We take from its error only what kind it is and which option it is about. The rest comes
// from the tables of --help, so each message names the words that would be right.

#include <algorithm>
#include <charconv>
#include <cmath>
#include <functional>
#include <iterator>
#include <sstream>

#include "platform/Text.h"
#include "tesselctl/commands/Command.h"

namespace tessel::ctl {

namespace {

std::string joined(const std::vector<std::string>& words, const char* between) {
  std::string text;
  for (const std::string& word : words) text += (text.empty() ? "" : between) + word;
  return text;
}

// The innermost command that was called.
const CLI::App& calledIn(const CLI::App& app) {
  const auto called = app.get_subcommands();
  return called.empty() ? app : calledIn(*called.front());
}

// "events show"; the program itself has no path.
std::string commandPath(const CLI::App& command) {
  if (command.get_parent() == nullptr) return "";
  const std::string outer = commandPath(*command.get_parent());
  return (outer.empty() ? "" : outer + " ") + command.get_name();
}

// How a message begins that is about the command.
std::string nameOf(const CLI::App& command) {
  const std::string path = commandPath(command);
  return path.empty() ? "the command line" : path;
}

std::vector<std::string> namesOfCommands(const CLI::App& command) {
  std::vector<std::string> names;
  for (const CLI::App* inner : command.get_subcommands([](const CLI::App*) { return true; }))
    names.push_back(inner->get_name());
  return names;
}

// "SUBSYSTEM CATEGORY [NAME]".
std::string argumentsOf(const CLI::App& command) {
  std::vector<std::string> words;
  for (const CLI::Option* option : optionsOf(command)) {
    // As the usage line writes them, so that a reader finds the words of the message again in
    // --help.
    if (option->nonpositional()) continue;
    std::string word = option->get_name();
    std::ranges::transform(word, word.begin(), [](unsigned char c) { return std::toupper(c); });
    words.push_back(option->get_required() ? word : "[" + word + "]");
  }
  return joined(words, " ");
}

// All options are named and not only near ones: a command has a dozen at most, and whoever mistook
// one most often looks for another.
std::string unknownOption(const CLI::App& command, const std::string& word) {
  std::vector<std::string> names;
  for (const CLI::Option* option : optionsOf(command)) {
    for (const std::string& name : option->get_lnames()) names.push_back("--" + name);
  }
  // What stands behind an equals sign is a value, and may be a secret that was put behind the wrong
  // name.
  return nameOf(command) + " has no option '" + word.substr(0, word.find('=')) + "'; it has " +
         joined(names, ", ");
}

// A word that stands where none, or another one, is taken.
std::string unknownWord(const CLI::App& command, const std::string& word) {
  const std::vector<std::string> inner = namesOfCommands(command);
  const std::string quoted = "'" + word + "'";
  if (command.get_parent() == nullptr)
    return "there is no command " + quoted + "; commands are " + joined(inner, ", ");
  if (!inner.empty()) {
    std::string message =
        nameOf(command) + " does not take " + quoted + "; it takes " + joined(inner, ", ");
    // Who leaves out the only word that may stand there meant it.
    if (inner.size() == 1)
      message += ": tesselctl " + commandPath(command) + " " + inner.front() + " " + word;
    return message;
  }
  const std::string arguments = argumentsOf(command);
  return nameOf(command) + " takes " +
         (arguments.empty() ? "no word" : "no word behind " + arguments) + ": " + quoted;
}

// The option that an error of the parser begins with. Of a flag it leaves the dashes out.
const CLI::Option* optionAt(const CLI::App& command, const std::string& message) {
  const std::string name = message.substr(0, message.find_first_of(": "));
  for (const CLI::Option* option : optionsOf(command)) {
    if (option->get_name() == name || option->check_lname(name)) return option;
  }
  return nullptr;
}

std::string missing(const CLI::App& command, const CLI::Option& option) {
  if (option.nonpositional())
    return nameOf(command) + " needs " + option.get_name() + " " + option.get_type_name() + ": " +
           option.get_description();
  return nameOf(command) + " needs " + argumentsOf(command) + "; " + option.get_name() +
         " is missing: " + option.get_description();
}

std::string mismatch(const CLI::Option& option, const std::string& message) {
  const std::string name = option.get_name();
  // The parser has one kind of error for several mistakes, and only its words tell them apart. A
  // test holds our messages against a command line that makes it.
  if (message.find("override") != std::string::npos) return name + " takes no value";
  if (message.find("At Most") == std::string::npos) {
    const std::vector<std::string> values = valuesOf(option);
    if (!values.empty() && values.front() != kFiles)
      return name + " needs one of " + joined(values, ", ");
    return name + " needs a value, " + option.get_type_name() + ": " + option.get_description();
  }
  if (option.nonpositional()) return name + " may stand once";
  return name + ": more than " + std::to_string(option.get_items_expected_max()) +
         " words; it is: " + option.get_description();
}

std::string messageFor(const CLI::App& command, const CLI::ParseError& error,
                       const std::vector<std::string>& remaining) {
  const std::string words = error.what();
  const CLI::Option* option = optionAt(command, words);
  const auto kind = static_cast<CLI::ExitCodes>(error.get_exit_code());
  if (kind == CLI::ExitCodes::RequiredError && option != nullptr) return missing(command, *option);
  if (kind == CLI::ExitCodes::ArgumentMismatch && option != nullptr)
    return mismatch(*option, words);
  if (kind == CLI::ExitCodes::ExtrasError ||
      (kind == CLI::ExitCodes::RequiredError && !remaining.empty())) {
    const std::string& word = remaining.front();
    return word.size() > 1 && word.front() == '-' ? unknownOption(command, word)
                                                  : unknownWord(command, word);
  }
  if (kind == CLI::ExitCodes::RequiredError)
    return nameOf(command) + " needs one of " + joined(namesOfCommands(command), ", ");
  if (kind == CLI::ExitCodes::ExcludesError || kind == CLI::ExitCodes::RequiresError) {
    const size_t verb = words.find(' ');
    // The parser's sentence names both options, first and last. What it says between them we say in
    // our words.
    return words.substr(0, verb) +
           (kind == CLI::ExitCodes::ExcludesError ? " cannot stand with" : " needs") +
           words.substr(words.rfind(' '));
  }
  return words;
}

// The parser keeps no list of the values that an option takes. It keeps checks, which have names.
// So the name of a check is the list.
CLI::Option* checked(CLI::Option* option, std::function<std::string(const std::string&)> check,
                     const std::vector<std::string>& words) {
  return option->check(CLI::Validator(std::move(check), ""), joined(words, " "));
}

}  // namespace

std::vector<const CLI::Option*> optionsOf(const CLI::App& command) {
  auto options = command.get_options([](const CLI::Option*) { return true; });
  const CLI::App* outer = command.get_parent();
  if (outer == nullptr || !command.get_fallthrough()) return options;
  for (const CLI::Option* option : optionsOf(*outer)) {
    const auto same = [&](const auto* own) { return own->get_name() == option->get_name(); };
    if (option->nonpositional() && std::ranges::none_of(options, same)) options.push_back(option);
  }
  return options;
}

std::vector<std::string> valuesOf(const CLI::Option& option) {
  try {
    // The parser gives a check away only by a pointer to change it.
    std::istringstream words(const_cast<CLI::Option&>(option).get_validator(0)->get_name());
    return {std::istream_iterator<std::string>(words), {}};
  } catch (const CLI::OptionNotFound&) {  // the parser has no other way to say that there is none
    return {};
  }
}

CLI::Option* takesOneOf(CLI::Option* option, const std::vector<std::string>& words) {
  const auto check = [words](const std::string& value) {
    if (std::ranges::find(words, value) != words.end()) return std::string();
    return "'" + value + "' is none of " + joined(words, ", ");
  };
  return checked(option, check, words);
}

CLI::Option* takesWhole(CLI::Option* option, uint64_t least, uint64_t most,
                        const std::string& unit) {
  const auto check = [=](const std::string& value) {
    // from_chars() takes no blank, no sign, no other base and nothing behind the digits, so a
    // mistyped number is never another one.
    uint64_t number = 0;
    const char* end = value.data() + value.size();
    const auto [stop, error] = std::from_chars(value.data(), end, number);
    if (error == std::errc() && stop == end && number >= least && number <= most)
      return std::string();
    return "'" + value + "' is no whole number of " + unit + " from " + std::to_string(least) +
           " to " + std::to_string(most);
  };
  return checked(option, check, {});
}

CLI::Option* suggests(CLI::Option* option, const std::vector<std::string>& words) {
  return checked(
      option, [](const std::string&) { return std::string(); }, words);
}

// A shell makes an empty word of a variable that is not set. As a path it would mean the directory
// "/" to whoever appends a name to it.
CLI::Option* suggestsFiles(CLI::Option* option) {
  const auto check = [](const std::string& value) {
    return value.empty() ? std::string("'' names no file or directory") : std::string();
  };
  return checked(option, check, {std::string(kFiles)});
}

void refuseValuesOfFlags(CLI::App& command) {
  for (CLI::Option* option : command.get_options([](CLI::Option*) { return true; })) {
    // A script that writes --json=$wanted would get JSON where it wanted none, too.
    if (option->get_items_expected_max() == 0) option->disable_flag_override();
  }
  for (CLI::App* inner : command.get_subcommands([](CLI::App*) { return true; }))
    refuseValuesOfFlags(*inner);
}

int failToParse(const CLI::App& app, const CLI::ParseError& error, const std::string& firstWord) {
  // A command takes the words behind it. So only the first word can be none of its own.
  const auto remaining = app.remaining();
  const bool first = !remaining.empty() && remaining.front() == firstWord;
  const CLI::App& command = first ? app : calledIn(app);
  const std::string path = commandPath(command);
  return fail(kUsage, messageFor(command, error, app.remaining(true)) + "; see tesselctl " +
                          (path.empty() ? "" : path + " ") + "--help");
}

}  // namespace tessel::ctl
