#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include "Platform/SandboxExtension.h"
#include "Platform/SystemRoot.h"

using namespace vsl;

TEST(SandboxExtension, TokenOpensExactlyOnePathClassAndProcess) {
    char dir[] = "/tmp/vessel-sbx-XXXXXX";
    ASSERT_TRUE(mkdtemp(dir));
    setSystemRoot(dir);
    const SandboxAuditToken process = {501, 501, 501, 501, 501, 4242, 0, 99};
    const std::string cls = "com.tarrow.sandbox.container";
    const std::string path = std::string(dir) + "/private/var/mobile/Containers/Data/Application/X";

    auto token = issueSandboxFileExtension(cls, path, process);
    ASSERT_TRUE(token);
    std::string key = sandboxExtensionKeyPath();
    struct stat st;
    ASSERT_EQ(0, stat(key.c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 0777) << "the key is the daemon's alone";

    EXPECT_TRUE(verifySandboxFileExtension(*token, cls, path, process, key));
    EXPECT_FALSE(verifySandboxFileExtension(*token, cls, path + "/..", process, key));
    EXPECT_FALSE(verifySandboxFileExtension(*token, cls, path + "Y", process, key));
    EXPECT_FALSE(verifySandboxFileExtension(*token, "com.tarrow.sandbox.application-group", path, process, key));
    SandboxAuditToken recycled = process;
    recycled[7] = 100;  // same pid, another process
    EXPECT_FALSE(verifySandboxFileExtension(*token, cls, path, recycled, key));
    std::string tampered = *token;
    tampered.back() = tampered.back() == '0' ? '1' : '0';
    EXPECT_FALSE(verifySandboxFileExtension(tampered, cls, path, process, key));
    EXPECT_FALSE(verifySandboxFileExtension(*token, cls, path, process, key + ".missing"));

    // The key stays for the boot: a second token for the same inputs is the same.
    EXPECT_EQ(*token, issueSandboxFileExtension(cls, path, process));
    // A new boot (run/ cleared) makes a new key, and old tokens stop verifying.
    ASSERT_EQ(0, unlink(key.c_str()));
    auto fresh = issueSandboxFileExtension(cls, path, process);
    ASSERT_TRUE(fresh);
    EXPECT_NE(*token, *fresh);
    EXPECT_FALSE(verifySandboxFileExtension(*token, cls, path, process, key));

    std::string rm = std::string("rm -rf '") + dir + "'";
    EXPECT_EQ(0, system(rm.c_str()));
    setSystemRoot("/");
}
