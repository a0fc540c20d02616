// libvessel: asking vesseld to put a prepared container in the place of an old one
// (an application update), or, without an old one, to make it permanent.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>

#include "Client/VSLConnection.h"
#include "Platform/Value.h"

namespace vsl::client {

// One container as the daemon names it: identifier, class, the UUID it answers to,
// and the persona it belongs to (none: the caller's own).
struct VSLContainerReference {
    std::string identifier;
    uint64_t containerClass = 0;
    Uuid uuid;
    std::optional<std::string> personaUniqueString;
};

// The replaceContainer request: "Old..." keys only when there is an old container.
Value replaceContainerRequest(const std::optional<VSLContainerReference>& oldContainer,
                              const VSLContainerReference& newContainer);

// The daemon's result code (1: replaced), or 0 with `error` set when no reply came.
uint64_t replaceContainer(VSLConnection& connection, const std::optional<VSLContainerReference>& oldContainer,
                          const VSLContainerReference& newContainer, std::string* error = nullptr,
                          std::optional<std::chrono::milliseconds> timeout = std::nullopt);

}  // namespace vsl::client
