#pragma once
// vantrelctl's command line: global options, the command, its own options
// and operands. Options may come before or after the command; "--" ends
// them.

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace vantrel::ctl {

// One option a command (or the tool) takes: --long, or -c when shortName is
// not 0; takesValue: "--long VALUE", "--long=VALUE" or "-c VALUE".
struct OptionSpec {
  const char* longName;
  char shortName;
  bool takesValue;
};

struct GlobalOptions {
  std::string service;
  bool json = false;
  bool help = false;
  bool version = false;
  bool noLegend = false;
  std::chrono::milliseconds timeout{10'000};
};

// What one command's own options and operands came to.
class Arguments {
 public:
  bool has(const std::string& name) const { return values_.contains(name); }
  // The last value given for name.
  std::optional<std::string> value(const std::string& name) const;
  // Every value given for name, in order.
  std::vector<std::string> values(const std::string& name) const;
  const std::vector<std::string>& operands() const { return operands_; }

  void add(const std::string& name, std::string value) {
    values_[name].push_back(std::move(value));
  }
  void addOperand(std::string operand) { operands_.push_back(std::move(operand)); }

 private:
  std::map<std::string, std::vector<std::string>> values_;
  std::vector<std::string> operands_;
};

struct CommandLine {
  GlobalOptions global;
  std::string command;             // empty when none was given
  std::vector<std::string> words;  // everything after the command, unparsed
};

// Splits off the global options before the command. nullopt (after a message
// on stderr) for a malformed global option.
std::optional<CommandLine> parseGlobal(int argc, char** argv);

// Parses a command's words against its options plus the global ones (which
// update global). nullopt (after a message on stderr) for an unknown option
// or a missing value.
std::optional<Arguments> parseCommand(const std::vector<std::string>& words,
                                      const std::vector<OptionSpec>& specs, GlobalOptions& global);

}  // namespace vantrel::ctl
