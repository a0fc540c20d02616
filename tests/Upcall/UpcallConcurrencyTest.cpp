// Many kernel requests at once: all answered, one at a time, while the client socket
// keeps serving.
#include <gtest/gtest.h>

#include <atomic>
#include <sstream>
#include <thread>

#include "Client/VSLUpcallProtocol.h"
#include "Support/TempRoot.h"
#include "Upcall/UpcallTestSupport.h"

using namespace vsl;
using namespace vsl::client;
using namespace vsl::test;

TEST(UpcallConcurrency, TenClientsAreServedOneAtATimeWhileClientCommandsGoOn) {
    DaemonProcess daemon;
    std::string admin =
        daemon.addClient("admin", "com.example.admin", dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)}}));
    // Each request holds the upcall queue for a while, so that they pile up.
    ASSERT_TRUE(daemon.start({"VESSELD_DEBUG=1", "VESSELD_TEST_UPCALL_DELAY_MS=300"}))
        << readFile(daemon.at("vesseld.stderr"));

    constexpr int kClients = 10;
    std::atomic<int> answered{0};
    std::vector<UpcallAnswer> answers(kClients);
    std::vector<std::thread> threads;
    for (int i = 0; i < kClients; i++) {
        threads.emplace_back([&, i] {
            VSLUpcallQuery q;
            q.codeSignatureID = "com.example.app" + std::to_string(i);
            q.uid = mobileUID();
            q.personaID = kVSLUpcallNoPersona;
            answers[i] = askUpcall(daemon, q);
            answered++;
        });
    }
    // The client socket answers while the upcalls wait their turn.
    int servedDuringUpcalls = 0;
    for (int i = 0; i < 3; i++) {
        auto r = daemon.run(admin, {"createOrLookup", "Identifier=com.example.client" + std::to_string(i),
                                    "ContainerClass=2", "CreateIfNecessary=true"});
        EXPECT_EQ(1u, r.code()) << r.err;
        if (answered.load() < kClients) servedDuringUpcalls++;
    }
    for (auto& t : threads) t.join();
    EXPECT_GT(servedDuringUpcalls, 0) << "client commands waited for the upcall queue";
    for (int i = 0; i < kClients; i++) {
        ASSERT_EQ(VSLUpcallStatus::Ok, answers[i].status) << i << ": " << answers[i].error;
        EXPECT_EQ(0, answers[i].frame.returnCode);
        EXPECT_EQ(1u, answers[i].containers.status.value_or(0)) << i;
    }
    EXPECT_EQ(0, daemon.stop());

    // One at a time: every request's first line is followed by its last before the next begins.
    std::istringstream log(readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log")));
    int begun = 0, finished = 0;
    bool inside = false, overlapped = false;
    for (std::string line; std::getline(log, line);) {
        if (line.find("server_get_process_containers: request size:") != std::string::npos) {
            if (inside) overlapped = true;
            inside = true;
            begun++;
        } else if (line.find("server_get_process_containers: packbuff bytes:") != std::string::npos) {
            if (!inside) overlapped = true;
            inside = false;
            finished++;
        }
    }
    EXPECT_EQ(kClients, begun);
    EXPECT_EQ(kClients, finished);
    EXPECT_FALSE(overlapped) << "two requests ran at once";
}
