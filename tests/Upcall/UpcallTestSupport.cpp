#include "Upcall/UpcallTestSupport.h"

#include <gtest/gtest.h>

#include <cstdio>

#include "Platform/PropertyList.h"

namespace vsl::test {

std::unique_ptr<client::VSLUpcallClient> connectUpcall(const DaemonProcess& daemon) {
    std::string error;
    auto c = client::VSLUpcallClient::connect(client::VSLUpcallClient::socketPathForSystemRoot(daemon.root()), &error);
    EXPECT_TRUE(c) << error;
    return c;
}

UpcallAnswer askUpcall(client::VSLUpcallClient& client, const std::string& packbuff) {
    UpcallAnswer a;
    a.status = client.getProcessContainers(packbuff, &a.frame, kUpcallWait, &a.error);
    if (a.status == client::VSLUpcallStatus::Ok && a.frame.returnCode == 0) {
        auto containers = client::unpackUpcallReply(a.frame.packbuff, &a.error);
        EXPECT_TRUE(containers) << a.error;
        if (containers) a.containers = *containers;
    }
    return a;
}

UpcallAnswer askUpcall(const DaemonProcess& daemon, const client::VSLUpcallQuery& query) {
    auto c = connectUpcall(daemon);
    auto packbuff = client::packUpcallQuery(query);
    EXPECT_TRUE(packbuff);
    if (!c || !packbuff) return {};
    return askUpcall(*c, *packbuff);
}

packbuff_test::Bytes& packedString(packbuff_test::Bytes& bytes, uint16_t key, const std::string& s) {
    const uint32_t length = static_cast<uint32_t>(s.size() + 1);
    return bytes.header(2, key, length).raw(s).zeros(1 + (8 - length % 8) % 8);
}

std::string asString(const packbuff_test::Bytes& bytes) { return std::string(bytes.v.begin(), bytes.v.end()); }

void registerCodeSigning(DaemonProcess& daemon, const std::string& installer, const std::string& identifier,
                         uint64_t dataContainerClass) {
    auto write = [&](const std::string& name, const Value& value) {
        std::string path = daemon.at(name);
        auto bytes = encodeBinaryPropertyList(value, nullptr);
        FILE* f = std::fopen(path.c_str(), "wb");
        if (f && bytes) std::fwrite(bytes->data(), 1, bytes->size(), f);
        if (f) std::fclose(f);
        return path;
    };
    std::string info = write("info-" + identifier + ".plist",
                             dict({{"com.tarrow.Vesselry.Entitlements", Value::dictionary({})},
                                   {"Version", Value::uint64(3)}}));
    std::string options = write("options-" + identifier + ".plist",
                                dict({{"com.tarrow.Vesselry.DataContainerClass", Value::uint64(dataContainerClass)}}));
    auto r = daemon.run(installer, {"processCodeSigningInfo", "Identifier=" + identifier, "CodeSigningInfo=@" + info,
                                    "OptionsDictionary=@" + options});
    ASSERT_EQ(1u, r.code()) << r.err;
}

}  // namespace vsl::test
