#include "vitd_helper/command_table.h"

#include <array>

namespace vtr {
namespace {

using R = VTRHMessageResponder;

// Commands join this table as they are built.
constexpr std::array kCommands = {
    Command{"migratePreferencesFile:", &R::migratePreferencesFile},
    Command{"prepareLogContainer:", &R::prepareLogContainer},
    Command{"prepareWorkContainer:", &R::prepareWorkContainer},
    Command{"removeWorkContainer:", &R::removeWorkContainer},
    Command{"createDeviceManifest:", &R::createDeviceManifest},
    Command{"createHardLink:", &R::createHardLink},
    Command{"restoreAttributes:", &R::restoreAttributes},
    Command{"moveStagingToFinal:", &R::moveStagingToFinal},
};

}  // namespace

const Command* FindCommand(std::string_view key) {
  for (const Command& command : kCommands) {
    if (command.key == key) return &command;
  }
  return nullptr;
}

}  // namespace vtr
