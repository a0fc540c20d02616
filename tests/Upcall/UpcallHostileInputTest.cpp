// What the upcall channel does with ids it does not serve, malformed packbuffs and
// broken frames: the right code or no reply, never a container, and the daemon serves on.
#include <gtest/gtest.h>

#include "Client/VSLUpcallProtocol.h"
#include "Support/TempRoot.h"
#include "Upcall/UpcallTestSupport.h"

using namespace vsl;
using namespace vsl::client;
using namespace vsl::test;
using packbuff_test::Bytes;

namespace {

const char* const kApplications = "private/var/mobile/Containers/Data/Application";

Bytes withUID() {
    Bytes b;
    b.header(1, VW_KERN_REQUEST_UID, mobileUID());
    return b;
}

}  // namespace

TEST(UpcallHostileInput, IdsTheServerDoesNotServe) {
    DaemonProcess daemon;
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    auto c = connectUpcall(daemon);
    ASSERT_TRUE(c);
    VSLUpcallQuery q;
    q.codeSignatureID = "com.example.app";
    q.uid = mobileUID();
    q.personaID = kVSLUpcallNoPersona;
    const std::string request = *packUpcallQuery(q);

    ASSERT_TRUE(c->sendRequest(kVSLUpcallUnusedID, request));
    UpcallReplyFrame frame;
    ASSERT_EQ(VSLUpcallStatus::Ok, c->receiveReply(&frame, kUpcallWait));
    EXPECT_EQ(kVSLUpcallUnusedID + 100, frame.messageId);
    EXPECT_EQ(kVSLUpcallBadID, frame.returnCode);
    EXPECT_TRUE(frame.packbuff.empty());
    EXPECT_TRUE(entriesOf(daemon.at(kApplications)).empty());

    // A foreign id gets nothing: the next reply on the connection is the valid request's.
    ASSERT_TRUE(c->sendRequest(7, request));
    ASSERT_TRUE(c->sendRequest(kVSLUpcallGetProcessContainersID + 1000, request));
    UpcallAnswer a = askUpcall(*c, request);
    ASSERT_EQ(VSLUpcallStatus::Ok, a.status) << a.error;
    EXPECT_EQ(kVSLUpcallGetProcessContainersID + 100, a.frame.messageId);
    EXPECT_EQ(0, a.frame.returnCode);
    EXPECT_EQ(1u, a.containers.status.value_or(0));
    EXPECT_EQ(1u, entriesOf(daemon.at(kApplications)).size());
    EXPECT_EQ(0, daemon.stop());
}

TEST(UpcallHostileInput, MalformedPackbuffsGetTheirCodeAndTouchNoContainer) {
    DaemonProcess daemon;
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    auto c = connectUpcall(daemon);
    ASSERT_TRUE(c);
    struct Case {
        const char* what;
        Bytes bytes;
        int32_t code;
    };
    std::vector<Case> cases;
    {
        Bytes b = withUID();
        b.header(2, VW_KERN_REQUEST_CODE_SIGNATURE_ID, 100).raw("com.exa").zeros(1).end();
        cases.push_back({"a string whose length runs past the end", b, kVSLUpcallFailure});
    }
    {
        Bytes b = withUID();
        packedString(b, VW_KERN_REQUEST_CODE_SIGNATURE_ID, "com.example.cut").zeros(4);
        cases.push_back({"a buffer cut short inside the next item header", b, kVSLUpcallFailure});
    }
    {
        Bytes b = withUID();
        b.header(2, VW_KERN_REQUEST_CODE_SIGNATURE_ID, 3).raw("ab").zeros(1).end();
        cases.push_back({"a string without its padding", b, kVSLUpcallFailure});
    }
    {
        Bytes b = withUID();
        b.header(7, VW_KERN_REQUEST_CODE_SIGNATURE_ID, 0).end();
        cases.push_back({"an unknown item type", b, kVSLUpcallFailure});
    }
    {
        Bytes b = withUID();
        b.header(1, VW_KERN_REQUEST_UID, 0).header(2, VW_KERN_REQUEST_CONTAINER_TYPE, 8).raw("1234567").zeros(1).end();
        cases.push_back({"a string where a number belongs", b, kVSLUpcallFailure});
    }
    {
        Bytes b;
        packedString(b, VW_KERN_REQUEST_CODE_SIGNATURE_ID, "com.example.app");
        b.header(1, 42, 1).end();
        cases.push_back({"an unknown key", b, kVSLUpcallInvalidArgument});
    }
    {
        Bytes b = withUID();
        packedString(b, VW_KERN_REQUEST_CODE_SIGNATURE_ID, std::string("com.example.app\0evil", 20)).end();
        cases.push_back({"a NUL inside a string", b, kVSLUpcallInvalidArgument});
    }
    {
        Bytes b = withUID();
        packedString(b, VW_KERN_REQUEST_APP_GROUP_ID, std::string("group.a\0b", 9));
        packedString(b, VW_KERN_REQUEST_CODE_SIGNATURE_ID, "com.example.app").end();
        cases.push_back({"a NUL inside a group", b, kVSLUpcallInvalidArgument});
    }
    {
        Bytes b;
        b.zeros(4);
        cases.push_back({"less than an end marker", b, kVSLUpcallMemoryFailure});
    }
    for (const Case& test : cases) {
        UpcallAnswer a = askUpcall(*c, asString(test.bytes));
        ASSERT_EQ(VSLUpcallStatus::Ok, a.status) << test.what << ": " << a.error;
        EXPECT_EQ(test.code, a.frame.returnCode) << test.what;
        EXPECT_TRUE(a.frame.packbuff.empty()) << test.what;
    }
    EXPECT_TRUE(entriesOf(daemon.at(kApplications)).empty());
    EXPECT_TRUE(entriesOf(daemon.at("private/var/mobile/Containers/Shared/AppGroup")).empty());
    EXPECT_EQ(0, daemon.stop());
}

TEST(UpcallHostileInput, BrokenFramesCloseOnlyTheirConnection) {
    DaemonProcess daemon;
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    auto lengthOnly = [](uint32_t length) {
        Bytes b;
        b.u32(length).u32(kVSLUpcallGetProcessContainersID);
        return asString(b);
    };
    const std::pair<const char*, std::string> frames[] = {
        {"over 1 MiB", lengthOnly((1u << 20) + 1)},
        {"too short for a message id", lengthOnly(3)},
    };
    for (const auto& [what, bytes] : frames) {
        auto c = connectUpcall(daemon);
        ASSERT_TRUE(c);
        ASSERT_TRUE(c->sendBytes(bytes));
        UpcallReplyFrame frame;
        EXPECT_EQ(VSLUpcallStatus::Closed, c->receiveReply(&frame, kUpcallWait)) << what;
    }
    // A peer that leaves inside a frame costs nothing; the channel still answers.
    {
        auto c = connectUpcall(daemon);
        ASSERT_TRUE(c->sendBytes(lengthOnly(64).append("partial")));
    }
    VSLUpcallQuery q;
    q.uid = 0;
    q.personaID = kVSLUpcallNoPersona;
    UpcallAnswer a = askUpcall(daemon, q);
    ASSERT_EQ(VSLUpcallStatus::Ok, a.status) << a.error;
    EXPECT_EQ(1u, a.containers.status.value_or(0));
    EXPECT_EQ(0, daemon.stop());
}

TEST(UpcallHostileInput, TheDaemonStopsWhenTheChannelCannotBeMade) {
    DaemonProcess daemon;
    // A directory where the socket belongs cannot be replaced by one.
    ASSERT_EQ(0, std::system(("mkdir -p '" + daemon.at("run/vesseld/com.tarrow.vesseld.upcall") + "'").c_str()));
    EXPECT_FALSE(daemon.start());
    EXPECT_NE(std::string::npos,
              readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log"))
                  .find("Failed to initialize kernel upcall interface."));
}
