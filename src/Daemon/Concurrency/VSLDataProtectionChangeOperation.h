// One protection-class change of a data container. It is recorded first as a
// pending-update file (PendingUpdates/<identifier>-<class>-<user>.plist, at most one per
// container: a newer request replaces it), then carried out by walking the
// container's user data, retried after the next unlock when the device was locked,
// and confirmed by deleting the file. A file left by a crash is run again at start.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "Daemon/Core/VSLContainerIdentity.h"
#include "Daemon/Core/VSLError.h"
#include "Daemon/Core/VSLUserIdentity.h"
#include "Platform/Value.h"
#include "Platform/WorkQueue.h"

namespace vsl {

class VSLMetadata;
using VSLMetadataRef = std::shared_ptr<const VSLMetadata>;

// Bits of the change type.
constexpr uint32_t kVSLChangeDirectories = 1;
constexpr uint32_t kVSLChangeFiles = 2;
constexpr uint32_t kVSLChangeNeverRaiseFiles = 4;

// A pending-update file, read and validated; `userIdentity` is none when the class
// needs none.
struct VSLDataProtectionUpdate {
    std::string identifier;
    uint64_t containerClass = 0;
    VSLUserIdentityRef userIdentity;
    int32_t protectionClass = 0;
    uint32_t changeType = 0;
    bool retryIfLocked = false;
    Uuid internalID;
};

class VSLDataProtectionChangeOperation : public std::enable_shared_from_this<VSLDataProtectionChangeOperation> {
    struct Passkey {};

public:
    using Ref = std::shared_ptr<VSLDataProtectionChangeOperation>;
    using CompletionBlock = std::function<void(bool wasLocked, const VSLErrorRef& error)>;

    static Ref dataProtectionChangeOperationWithContainerMetadata(VSLMetadataRef metadata, int32_t newClass,
                                                                  bool retryIfLocked, uint32_t changeType,
                                                                  std::shared_ptr<WorkQueue> queue);
    // A missing `internalChangeID` is replaced by a fresh one.
    static Ref initWithContainerMetadata(VSLMetadataRef metadata, int32_t newClass, bool retryIfLocked,
                                         uint32_t changeType, std::optional<Uuid> internalChangeID,
                                         std::shared_ptr<WorkQueue> queue,
                                         std::shared_ptr<VSLUserIdentityResolver> userIdentityCache);
    // Rebuilds the operation a pending-update file describes; the container must exist.
    static Ref dataProtectionChangeOperationAtURL(const std::string& url, std::shared_ptr<WorkQueue> queue,
                                                  VSLErrorRef* error);

    static std::optional<VSLDataProtectionUpdate> _readAndValidateDataProtectionUpdateAtURL(
        const std::optional<std::string>& url, VSLUserIdentityResolver& userIdentityCache, VSLErrorRef* error);
    // None when the identity cannot name a file (not a plain name component).
    static std::optional<std::string> urlForProtectionOperationWithContainerIdentity(
        const VSLContainerIdentity& identity);
    static bool deleteUpdateFileWithContainerIdentity(const VSLContainerIdentity& identity, VSLErrorRef* error);

    VSLDataProtectionChangeOperation(Passkey) {}

    // On the operation's queue.
    bool writeToDiskWithError(VSLErrorRef* error);
    bool _stillMostCurrentUpdate();
    bool _deleteUpdateFileWithError(VSLErrorRef* error);
    bool _onQueue_writeToDiskWithError(VSLErrorRef* error);
    bool _onQueue_stillMostCurrentUpdate();
    bool _onQueue_deleteUpdateFileWithError(VSLErrorRef* error);

    // Runs the change and settles it: completion, or parked on the lock-state queue.
    void performChangeOperation();
    bool _runChangeOperationNeedToRetry(bool* needRetry, VSLErrorRef* error);

    bool retryIfLocked() const { return retryIfLocked_; }
    bool retried() const { return retried_; }
    int32_t newDataProtectionClass() const { return newDataProtectionClass_; }
    uint32_t changeType() const { return changeType_; }
    const VSLMetadataRef& dataContainerMetadata() const { return dataContainerMetadata_; }
    const Uuid& internalChangeID() const { return internalChangeID_; }
    void setRetryStartBlock(std::function<void()> block) { retryStartBlock_ = std::move(block); }
    void setCompletionBlock(CompletionBlock block) { completionBlock_ = std::move(block); }

private:
    std::optional<std::string> url() const;
    bool walkRoot(const std::string& root, VSLErrorRef* error);

    bool retryIfLocked_ = false;
    bool retried_ = false;
    int32_t newDataProtectionClass_ = 0;
    uint32_t changeType_ = 0;
    VSLMetadataRef dataContainerMetadata_;
    std::function<void()> retryStartBlock_;
    CompletionBlock completionBlock_;
    Uuid internalChangeID_;
    std::shared_ptr<WorkQueue> queue_;
    std::shared_ptr<VSLUserIdentityResolver> userIdentityCache_;
};

}  // namespace vsl
