// vesselctl's named subcommands: the first words of a command line that stand for a
// command with some of its keys. The container is named by the usual key=value
// arguments (Identifier= ContainerClass= UUID= PersonaUniqueString=) that follow.
//   info get KEY                   infoValueForKey
//   info set KEY [Value[:type]=V]  setInfoValue (no Value removes the key)
//   metadata                       metadata, with the info dictionary
//   recreate-structure             recreateDefaultStructure
//   regenerate-uuid                regenerateDirectoryUUID
//   du                             diskUsage
//   test-lock N on|off             setTestLock
//   retry-test N                   retryTest
//   groups, group-ids, system-container, system-groups, system-group GROUP
//                                  commands 13 to 17 (GroupSubcommands.cpp)
//   protect CLASS                  setDataProtection (ContainerClass 2 unless given)
#pragma once

#include <optional>
#include <string>

#include "Platform/Value.h"

// None when argv[*index] names no subcommand. Otherwise the request so far, with
// *index moved past the words used; a malformed subcommand sets *error.
std::optional<vsl::Dictionary> subcommandRequest(int argc, char** argv, int* index, std::string* error);

extern const char* const kSubcommandUsage;

// The group subcommands alone.
std::optional<vsl::Dictionary> groupSubcommandRequest(int argc, char** argv, int* index, std::string* error);
extern const char* const kGroupSubcommandUsage;
