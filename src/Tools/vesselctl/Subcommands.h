// Subcommands that stand for one protocol command with some of its keys: the words
// after the name build the request; key=value arguments add to it.
//   metadata | recreate-structure | regenerate-uuid     (Identifier= ContainerClass= ...)
//   test-lock N on|off | retry-test N | migrate | migrate-user
//   group-ids | system-container | system-groups | system-group GROUP   (GroupSubcommands.cpp)
//   wipe-content | stage-shared | assets-path | assets-delete           (ContentSubcommands.cpp)
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "Platform/Value.h"

// The request for `name` from its positional words (the ones without '='). None
// when the name is not one of these; a malformed line sets *error to the usage.
std::optional<vsl::Dictionary> namedRequest(const std::string& name, const std::vector<std::string>& words,
                                            std::string* error);
std::optional<vsl::Dictionary> groupRequest(const std::string& name, const std::vector<std::string>& words,
                                            std::string* error);
std::optional<vsl::Dictionary> contentRequest(const std::string& name, const std::vector<std::string>& words,
                                              std::string* error);

// {"Command": the protocol command with this name}.
vsl::Dictionary commandRequest(const char* commandName);
