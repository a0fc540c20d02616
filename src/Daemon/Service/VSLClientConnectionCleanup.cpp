// The start-up clean-ups: they return at once and finish on the background queue,
// each holding a keep-alive transaction until its completion has run.
#include <cerrno>
#include <set>
#include <string>
#include <vector>

#include "Daemon/Core/VSLUserIdentityCache.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Platform/Log.h"
#include "Platform/Transaction.h"

namespace vsl {

namespace {

constexpr const char* kVesselCleanup = "-[VSLClientConnection vesselCleanupWithCompletion:]";

// Appends the items of `directory`; a missing directory holds none.
// Personas of one uid share a home: each directory is listed once.
void appendItemsOf(const std::optional<std::string>& directory, const char* failureFormat,
                   std::set<std::string>& listedDirectories, std::vector<std::string>& items) {
    if (!directory || !listedDirectories.insert(*directory).second) return;
    VSLErrorRef error;
    auto listed = VSLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*directory, &error);
    if (!listed) {
        if (!isPOSIXError(error, ENOENT)) LogWrite(kLogLevelError, kVesselCleanup, failureFormat, *directory, error);
        return;
    }
    for (const auto& item : *listed) items.push_back(item.path);
}

}  // namespace

void VSLClientConnection::vesselCleanupWithCompletion(std::function<void()> completion) {
    auto transaction = std::make_shared<Transaction>("com.tarrow.vesseld.cleanup");
    auto config = VSLGlobalConfiguration::sharedInstance();
    // Whatever is in staging now was being built when the last process ended: no
    // request of this process has started yet.
    std::set<std::string> listed;
    std::vector<std::string> items;
    appendItemsOf(config->stagingDirectory(), "Failed to get items at global staging URL: %@ : %@", listed, items);
    userIdentityCache()->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const VSLUserIdentityRef& user) {
        appendItemsOf(config->stagingDirectoryURLForUserIdentity(user, kVSLClassApplicationData),
                      "Failed to get items at per-user staging URL: %@ : %@", listed, items);
    });
    auto self = shared_from_this();
    backgroundQueue()->async([self, items = std::move(items), transaction, completion = std::move(completion)] {
        for (const auto& item : items) {
            VSLErrorRef error;  // logged where it was made
            self->_moveItemAtURLToDeathRow(item, true, false, &error);
        }
        self->deleteContainersOnDeathRowWithCompletion([transaction, completion](uint64_t) {
            backgroundQueue()->async([transaction, completion] {
                if (completion) completion();
                transaction->close();
            });
        });
    });
}

}  // namespace vsl
