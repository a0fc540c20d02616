// The request and reply packbuffs of the kernel's container query, as a client that
// plays the kernel builds and reads them.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Platform/Value.h"

namespace vsl::client {

struct VSLUpcallQuery {
    std::optional<std::string> codeSignatureID;
    std::optional<std::string> containerID;
    std::optional<std::string> applicationID;
    std::optional<uint32_t> uid;
    std::vector<std::string> appGroupIDs;
    std::optional<uint32_t> containerType;  // 0 application, 1 plug-in
    std::optional<std::string> systemContainerID;
    std::vector<std::string> systemGroupIDs;
    std::optional<uint32_t> personaID;  // 0xFFFFFFFF: none
};

// The request packbuff, items in key order; none when a string cannot be packed.
std::optional<std::string> packUpcallQuery(const VSLUpcallQuery& query);

struct VSLUpcallContainers {
    std::optional<std::string> home;
    std::optional<std::string> dataContainer;
    std::optional<std::string> temporaryDirectory;
    std::vector<std::pair<std::string, std::string>> groups;  // identifier, path; in reply order
    std::optional<std::string> systemContainer;
    std::vector<std::pair<std::string, std::string>> systemGroups;
    std::optional<uint32_t> status;  // 1 when every container was produced

    // For printing: the items under their names.
    Value value() const;
};

// Reads a reply packbuff; none with a reason for an item it does not know or cannot read.
std::optional<VSLUpcallContainers> unpackUpcallReply(const std::string& packbuff, std::string* error);

}  // namespace vsl::client
