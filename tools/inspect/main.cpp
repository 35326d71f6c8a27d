// vantrel-inspect: prints what the plug-in model makes of plug-in bundles:
// each record's identity, its validation verdict with the exact message, and
// the form it exports. Plug-in authors run it on their bundles before
// shipping them.

#include <getopt.h>
#include <stdlib.h>

#include <cstdio>
#include <string>
#include <vector>

#include "base/Format.h"
#include "lmo/Json.h"
#include "tools/inspect/Inspection.h"

namespace {

using vantrel::lmo::Dictionary;
using vantrel::lmo::JsonStyle;
using vantrel::lmo::Value;
using vantrel::tools::Inspection;

constexpr const char* kUsage =
    "usage: vantrel-inspect [--json] [--check] [--sdk-dir DIR]... [BUNDLE...]\n"
    "\n"
    "Prints each plug-in bundle's record, validation verdict and exported form.\n"
    "With no BUNDLE, inspects the sample bundles shipped in examples/ (and\n"
    "registers their sample SDKs).\n"
    "  --json         one JSON document on standard output\n"
    "  --check        exit with status 1 when any plug-in is invalid\n"
    "  --sdk-dir DIR  look extension-point SDKs up in DIR first (repeatable)\n";

struct Options {
  bool json = false;
  bool check = false;
  std::vector<std::string> sdkDirs;
  std::vector<std::string> bundles;
};

bool parse(int argc, char** argv, Options& options) {
  static const option kLong[] = {{"json", no_argument, nullptr, 'j'},
                                 {"check", no_argument, nullptr, 'c'},
                                 {"sdk-dir", required_argument, nullptr, 's'},
                                 {"help", no_argument, nullptr, 'h'},
                                 {nullptr, 0, nullptr, 0}};
  int c;
  while ((c = getopt_long(argc, argv, "jcs:h", kLong, nullptr)) != -1) {
    switch (c) {
      case 'j':
        options.json = true;
        break;
      case 'c':
        options.check = true;
        break;
      case 's':
        options.sdkDirs.push_back(optarg);
        break;
      case 'h':
        std::fputs(kUsage, stdout);
        std::exit(0);
      default:
        return false;
    }
  }
  for (int i = optind; i < argc; ++i) options.bundles.push_back(argv[i]);
  return true;
}

// Puts dirs in front of the SDK search path that the model reads.
void prependSdkDirs(const std::vector<std::string>& dirs) {
  if (dirs.empty()) return;
  std::string value;
  for (const std::string& d : dirs) value += d + ":";
  const char* current = std::getenv("VANTREL_SDK_DIRS");
  value += current && *current ? current : "/usr/share/vantrel/sdks";
  setenv("VANTREL_SDK_DIRS", value.c_str(), 1);
}

Value verdictValue(const Inspection& in) {
  if (!in.built)
    return Value(Dictionary{{"valid", Value::boolean(false)}, {"message", Value(in.failure)}});
  if (!in.verdict) return Value(Dictionary{{"valid", Value::boolean(true)}});
  return Value(Dictionary{{"valid", Value::boolean(false)},
                          {"domain", Value(in.verdict->domain)},
                          {"code", Value::integer(in.verdict->code)},
                          {"message", Value(in.verdict->description())}});
}

Value jsonValue(const Inspection& in) {
  std::vector<Value> log(in.log.begin(), in.log.end());
  std::vector<Dictionary::Entry> entries = {
      {"path", Value(in.path)},
      {"verdict", verdictValue(in)},
      {"log", Value(vantrel::lmo::Array(std::move(log)))},
  };
  if (in.built) {
    entries.insert(entries.end(), {{"identifier", Value(in.identifier)},
                                   {"version", Value(in.version)},
                                   {"protocol", Value(in.protocol)},
                                   {"extensionPoint", Value(in.extensionPoint)},
                                   {"style", Value(in.style)},
                                   {"form", Value(in.form)}});
    if (!in.containingApp.empty()) entries.emplace_back("containingApp", Value(in.containingApp));
  }
  return Value(Dictionary::fromEntries(std::move(entries)));
}

void printField(const char* name, const std::string& value) {
  std::printf("  %-16s %s\n", name, value.empty() ? "-" : value.c_str());
}

void printText(const Inspection& in) {
  std::printf("%s\n", in.path.c_str());
  if (!in.built) {
    printField("verdict", "not built: " + in.failure);
  } else {
    printField("identifier", in.identifier);
    printField("version", in.version);
    printField("protocol", in.protocol);
    printField("extension point", in.extensionPoint);
    printField("style", in.style);
    printField("containing app", in.containingApp);
    printField("verdict", in.verdict
                              ? vantrel::base::format("invalid (%@ %d): %@", in.verdict->domain,
                                                      in.verdict->code, in.verdict->description())
                              : std::string("valid"));
  }
  for (const std::string& line : in.log) printField("log", line);
  if (in.built) {
    std::printf("  form             %s\n",
                vantrel::lmo::toJson(Value(in.form), JsonStyle::kPretty, 2).c_str());
  }
}

bool isValid(const Inspection& in) {
  return in.built && !in.verdict;
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  if (!parse(argc, argv, options)) {
    std::fputs(kUsage, stderr);
    return 2;
  }
  if (options.bundles.empty()) {
    options.bundles = vantrel::tools::findPlugInBundles(VANTREL_EXAMPLES_DIR "/bundles");
    options.sdkDirs.push_back(VANTREL_EXAMPLES_DIR "/sdks");
  }
  prependSdkDirs(options.sdkDirs);

  std::vector<Inspection> results;
  for (const std::string& path : options.bundles) {
    results.push_back(vantrel::tools::inspectBundle(path));
  }

  bool allValid = true;
  std::vector<Value> documents;
  for (size_t i = 0; i < results.size(); ++i) {
    allValid = allValid && isValid(results[i]);
    if (options.json) {
      documents.push_back(jsonValue(results[i]));
    } else {
      if (i > 0) std::printf("\n");
      printText(results[i]);
    }
  }
  if (options.json) {
    Value all(vantrel::lmo::Array(std::move(documents)));
    std::printf("%s\n", vantrel::lmo::toJson(all, JsonStyle::kPretty).c_str());
  }
  return options.check && !allValid ? 1 : 0;
}
