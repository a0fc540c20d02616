#include "Daemon/Service/VSLStartup.h"

#include <syslog.h>

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>

#include "Client/VSLNotification.h"
#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Concurrency/VSLDataProtectionManager.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLCommandTable.h"
#include "Daemon/Service/VSLLockState.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Upcall/VSLUpcallServer.h"
#include "Platform/CrashAnnotation.h"
#include "Platform/DeviceFacts.h"
#include "Platform/DurableIO.h"
#include "Platform/Log.h"
#include "Platform/Notification.h"
#include "Platform/SandboxState.h"
#include "Platform/SystemRoot.h"

namespace vsl {

const std::shared_ptr<WorkQueue>& lockStateQueue() {
    static const auto queue = WorkQueue::serial("com.tarrow.vesseld.lockstate");
    return queue;
}

void vesseld_init(std::shared_ptr<Transaction> transaction) {
    durable::beginScope(durable::Scope::Startup);
    SignpostInterval interval(LogCategory::Ipc, "StartingUp", "");
    bool internal = deviceFacts().internalBuild;

    LogFileOptions options;
    options.directory = VSLGlobalConfiguration::sharedInstance()->logDirectory();
    options.maxBytes = internal ? 262144 : 102400;
    options.rotatedFiles = internal ? 4 : 1;
    if (!openLogFile(options)) {
        std::string path = joinPath(options.directory, options.name);
        syslog(LOG_ERR, "Failed to set up rotating logs at path %s", path.c_str());
    }
    setCrashAnnotationFile(joinPath(options.directory, "vesseld.crash"));
    LogWrite(kLogLevelDebug, "vesseld_init", "vesseld built at %s %s started", __DATE__, __TIME__);

    // A notification of the last process must not be taken for one of this process.
    if (int rc = withdrawNotification(client::kCleanupCompleteNotification))
        LogWrite(kLogLevelError, "vesseld_init", "Failed to withdraw cleanup-complete: %d", rc);

    if (!deathRowQueue() || !lockStateQueue()) {
        LogWrite(kLogLevelError, "vesseld_init", "Can't create dispatch queues.");
        std::abort();
    }
    if (validateCommandTable() != 0)
        LogWrite(kLogLevelError, "vesseld_init", "The command table is inconsistent; affected commands answer 49");
    // Opens the code-signing database now, so an unusable file stops the daemon at
    // start rather than at the first request; advance copies never outlive a restart.
    if (auto mapping = VSLCodeSigningMapping::sharedInstance()) {
        VSLErrorRef error;
        if (!mapping->removeAllAdvanceCopiesWithError(&error))
            LogWrite(kLogLevelError, "vesseld_init", "Failed to remove advance copies: %@", error);
    }

    // Before any table is written: a kill during a rewrite leaves its temporary file.
    if (int rc = SandboxState::removeTemporaryFiles())
        LogWrite(kLogLevelError, "vesseld_init", "Failed to remove temporary sandbox files: %d", rc);

    // An atomic rewrite that a kill stopped before its rename leaves a temporary file no
    // listing sees: journals, pending updates and status files are whole or absent.
    for (const std::string& directory : {VSLGlobalConfiguration::sharedInstance()->replaceDirectory(),
                                         VSLGlobalConfiguration::sharedInstance()->pendingUpdatesDirectory(),
                                         VSLGlobalConfiguration::sharedInstance()->libraryDirectory()})
        if (int rc = durable::removeTemporaryFiles(directory))
            LogWrite(kLogLevelError, "vesseld_init", "Failed to remove temporary files in %s: %d", directory, rc);

    // Every start: replacements a crash interrupted are settled before anything looks
    // at containers; their journals go to death row.
    VSLErrorRef replaceError;
    if (!VSLClientConnection::sharedClientConnection()->_recoverFromReplaceOperationsWithError(&replaceError))
        LogWrite(kLogLevelError, "vesseld_init", "Failed to recover replace operations: %@", replaceError);

    // Lock state first, so a change restarted below while the device is locked parks
    // on a suspended queue.
    registerForLockStateNotifications();
    VSLErrorRef protectionError;
    if (!VSLDataProtectionManager::defaultManager().restartPendingDataProtectionOperationsWithError(&protectionError))
        LogWrite(kLogLevelError, "vesseld_init", "Failed restarting pending data protection operations: %@",
                 protectionError);
    std::string upcallError;
    if (!startKernelUpcallServer(&upcallError)) {
        LogWrite(kLogLevelError, "vesseld_init", "Failed to initialize kernel upcall interface.");
        std::fprintf(stderr, "vesseld: Failed to initialize kernel upcall interface: %s\n", upcallError.c_str());
        closeLogFile();
        ::_exit(1);
    }

    // Every start: staging leftovers and whatever a crash left on death row are
    // destroyed in the background; waiters learn of it by the notification.
    auto bootCleanup = std::make_shared<SignpostInterval>(LogCategory::Startup, "BootCleanup", "");
    VSLClientConnection::sharedClientConnection()->vesselCleanupWithCompletion([bootCleanup] {
        if (int rc = postNotification(client::kCleanupCompleteNotification))
            LogWrite(kLogLevelError, "vesseld_init", "Failed to post cleanup-complete: %u", rc);
        bootCleanup->end("");
    });

    interval.end("");
    transaction->close();
}

}  // namespace vsl
