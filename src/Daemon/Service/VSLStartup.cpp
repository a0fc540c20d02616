#include "Daemon/Service/VSLStartup.h"

#include <syslog.h>

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "Client/VSLNotification.h"
#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLCommandTable.h"
#include "Daemon/Service/VSLLockState.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Upcall/VSLUpcallServer.h"
#include "Platform/CrashAnnotation.h"
#include "Platform/DeviceFacts.h"
#include "Platform/DurableIO.h"
#include "Platform/Log.h"
#include "Platform/NamedSemaphore.h"
#include "Platform/Notification.h"
#include "Platform/SandboxState.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

constexpr const char* kInit = "vesseld_init";

// The first-boot clean-up's interval lives until its completion runs.
std::shared_ptr<SignpostInterval>& firstBootCleanupInterval() {
    static std::shared_ptr<SignpostInterval> interval;
    return interval;
}

void openRotatingLog() {
    const bool internal = deviceFacts().internalBuild;
    LogFileOptions options;
    options.directory = VSLGlobalConfiguration::sharedInstance()->logDirectory();
    options.maxBytes = internal ? 262144 : 102400;
    options.rotatedFiles = diskLoggingParameter();
    if (!openLogFile(options)) {
        std::string path = joinPath(options.directory, options.name);
        syslog(LOG_ERR, "Failed to set up rotating logs at path %s", path.c_str());
    }
    setCrashAnnotationFile(joinPath(options.directory, "vesseld.crash"));
    LogWrite(kLogLevelDebug, kInit, "vesseld built at %s %s started", __DATE__, __TIME__);
}

// Work that belongs to no step of its own but must precede every client.
void prepareForClients() {
    // A notification of the last process must not be taken for one of this process.
    if (int rc = withdrawNotification(client::kCleanupCompleteNotification))
        LogWrite(kLogLevelError, kInit, "Failed to withdraw cleanup-complete: %d", rc);
    if (validateCommandTable() != 0)
        LogWrite(kLogLevelError, kInit, "The command table is inconsistent; affected commands answer 49");
    // Opens the code-signing database now, so an unusable file stops the daemon at
    // start rather than at the first request.
    VSLCodeSigningMapping::sharedInstance();
    // Before any table is written: a kill during a rewrite leaves its temporary file.
    if (int rc = SandboxState::removeTemporaryFiles())
        LogWrite(kLogLevelError, kInit, "Failed to remove temporary sandbox files: %d", rc);
    // An atomic rewrite that a kill stopped before its rename leaves a temporary file no
    // listing sees: journals, pending updates and status files are whole or absent.
    const auto configuration = VSLGlobalConfiguration::sharedInstance();
    for (const std::string& directory : {configuration->replaceDirectory(), configuration->pendingUpdatesDirectory(),
                                         configuration->libraryDirectory()})
        if (int rc = durable::removeTemporaryFiles(directory))
            LogWrite(kLogLevelError, kInit, "Failed to remove temporary files in %s: %d", directory, rc);
}

}  // namespace

const std::shared_ptr<WorkQueue>& lockStateQueue() {
    static const auto queue = WorkQueue::serial("com.tarrow.vesseld.lockstate");
    return queue;
}

int diskLoggingParameter() { return deviceFacts().internalBuild ? 4 : 1; }

std::string firstBootSemaphoreName() { return semaphoreNameForSystemRoot(kFirstBootSemaphoreBase, systemRoot()); }

void set_first_boot_work_completed() {
    LogWrite(kLogLevelNotice, "set_first_boot_work_completed", "vesseld first boot cleanup complete");
    const std::string name = firstBootSemaphoreName();
    if (int rc = createSemaphore(name, 0444, 0))
        LogWrite(kLogLevelError, "set_first_boot_work_completed", "Failed to create semaphore %s: %s", name,
                 std::strerror(rc));
    if (int rc = postNotification(client::kRebootCleanupCompleteNotification))
        LogWrite(kLogLevelError, "set_first_boot_work_completed", "Failed to post reboot-cleanup-complete: %u", rc);
    if (auto& interval = firstBootCleanupInterval()) {
        interval->end("");
        interval.reset();
    }
}

void vesseld_init(std::shared_ptr<Transaction> transaction) {
    durable::beginScope(durable::Scope::Startup);
    SignpostInterval interval(LogCategory::Ipc, "StartingUp", "");
    openRotatingLog();

    if (!deathRowQueue() || !lockStateQueue()) {
        LogWrite(kLogLevelError, kInit, "Can't create dispatch queues.");
        std::abort();
    }
    // The lock-state queue starts in the device's state, so protection changes that the
    // every-start setup restarts on a locked device park on it until the unlock rather
    // than spin on a queue nobody has suspended yet. Registration comes later, in its
    // place; the callback keeps suspensions balanced, so acting twice is harmless.
    lock_state_notification_callback();
    auto connection = VSLClientConnection::sharedClientConnection();
    prepareForClients();

    // The marker is made only once the first-boot clean-up has completed, so a crash
    // during first-boot work repeats it at the next start.
    const bool firstBoot = !semaphoreExists(firstBootSemaphoreName());
    if (firstBoot) {
        LogWrite(kLogLevelNotice, kInit, "vesseld performing first boot initialization");
        SignpostInterval setup(LogCategory::Startup, "FirstBootSetup", "");
        connection->rebootVesselSetup();
    }
    {
        SignpostInterval setup(LogCategory::Startup, "BootSetup", "");
        connection->vesselSetup();
    }

    std::string upcallError;
    if (!startKernelUpcallServer(&upcallError)) {
        LogWrite(kLogLevelError, kInit, "Failed to initialize kernel upcall interface.");
        std::fprintf(stderr, "vesseld: Failed to initialize kernel upcall interface: %s\n", upcallError.c_str());
        closeLogFile();
        ::_exit(1);
    }

    registerForLockStateNotifications();

    if (firstBoot) {
        firstBootCleanupInterval() = std::make_shared<SignpostInterval>(LogCategory::Startup, "FirstBootCleanup", "");
        connection->rebootVesselCleanupWithCompletion(set_first_boot_work_completed);
    }
    auto bootCleanup = std::make_shared<SignpostInterval>(LogCategory::Startup, "BootCleanup", "");
    connection->vesselCleanupWithCompletion([bootCleanup] {
        if (int rc = postNotification(client::kCleanupCompleteNotification))
            LogWrite(kLogLevelError, kInit, "Failed to post cleanup-complete: %u", rc);
        bootCleanup->end("");
    });

    interval.end("");
    transaction->close();
}

}  // namespace vsl
