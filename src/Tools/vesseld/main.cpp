// vesseld: the container daemon.
//   vesseld [--root DIR] [--init] [--debug]
// --root (or VESSELD_ROOT) selects the system root; --init first lays down a default
// configuration there so the daemon runs without privileges or set-up.
#include <pthread.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>

#include "Daemon/Service/VSLService.h"
#include "Daemon/Service/VSLStartup.h"
#include "Daemon/Upcall/VSLUpcallServer.h"
#include "Platform/DeviceFacts.h"
#include "Platform/Log.h"
#include "Platform/ServiceManager.h"
#include "Platform/SystemRoot.h"
#include "Platform/Transaction.h"
#include "Platform/WorkQueue.h"
#include "ScratchRoot.h"

using namespace vsl;

namespace {

void usage() {
    std::fprintf(stderr, "usage: vesseld [--root DIR] [--init] [--debug]\n");
}

// Handlers still running when a stop is asked for get this long; then the process
// exits under them. Open transactions get kTransactionGrace more. Whatever happens,
// kStopLimit after the signal the process is gone.
constexpr auto kHandlerGrace = std::chrono::seconds(2);
constexpr auto kTransactionGrace = std::chrono::seconds(1);
constexpr auto kStopLimit = std::chrono::seconds(4);

// Signals are taken by one thread so that no handler runs inside daemon code. The
// first SIGTERM or SIGINT starts a clean stop; a second one, or the stop limit,
// ends the process at once.
void startSignalThread() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGTERM);
    sigaddset(&set, SIGINT);
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
    std::thread([set] {
        int sig = 0;
        sigwait(&set, &sig);
        notifyServiceStopping();
        stopMainLoop();
        const auto limit = std::chrono::duration_cast<std::chrono::seconds>(kStopLimit).count();
        const timespec wait{static_cast<time_t>(limit), 0};
        const bool again = sigtimedwait(&set, nullptr, &wait) > 0;
        LogWrite(kLogLevelNotice, "main", again ? "Stopping at once on a second signal"
                                                : "Stopping at once: the clean stop did not end in time");
        ::_exit(0);
    }).detach();
}

}  // namespace

int main(int argc, char** argv) {
    std::string root = std::getenv("VESSELD_ROOT") ? std::getenv("VESSELD_ROOT") : "/";
    bool init = false;
    for (int i = 1; i < argc; i++) {
        std::string a = argv[i];
        if (a == "--root" && i + 1 < argc) {
            root = argv[++i];
        } else if (a == "--init") {
            init = true;
        } else if (a == "--debug") {
            setDebugLogging(true);
        } else {
            usage();
            return 2;
        }
    }
    signal(SIGPIPE, SIG_IGN);
    // Connections and tree walks draw on one descriptor table: take all the hard limit allows.
    struct rlimit files;
    if (::getrlimit(RLIMIT_NOFILE, &files) == 0 && files.rlim_cur < files.rlim_max) {
        files.rlim_cur = files.rlim_max;
        ::setrlimit(RLIMIT_NOFILE, &files);
    }
    if (init && ::mkdir(root.c_str(), 0755) != 0 && errno != EEXIST) {
        std::fprintf(stderr, "vesseld: cannot create %s: %s\n", root.c_str(), std::strerror(errno));
        return 1;
    }
    setSystemRoot(root);
    if (init) {
        std::string error;
        if (!initializeScratchRoot(&error)) {
            std::fprintf(stderr, "vesseld: --init failed: %s\n", error.c_str());
            return 1;
        }
    }
    reloadDeviceFacts();
    // Asked-for verbosity wins, whichever asked: --debug, VESSELD_DEBUG or device.plist.
    if (auto level = deviceFacts().logLevel; level && *level > logVerbosity()) setLogVerbosity(*level);
    // Before any thread starts: taking the passed sockets clears their environment variables.
    adoptActivatedSockets();
    startSignalThread();

    auto listenerQueue = WorkQueue::serial("com.tarrow.vesseld.listener");
    auto startup = std::make_shared<Transaction>("com.tarrow.vesseld.startup");
    listenerQueue->async([startup] { vesseld_init(startup); });
    // Queued behind start-up, as every new connection is: none is served before it.
    listenerQueue->async([] { notifyServiceReady(); });

    std::string error;
    auto service = VSLService::start(listenerQueue, &error);
    if (!service) {
        LogWrite(kLogLevelError, "main", "unable to start ipc service!");
        std::fprintf(stderr, "vesseld: unable to start ipc service: %s\n", error.c_str());
        // A second daemon on the same root must not linger without serving.
        return 1;
    }
    std::fprintf(stderr, "vesseld: serving on %s\n", defaultIpcServicePath().c_str());

    runMainLoop();

    // A handler blocked on a slow disk or a FIFO must not keep the daemon alive: past
    // the grace periods, exit under whatever still runs rather than tear it down.
    const bool upcallsDone = stopKernelUpcallServer(kHandlerGrace);
    const bool handlersDone = service->stop(kHandlerGrace) && upcallsDone;
    if (!handlersDone) LogWrite(kLogLevelNotice, "main", "Stopping with request handlers still running");
    const bool transactionsDone = waitForNoTransactions(kTransactionGrace);
    if (!transactionsDone)
        LogWrite(kLogLevelNotice, "main", "Stopping with %llu transactions open", (unsigned long long)openTransactionCount());
    closeLogFile();
    if (!handlersDone || !transactionsDone) ::_exit(0);
    return 0;
}
