#include "vitd_helper/command_table.h"

#include <array>

namespace vtr {
namespace {

using R = VTRHMessageResponder;

constexpr std::array kCommands = {
    Command{"migratePreferencesFile:", &R::migratePreferencesFile},
    Command{"prepareLogContainer:", &R::prepareLogContainer},
    Command{"prepareWorkContainer:", &R::prepareWorkContainer},
    Command{"removeWorkContainer:", &R::removeWorkContainer},
    Command{"createDeviceManifest:", &R::createDeviceManifest},
    Command{"createHardLink:", &R::createHardLink},
    Command{"restoreAttributes:", &R::restoreAttributes},
    Command{"moveStagingToFinal:", &R::moveStagingToFinal},
    Command{"deleteNvram:", &R::deleteNvram},
    Command{"writeNvram:", &R::writeNvram},
    Command{"reboot:", &R::reboot},
    Command{"quitHelper:", &R::quitHelper},
    Command{"shrinkDataPartition:", &R::shrinkDataPartition},
    Command{"expandDataPartition:", &R::expandDataPartition},
};

}  // namespace

const Command* FindCommand(std::string_view key) {
  for (const Command& command : kCommands) {
    if (command.key == key) return &command;
  }
  return nullptr;
}

}  // namespace vtr
