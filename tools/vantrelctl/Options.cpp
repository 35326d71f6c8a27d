#include "tools/vantrelctl/Options.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>

#include "lmo/Protocol.h"

namespace vantrel::ctl {
namespace {

constexpr OptionSpec kGlobalSpecs[] = {
    {"service", 'S', true}, {"json", 0, false},      {"help", 'h', false},
    {"version", 0, false},  {"no-legend", 0, false}, {"timeout", 0, true},
};

// The longest a request may be given; beyond that a typo is likelier than
// patience.
constexpr double kMaxTimeoutSeconds = 24 * 60 * 60;

bool applyGlobal(const std::string& name, const std::string& value, GlobalOptions& global) {
  if (name == "service") {
    if (value.empty()) {
      std::fputs("vantrelctl: --service needs a name\n", stderr);
      return false;
    }
    global.service = value;
  } else if (name == "json") {
    global.json = true;
  } else if (name == "help") {
    global.help = true;
  } else if (name == "version") {
    global.version = true;
  } else if (name == "no-legend") {
    global.noLegend = true;
  } else if (name == "timeout") {
    char* end = nullptr;
    const double seconds = std::strtod(value.c_str(), &end);
    if (value.empty() || *end != '\0' || !std::isfinite(seconds) || seconds <= 0 ||
        seconds > kMaxTimeoutSeconds) {
      std::fprintf(stderr, "vantrelctl: --timeout wants a number of seconds above 0, not \"%s\"\n",
                   value.c_str());
      return false;
    }
    global.timeout = std::chrono::milliseconds(static_cast<int64_t>(std::ceil(seconds * 1000)));
  }
  return true;
}

const OptionSpec* findSpec(const std::vector<OptionSpec>& specs, std::string_view longName,
                           char shortName) {
  for (const OptionSpec& s : specs) {
    if (longName.empty() ? s.shortName == shortName && shortName != 0 : longName == s.longName) {
      return &s;
    }
  }
  return nullptr;
}

bool isGlobal(const OptionSpec* spec) {
  for (const OptionSpec& g : kGlobalSpecs) {
    if (spec != nullptr && std::string_view(spec->longName) == g.longName) return true;
  }
  return false;
}

// Reads the option at words[i] (advancing i past a separate value). Returns
// false after a complaint.
bool readOption(const std::vector<std::string>& words, size_t& i,
                const std::vector<OptionSpec>& specs, const OptionSpec*& spec, std::string& value) {
  const std::string& word = words[i];
  std::optional<std::string> inlineValue;
  if (word.starts_with("--")) {
    std::string name = word.substr(2);
    if (const size_t eq = name.find('='); eq != std::string::npos) {
      inlineValue = name.substr(eq + 1);
      name.resize(eq);
    }
    spec = findSpec(specs, name, 0);
  } else {
    spec = findSpec(specs, "", word[1]);
    if (word.size() > 2) inlineValue = word.substr(2);
  }
  if (spec == nullptr) {
    std::fprintf(stderr, "vantrelctl: unknown option %s\n", word.c_str());
    return false;
  }
  if (!spec->takesValue) {
    if (inlineValue && word.starts_with("--")) {
      std::fprintf(stderr, "vantrelctl: --%s takes no value\n", spec->longName);
      return false;
    }
    if (inlineValue) {
      std::fprintf(stderr, "vantrelctl: unknown option %s\n", word.c_str());
      return false;
    }
    return true;
  }
  if (inlineValue) {
    value = *inlineValue;
  } else if (i + 1 < words.size()) {
    value = words[++i];
  } else {
    std::fprintf(stderr, "vantrelctl: --%s needs a value\n", spec->longName);
    return false;
  }
  return true;
}

bool isOption(const std::string& word) {
  return word.size() > 1 && word[0] == '-';
}

}  // namespace

std::optional<std::string> Arguments::value(const std::string& name) const {
  auto it = values_.find(name);
  if (it == values_.end() || it->second.empty()) return std::nullopt;
  return it->second.back();
}

std::vector<std::string> Arguments::values(const std::string& name) const {
  auto it = values_.find(name);
  return it == values_.end() ? std::vector<std::string>() : it->second;
}

std::optional<CommandLine> parseGlobal(int argc, char** argv) {
  CommandLine line;
  line.global.service = protocol::kDefaultServiceName;
  const std::vector<OptionSpec> specs(std::begin(kGlobalSpecs), std::end(kGlobalSpecs));
  std::vector<std::string> words(argv + 1, argv + argc);
  size_t i = 0;
  for (; i < words.size() && isOption(words[i]) && words[i] != "--"; ++i) {
    const OptionSpec* spec = nullptr;
    std::string value;
    if (!readOption(words, i, specs, spec, value)) return std::nullopt;
    if (!applyGlobal(spec->longName, value, line.global)) return std::nullopt;
  }
  if (i < words.size() && words[i] == "--") ++i;
  if (i < words.size()) line.command = words[i++];
  line.words.assign(words.begin() + static_cast<ptrdiff_t>(i), words.end());
  return line;
}

std::optional<Arguments> parseCommand(const std::vector<std::string>& words,
                                      const std::vector<OptionSpec>& commandSpecs,
                                      GlobalOptions& global) {
  std::vector<OptionSpec> specs(commandSpecs);
  specs.insert(specs.end(), std::begin(kGlobalSpecs), std::end(kGlobalSpecs));
  Arguments arguments;
  bool optionsEnded = false;
  for (size_t i = 0; i < words.size(); ++i) {
    if (optionsEnded || !isOption(words[i])) {
      arguments.addOperand(words[i]);
      continue;
    }
    if (words[i] == "--") {
      optionsEnded = true;
      continue;
    }
    const OptionSpec* spec = nullptr;
    std::string value;
    if (!readOption(words, i, specs, spec, value)) return std::nullopt;
    if (isGlobal(spec) && !findSpec(commandSpecs, spec->longName, 0)) {
      if (!applyGlobal(spec->longName, value, global)) return std::nullopt;
    } else {
      arguments.add(spec->longName, value);
    }
  }
  return arguments;
}

}  // namespace vantrel::ctl
