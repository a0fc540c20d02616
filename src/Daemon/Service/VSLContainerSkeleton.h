// The skeleton of a new container: the subdirectories each class starts with,
// relative to the container, parents before children.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "Daemon/Core/VSLContainerClass.h"

namespace vsl {

// None (with `code` set to 20) for a class outside 1..13.
std::optional<std::vector<std::string>> subdirectoriesForContainerClass(VSLContainerClass containerClass,
                                                                        uint64_t* code);

}  // namespace vsl
