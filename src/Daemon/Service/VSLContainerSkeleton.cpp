#include "Daemon/Service/VSLContainerSkeleton.h"

#include "Daemon/Core/VSLErrorCodes.h"

namespace vsl {

std::optional<std::vector<std::string>> subdirectoriesForContainerClass(VSLContainerClass containerClass,
                                                                        uint64_t* code) {
    if (!isValidContainerClass(containerClass)) {
        if (code) *code = kVSLErrorUnexpectedClass;
        return std::nullopt;
    }
    const auto& skeleton = containerClassTraits(containerClass).skeleton;
    return std::vector<std::string>(skeleton.begin(), skeleton.end());
}

}  // namespace vsl
