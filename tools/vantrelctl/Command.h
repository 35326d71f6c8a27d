#pragma once
// One vantrelctl command: its name, its help, the options it takes and the
// function that runs it. Each command lives in its own file; commands()
// lists them in the order "vantrelctl --help" shows them.

#include <cstddef>
#include <string>
#include <vector>

#include "tools/vantrelctl/Options.h"
#include "tools/vantrelctl/Session.h"

namespace vantrel::ctl {

struct Context {
  const GlobalOptions& global;
  const Arguments& arguments;
  Session& session;
};

struct Command {
  const char* name;
  const char* synopsis;  // after "vantrelctl ", e.g. "list [--point ID]"
  const char* summary;   // one line for the command list
  std::string help;      // the rest of "vantrelctl help NAME", with an example
  std::vector<OptionSpec> options;
  size_t minOperands = 0;
  size_t maxOperands = static_cast<size_t>(-1);
  int (*run)(Context&) = nullptr;
};

const std::vector<Command>& commands();

Command statusCommand();
Command listCommand();
Command matchCommand();
Command showCommand();
Command electCommand();
Command unelectCommand();
Command resetCommand();
Command holdCommand();
Command releaseCommand();
Command addCommand();
Command removeCommand();
Command whyCommand();
Command monitorCommand();

}  // namespace vantrel::ctl
