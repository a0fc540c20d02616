// End to end: listing a class (command 1) is a first use of its index like any
// lookup, and mirrors what it finds into the kernel sandbox state.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <set>

#include "Platform/SandboxState.h"
#include "Platform/SystemRoot.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

std::set<std::string> sandboxIdentifiers(const DaemonProcess& daemon, uid_t uid) {
    setSystemRoot(daemon.root());
    std::set<std::string> identifiers;
    EXPECT_EQ(0, SandboxState::iterateItems(uid, [&](const SandboxContainerItem& item) {
                  if (item.type == 1) identifiers.insert(item.identifier);
              }));
    return identifiers;
}

}  // namespace

TEST(ClassListing, ABuildingListingMirrorsTheClassIntoTheSandboxState) {
    DaemonProcess daemon;
    std::string admin = daemon.addClient("admin", "com.example.admin",
                                         dict({{"com.tarrow.private.Vesselry.allowed", Value::boolean(true)}}));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    const uid_t mobile = ::geteuid() == 0 ? 501 : ::geteuid();
    for (const char* identifier : {"com.example.one", "com.example.two"})
        ASSERT_EQ(1u, daemon.run(admin, {"createOrLookup", std::string("Identifier=") + identifier, "ContainerClass=2",
                                         "CreateIfNecessary=true"})
                          .code());
    EXPECT_EQ((std::set<std::string>{"com.example.one", "com.example.two"}), sandboxIdentifiers(daemon, mobile))
        << "creation mirrors";

    // The state is lost while the daemon is down (as kernel memory is at a boot, without
    // the boot clean-up); the next use of the class index must mirror it again.
    ASSERT_EQ(0, daemon.stop());
    ASSERT_EQ(0, std::system(("rm -rf '" + daemon.at("run/vesseld/sandbox") + "'").c_str()));
    ASSERT_TRUE(daemon.start()) << readFile(daemon.at("vesseld.stderr"));
    auto listed = daemon.run(admin, {"containersWithClass", "ContainerClass=2"});
    ASSERT_EQ(1u, listed.code()) << listed.err;
    const Value* ids = listed.reply.find("ReplyIdsArray");
    ASSERT_TRUE(ids && ids->arrayValue());
    EXPECT_EQ(2u, ids->arrayValue()->size());
    EXPECT_EQ((std::set<std::string>{"com.example.one", "com.example.two"}), sandboxIdentifiers(daemon, mobile));
    EXPECT_EQ(0, daemon.stop());
}
