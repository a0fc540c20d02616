#include <gtest/gtest.h>

#include "Client/VSLSandboxToken.h"
#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLReply.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Support/TempRoot.h"

using namespace vsl;

TEST(SandboxToken, IssuedOnlyToSandboxedClientsForEnterpriseDataAndGroupContainers) {
    test::TempRoot root;
    auto enterprise = VSLUserIdentity::create(501, 501, "/e", std::string("E1"), kVSLPersonaTypeEnterprise, 1001);
    auto personal = VSLUserIdentity::create(501, 501, "/p", std::string("P"), kVSLPersonaTypePersonal, 1000);
    const VSLAuditToken token = {501, 501, 501, 501, 501, 777, 0, 12345};
    auto client = [&](bool sandboxed) {
        return VSLClientIdentity::create("com.example.app", 501, 501, 777, enterprise, Value::dictionary({}),
                                         sandboxed, token, false);
    };
    auto tokenFor = [&](const VSLUserIdentityRef& user, VSLContainerClass c, bool sandboxed,
                        const std::string& path) -> std::optional<std::string> {
        auto identity = VSLConcreteContainerIdentity::containerIdentityWithUUID(Uuid::random(), user,
                                                                                "com.example.app", c, nullptr);
        auto metadata = VSLMetadata::initWithContainerIdentity(identity, std::nullopt, path, std::nullopt);
        VSLReply reply(nullptr);
        issueSandboxExtension(reply, "ReplySandboxToken", *metadata, client(sandboxed));
        auto values = reply.values();
        auto it = values.find("ReplySandboxToken");
        if (it == values.end()) return std::nullopt;
        return *it->second.stringValue();
    };
    std::string path = root.at("private/var/PersonaVolumes/E1/Containers/Data/Application/X");

    for (VSLContainerClass c : {2, 4, 6, 10}) {
        auto t = tokenFor(enterprise, c, true, path);
        ASSERT_TRUE(t) << "class " << c;
        EXPECT_TRUE(client::verifySandboxToken(*t, "com.tarrow.sandbox.container", path, token, root.path()));
        EXPECT_FALSE(client::verifySandboxToken(*t, "com.tarrow.sandbox.container", path + "/../Y", token, root.path()))
            << "that path and no other";
        EXPECT_FALSE(client::verifySandboxToken(*t, "com.tarrow.sandbox.application-group", path, token, root.path()));
    }
    auto group = tokenFor(enterprise, 7, true, path);
    ASSERT_TRUE(group);
    EXPECT_TRUE(client::verifySandboxToken(*group, "com.tarrow.sandbox.application-group", path, token, root.path()));

    EXPECT_FALSE(tokenFor(enterprise, 2, false, path)) << "never for a client that is not sandboxed";
    EXPECT_FALSE(tokenFor(personal, 2, true, path)) << "never for a personal container";
    for (VSLContainerClass c : {1, 3, 9, 11, 12, 13}) EXPECT_FALSE(tokenFor(enterprise, c, true, path)) << c;
}
