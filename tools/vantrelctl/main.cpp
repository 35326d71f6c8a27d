// vantrelctl: the command line people use vantreld through. Each command is
// one request (or a few) through the client library; see "vantrelctl help".

#include <cstdio>
#include <string>

#include "lmo/Protocol.h"
#include "tools/vantrelctl/Command.h"
#include "tools/vantrelctl/ExitStatus.h"

namespace {

using vantrel::ctl::Command;
using vantrel::ctl::commands;

std::string globalHelp() {
  return std::string(
             "Options (before or after the command):\n"
             "  -S, --service NAME  the daemon's service name, or its socket path when NAME\n"
             "                      starts with \"/\" (default ") +
         vantrel::protocol::kDefaultServiceName +
         ")\n"
         "      --json          machine output: one JSON document on standard output\n"
         "      --no-legend     no header row or footer, for scripts\n"
         "      --timeout SECS  give up on any request after SECS seconds (default 10)\n"
         "  -h, --help          this help, or the command's\n"
         "      --version       print the version\n";
}

const Command* find(const std::string& name) {
  for (const Command& c : commands()) {
    if (name == c.name) return &c;
  }
  return nullptr;
}

void printUsage(std::FILE* out) {
  std::fputs("usage: vantrelctl [OPTIONS] COMMAND [ARGS...]\n\nCommands:\n", out);
  for (const Command& c : commands()) std::fprintf(out, "  %-9s %s\n", c.name, c.summary);
  std::fprintf(out,
               "\n%s\nExit status: 0 done, 1 the daemon refused, 2 usage error, 3 the daemon\n"
               "cannot be reached. \"vantrelctl help COMMAND\" shows a command's help.\n",
               globalHelp().c_str());
}

void printCommandHelp(const Command& c, std::FILE* out) {
  std::fprintf(out, "usage: vantrelctl %s\n\n%s\n%s", c.synopsis, c.help.c_str(),
               globalHelp().c_str());
}

int usageError(const char* message, const std::string& detail) {
  if (message != nullptr) std::fprintf(stderr, "vantrelctl: %s%s\n", message, detail.c_str());
  printUsage(stderr);
  return vantrel::ctl::kExitUsage;
}

}  // namespace

int main(int argc, char** argv) {
  std::optional<vantrel::ctl::CommandLine> line = vantrel::ctl::parseGlobal(argc, argv);
  if (!line) return usageError(nullptr, "");
  if (line->global.version) {
    std::printf("vantrelctl %s\n", VANTREL_VERSION);
    return vantrel::ctl::kExitOk;
  }
  if (line->command == "help" || (line->command.empty() && line->global.help)) {
    if (line->words.empty()) {
      printUsage(stdout);
      return vantrel::ctl::kExitOk;
    }
    const Command* c = find(line->words[0]);
    if (c == nullptr || line->words.size() > 1) {
      return usageError("no such command: ", line->words[0]);
    }
    printCommandHelp(*c, stdout);
    return vantrel::ctl::kExitOk;
  }
  if (line->command.empty()) return usageError("no command given", "");
  const Command* command = find(line->command);
  if (command == nullptr) return usageError("unknown command: ", line->command);

  std::optional<vantrel::ctl::Arguments> arguments =
      vantrel::ctl::parseCommand(line->words, command->options, line->global);
  if (!arguments) {
    printCommandHelp(*command, stderr);
    return vantrel::ctl::kExitUsage;
  }
  if (line->global.help) {
    printCommandHelp(*command, stdout);
    return vantrel::ctl::kExitOk;
  }
  if (line->global.version) {
    std::printf("vantrelctl %s\n", VANTREL_VERSION);
    return vantrel::ctl::kExitOk;
  }
  const size_t count = arguments->operands().size();
  if (count < command->minOperands || count > command->maxOperands) {
    std::fprintf(stderr, "vantrelctl: %s: %s\n", command->name,
                 count < command->minOperands ? "missing argument" : "too many arguments");
    printCommandHelp(*command, stderr);
    return vantrel::ctl::kExitUsage;
  }
  vantrel::ctl::Session session(line->global.service, line->global.timeout);
  vantrel::ctl::Context context{line->global, *arguments, session};
  return command->run(context);
}
