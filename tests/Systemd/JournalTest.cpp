// Under the service manager every entry of the rotating log also reaches the journal,
// with the fields an operator filters on. The journal here is a double: a datagram
// socket the test binds, which the daemon's test build sends to instead.
#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "Daemon/Core/VSLErrorCodes.h"
#include "Platform/Value.h"
#include "Support/Boot.h"
#include "Support/DaemonProcess.h"
#include "Support/TempRoot.h"
#include "Systemd/DatagramListener.h"

namespace vsl::test {
namespace {

using Entry = std::map<std::string, std::string>;

// Reads the native protocol: NAME=value lines, or NAME, newline, a 64-bit
// little-endian length and that many bytes, then a newline.
Entry parseEntry(const std::string& datagram) {
    Entry entry;
    size_t at = 0;
    while (at < datagram.size()) {
        const size_t end = datagram.find_first_of("=\n", at);
        if (end == std::string::npos) break;
        const std::string name = datagram.substr(at, end - at);
        if (datagram[end] == '=') {
            const size_t newline = datagram.find('\n', end);
            if (newline == std::string::npos) break;
            entry[name] = datagram.substr(end + 1, newline - end - 1);
            at = newline + 1;
        } else {
            if (end + 9 > datagram.size()) break;
            uint64_t size = 0;
            for (int i = 0; i < 8; i++) size |= uint64_t(uint8_t(datagram[end + 1 + i])) << (8 * i);
            entry[name] = datagram.substr(end + 9, size);
            at = end + 9 + size + 1;
        }
    }
    return entry;
}

class JournalDouble {
public:
    explicit JournalDouble(const std::string& path) : listener_(path) {}
    bool bound() const { return listener_.bound(); }
    // The entries received so far.
    const std::vector<Entry>& entries() {
        for (const auto& datagram : listener_.receive()) entries_.push_back(parseEntry(datagram));
        return entries_;
    }
    // The first entry whose message holds `text`, waiting a while for it.
    std::optional<Entry> find(const std::string& text) {
        const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        do {
            for (const auto& e : entries()) {
                auto m = e.find("MESSAGE");
                if (m != e.end() && m->second.find(text) != std::string::npos) return e;
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        } while (std::chrono::steady_clock::now() < deadline);
        return std::nullopt;
    }

private:
    DatagramListener listener_;
    std::vector<Entry> entries_;
};

std::string field(const Entry& e, const std::string& name) {
    auto it = e.find(name);
    return it == e.end() ? "(absent)" : it->second;
}

TEST(JournalTest, FailedCreateReachesTheJournalWithItsFieldsAndTheRotatingLogWithTheSameLine) {
    DaemonProcess daemon;
    const std::string socket = daemon.at("journal.socket");
    JournalDouble journal(socket);
    ASSERT_TRUE(journal.bound());
    ASSERT_TRUE(daemon.start({"VESSELD_TEST_JOURNAL_SOCKET=" + socket, "VESSELD_TEST_FAIL_CREATE=com.example.broken"}))
        << readFile(daemon.at("vesseld.stderr"));
    // Start-up's lines are read now: the socket's queue is short, and a daemon finding
    // it full drops lines rather than wait.
    ASSERT_TRUE(waitForNotification(daemon, "com.tarrow.vesseld.reboot-cleanup-complete"));
    journal.entries();

    auto made = daemon.run(vesselctlPath(), {"createOrLookup", "Identifier=com.example.broken", "ContainerClass=2",
                                             "CreateIfNecessary=true"});
    ASSERT_EQ(uint64_t(kVSLErrorWriteFile), made.code()) << made.out << made.err;

    auto entry = journal.find("Failed to write metadata for com.example.broken");
    ASSERT_TRUE(entry) << journal.entries().size() << " entries, none about the failure";
    EXPECT_EQ("3", field(*entry, "PRIORITY"));
    EXPECT_EQ("vesseld", field(*entry, "SYSLOG_IDENTIFIER"));
    EXPECT_EQ("com.tarrow.vessel", field(*entry, "SUBSYSTEM"));
    EXPECT_EQ("unspecified", field(*entry, "CATEGORY"));
    EXPECT_EQ("createContainer", field(*entry, "CODE_FUNC"));
    EXPECT_EQ("com.example.broken", field(*entry, "VSL_CONTAINER_IDENTIFIER"));
    EXPECT_TRUE(Uuid::parse(field(*entry, "VSL_CONTAINER_UUID"))) << field(*entry, "VSL_CONTAINER_UUID");
    EXPECT_EQ(std::to_string(kVSLErrorWriteFile), field(*entry, "VSL_ERROR_CODE"));

    const std::string log = readFile(daemon.at("private/var/root/Library/Logs/Vesselry/vesseld.log"));
    EXPECT_NE(std::string::npos, log.find(" 3 createContainer: " + field(*entry, "MESSAGE") + "\n")) << log;

    // A line about no container carries no container fields: they end with their scope.
    auto startup = journal.find("Current mobile user ID");
    ASSERT_TRUE(startup);
    EXPECT_EQ("(absent)", field(*startup, "VSL_CONTAINER_IDENTIFIER"));
    EXPECT_EQ("(absent)", field(*startup, "VSL_ERROR_CODE"));
    daemon.stop();
}

}  // namespace
}  // namespace vsl::test
