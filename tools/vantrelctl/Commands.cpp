#include "tools/vantrelctl/Command.h"

namespace vantrel::ctl {

const std::vector<Command>& commands() {
  static const std::vector<Command> all = {
      statusCommand(), listCommand(),    matchCommand(),   showCommand(), whyCommand(),
      electCommand(),  unelectCommand(), resetCommand(),   holdCommand(), releaseCommand(),
      addCommand(),    removeCommand(),  monitorCommand(),
  };
  return all;
}

}  // namespace vantrel::ctl
