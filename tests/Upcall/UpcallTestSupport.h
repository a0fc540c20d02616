// A daemon on a scratch root reached through its kernel upcall channel, and
// packbuff bytes assembled by hand to compare replies against.
#pragma once

#include <sys/types.h>
#include <unistd.h>

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "Client/VSLUpcallClient.h"
#include "Support/DaemonProcess.h"
#include "Support/RootFiles.h"
#include "packbuff/PackbuffTestSupport.h"

namespace vsl::test {

constexpr auto kUpcallWait = std::chrono::seconds(30);

// The uid of the root's "mobile" user.
inline uint32_t mobileUID() { return ::geteuid() == 0 ? 501 : ::geteuid(); }

std::unique_ptr<client::VSLUpcallClient> connectUpcall(const DaemonProcess& daemon);

struct UpcallAnswer {
    client::VSLUpcallStatus status = client::VSLUpcallStatus::Closed;
    UpcallReplyFrame frame;
    client::VSLUpcallContainers containers;  // when the return code is 0
    std::string error;
};
UpcallAnswer askUpcall(client::VSLUpcallClient& client, const std::string& packbuff);
UpcallAnswer askUpcall(const DaemonProcess& daemon, const client::VSLUpcallQuery& query);

// A string item as the packbuff format lays it out: header, bytes, terminator, padding.
packbuff_test::Bytes& packedString(packbuff_test::Bytes& bytes, uint16_t key, const std::string& s);
std::string asString(const packbuff_test::Bytes& bytes);

// Registers `identifier` in the code-signing database with that data container class.
void registerCodeSigning(DaemonProcess& daemon, const std::string& installer, const std::string& identifier,
                         uint64_t dataContainerClass);

}  // namespace vsl::test
