// What the completion of the shell offers.
//
// The answers come from the tables of the parser, which also print --help. A list in the script of
// the shell would offer what is gone, and not what is new. The price is a call of the program for
// each key, some milliseconds.

#include <algorithm>

#include "tesselctl/commands/Command.h"

namespace tessel::ctl {

namespace {

bool takesValue(const CLI::Option& option) { return option.get_items_expected_max() > 0; }

// Follows the words of a command line to the command, option or argument that the next one is for.
class PlaceOfWord {
 public:
  explicit PlaceOfWord(CLI::App& app) : command_(&app) {}

  void pass(const std::string& word) {
    if (awaited_ != nullptr) {
      awaited_ = nullptr;
    } else if (word == "--") {
      otherProgram_ = true;
    } else if (otherProgram_) {
      // Its words are not ours.
    } else if (word.size() > 1 && word.front() == '-') {
      const CLI::Option* option = optionNamed(word.substr(0, word.find('=')));
      if (option != nullptr) given_.push_back(option);
      if (option != nullptr && takesValue(*option) && word.find('=') == std::string::npos)
        awaited_ = option;
    } else if (CLI::App* command = commandNamed(word)) {
      command_ = command;
      arguments_ = 0;
    } else {
      ++arguments_;
    }
  }

  std::vector<std::string> offers(const std::string& begun) {
    if (awaited_ != nullptr) return valuesOf(*awaited_);
    // We know nothing of another program but that its arguments are often files.
    if (otherProgram_) return {std::string(kFiles)};
    if (!begun.empty() && begun.front() == '-') return options();
    std::vector<std::string> words;
    // Behind an argument a command is none any more: `rules check` takes words, and `check` may be
    // one of them.
    if (arguments_ == 0) {
      for (const CLI::App* command : command_->get_subcommands({}))
        words.push_back(command->get_name());
    }
    const auto arguments =
        command_->get_options([](CLI::Option* option) { return option->get_positional(); });
    if (arguments_ < arguments.size()) {
      const auto values = valuesOf(*arguments[arguments_]);
      words.insert(words.end(), values.begin(), values.end());
    }
    return words;
  }

 private:
  CLI::App* commandNamed(const std::string& name) const {
    const auto found =
        command_->get_subcommands([&](CLI::App* command) { return command->check_name(name); });
    return found.empty() ? nullptr : found.front();
  }
  const CLI::Option* optionNamed(const std::string& name) const {
    for (const CLI::Option* option : optionsOf(*command_)) {
      if (option->nonpositional() && option->check_name(name)) return option;
    }
    return nullptr;
  }

  std::vector<std::string> options() const {
    std::vector<std::string> words;
    for (const CLI::Option* option : optionsOf(*command_)) {
      // A pattern may be given again. Another option would be refused, or the second time be vain.
      const bool again = option->get_items_expected_max() > 1;
      if (!again && std::ranges::find(given_, option) != given_.end()) continue;
      for (const std::string& name : option->get_lnames()) words.push_back("--" + name);
    }
    return words;
  }

  CLI::App* command_;
  const CLI::Option* awaited_ = nullptr;  // the option that the next word is the value of
  std::vector<const CLI::Option*> given_;
  size_t arguments_ = 0;  // positional ones of the command that were passed
  bool otherProgram_ = false;
};

}  // namespace

int complete(CLI::App& app, const std::vector<std::string>& words) {
  PlaceOfWord position(app);
  const std::string begun = words.empty() ? "" : words.back();
  for (size_t i = 0; i + 1 < words.size(); ++i) position.pass(words[i]);
  for (const std::string& word : position.offers(begun)) {
    // A word a line, since no word that we offer holds a line feed, and the shell splits at them.
    if (word == kFiles || word.starts_with(begun)) print(word + "\n");
  }
  return kDone;
}

}  // namespace tessel::ctl
