// The first stage of deleting containers: for each one, drop its code-signing
// records (bundle classes), move its directory onto death row and forget it in the
// container cache. From then on no lookup finds it; the death-row directory is
// emptied later, in the background.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <vector>

#include "Daemon/Concurrency/VSLCommandQueue.h"
#include "Daemon/Core/VSLContainerIdentity.h"
#include "Daemon/Core/VSLError.h"

namespace vsl {

class VSLMetadata;

class VSLCommandStageForDelete : public VSLCommand {
public:
    // Told the code of the error the run ends with.
    using OnError = std::function<void(uint64_t code)>;

    // Plain or concrete identities, staged in order. Without `useLocking` the caller
    // must already hold the global write lock when the command runs.
    static std::shared_ptr<VSLCommandStageForDelete> commandForStageForDeleteWithContainerIdentities(
        std::vector<VSLContainerIdentityRef> containerIdentities, bool useLocking, OnError onError);
    // Group containers staged because nothing named them: each is kept if a
    // registration has named its group again by the time the command runs.
    static std::shared_ptr<VSLCommandStageForDelete> commandForStageForDeleteOfUnreferencedGroups(
        std::vector<VSLContainerIdentityRef> containerIdentities, bool useLocking, OnError onError);
    VSLCommandStageForDelete(std::vector<VSLContainerIdentityRef> containerIdentities, bool useLocking,
                             OnError onError, bool onlyUnreferencedGroups = false);

    // The client command stageContainerForDelete.
    static constexpr uint64_t kCommandNumber = 3;
    uint64_t command() const override { return kCommandNumber; }
    // False only when forgetting a container in the cache failed (or on an
    // exception); a container that was not found is reported through `onError`
    // and the code but does not fail the run.
    bool fromQueue(const std::shared_ptr<VSLCommandQueue>& queue, uint64_t* code) override;

    bool useLocking() const { return useLocking_; }
    const std::vector<VSLContainerIdentityRef>& containerIdentities() const { return containerIdentities_; }
    const OnError& onError() const { return onError_; }

private:
    bool stageAll(const std::shared_ptr<VSLCommandQueue>& queue, VSLErrorRef* pending);
    bool groupIsNamedAgain(const VSLMetadata& container) const;

    bool useLocking_;
    bool onlyUnreferencedGroups_;
    std::vector<VSLContainerIdentityRef> containerIdentities_;
    OnError onError_;
};

}  // namespace vsl
