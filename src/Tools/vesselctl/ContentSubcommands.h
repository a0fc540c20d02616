// vesselctl's subcommands for the content of containers:
//   wipe ID                        wipeContainer (a plug-in data container)
//   wipe-content ID CLASS          deleteContainerContent
//   stage-shared GROUP SRC DEST    stageSharedContent (paths relative to the container)
//   assets-path [ID] [--relative] [--create]   userManagedAssetsPath
//   assets-delete ID PATH          deleteUserManagedAsset (PATH relative to the assets directory)
#pragma once

#include <optional>
#include <string>

#include "Platform/Value.h"

// As subcommandRequest (Subcommands.h).
std::optional<vsl::Dictionary> contentSubcommandRequest(int argc, char** argv, int* index, std::string* error);

extern const char* const kContentSubcommandUsage;
