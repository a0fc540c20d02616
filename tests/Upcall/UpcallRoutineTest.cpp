// The routine driven directly, as any transport would: only the kernel is served.
#include <gtest/gtest.h>

#include <string>

#include "Client/VSLUpcallMessages.h"
#include "Daemon/Upcall/VSLUpcallRoutine.h"
#include "Support/TempRoot.h"
#include "Upcall/UpcallTestSupport.h"

using namespace vsl;
using namespace vsl::test;

namespace {

// Every path below the root, for comparing before and after.
std::string treeOf(const std::string& root) {
    std::string out;
    std::string listing = "find '" + root + "' | sort";
    FILE* p = ::popen(listing.c_str(), "r");
    char line[4096];
    while (p && std::fgets(line, sizeof line, p)) out += line;
    if (p) ::pclose(p);
    return out;
}

}  // namespace

TEST(UpcallRoutine, ASenderOtherThanTheKernelGetsFailureAndChangesNothing) {
    TempRoot root;
    client::VSLUpcallQuery q;
    q.codeSignatureID = "com.example.app";
    q.uid = 501;
    q.appGroupIDs = {"group.example"};
    q.systemContainerID = "com.example.system";
    q.personaID = 0xFFFFFFFF;
    const std::string request = *client::packUpcallQuery(q);
    const std::string before = treeOf(root.path());

    VSLAuditToken token{501, 501, 501, 501, 501, 4321, 0, 77};
    std::string reply = "stale";
    EXPECT_EQ(5, server_get_process_containers(token, request.data(), request.size(), &reply));
    EXPECT_TRUE(reply.empty());
    EXPECT_EQ(before, treeOf(root.path()));
}
