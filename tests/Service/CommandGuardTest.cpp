// The dispatcher's run of one command row: an exception in a handler is an answer
// (code 40), not the end of the daemon, and the message's deferred work runs on
// every path.
#include <gtest/gtest.h>

#include <stdexcept>

#include "Daemon/Concurrency/VSLCommandQueue.h"
#include "Daemon/Service/VSLProcessIPCEvent.h"
#include "Support/TempRoot.h"

using namespace vsl;

namespace {

int gDeferredRuns = 0;

class DeferredWork : public VSLCommand {
public:
    uint64_t command() const override { return 3; }
    bool fromQueue(const std::shared_ptr<VSLCommandQueue>&, uint64_t*) override {
        gDeferredRuns++;
        return true;
    }
};

// Defers work and writes a reply key, then fails the way a bad allocation would.
void throwingHandler(const Value&, const VSLReplyRef& reply, const VSLClientConnectionRef& connection, uint64_t*) {
    connection->commandQueue()->insertCommand(std::make_shared<DeferredWork>());
    reply->set("ReplyPath", Value::string("/half/done"));
    throw std::runtime_error("out of something");
}

struct Sent {
    int count = 0;
    Value body;
};

VSLReplyRef replyInto(Sent& sent) {
    return std::make_shared<VSLReply>([&sent](const Value& body) {
        sent.count++;
        sent.body = body;
    });
}

VSLClientConnectionRef connectionWithQueue() {
    return VSLClientConnection::create(nullptr, true, false, false, std::nullopt, std::nullopt,
                                       VSLCommandQueue::create());
}

}  // namespace

TEST(CommandGuard, AThrowingHandlerAnswers40AndItsDeferredWorkStillRuns) {
    test::TempRoot root;
    gDeferredRuns = 0;
    Sent sent;
    auto reply = replyInto(sent);
    auto connection = connectionWithQueue();
    uint64_t code = 1;
    runCommandRow(VSLCommandRow{3, throwingHandler, "com.tarrow.private.Vesselry.allowed", 0x1}, dict({}), reply,
                  connection, &code);
    EXPECT_EQ(40u, code);
    EXPECT_EQ(1, gDeferredRuns);
    EXPECT_EQ(0u, connection->commandQueue()->pendingCount());
    reply->sendWithCode(code);
    ASSERT_EQ(1, sent.count);
    EXPECT_EQ(dict({{"ReplyError", Value::uint64(40)}}), sent.body) << "no half-written reply keys";

    // A row without a handler answers 49, and what was queued before it still runs.
    connection = connectionWithQueue();
    connection->commandQueue()->insertCommand(std::make_shared<DeferredWork>());
    code = 1;
    runCommandRow(VSLCommandRow{9, nullptr, "com.tarrow.private.Vesselry.allowed", 0x1}, dict({}),
                  replyInto(sent), connection, &code);
    EXPECT_EQ(49u, code);
    EXPECT_EQ(2, gDeferredRuns);
}

TEST(CommandGuardDeathTest, AnInternalBuildStopsOnAHandlerException) {
    test::TempRoot root;
    root.writeDeviceFacts(dict({{"InternalBuild", Value::boolean(true)}}));
    Sent sent;
    EXPECT_DEATH(
        {
            uint64_t code = 1;
            runCommandRow(VSLCommandRow{3, throwingHandler, "com.tarrow.private.Vesselry.allowed", 0x1}, dict({}),
                          replyInto(sent), connectionWithQueue(), &code);
        },
        "");
    root.writeDeviceFacts(dict({}));
}
