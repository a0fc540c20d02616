#include "Platform/JournalSink.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "Platform/LogFields.h"
#include "Platform/UniqueFd.h"

namespace vsl {

namespace {

const char* const kIdentifier = "vesseld";

std::string decideSocketPath() {
#ifdef VESSEL_KILLPOINTS
    if (const char* test = std::getenv("VESSELD_TEST_JOURNAL_SOCKET"); test && *test) return test;
#endif
    return "/run/systemd/journal/socket";
}

bool isSet(const char* name) {
    const char* value = std::getenv(name);
    return value && *value;
}

bool startedByServiceManager() {
#ifdef VESSEL_KILLPOINTS
    if (isSet("VESSELD_TEST_JOURNAL_SOCKET")) return true;
#endif
    return isSet("INVOCATION_ID") || isSet("JOURNAL_STREAM");
}

// NAME=value, or, for a value holding a newline, NAME, a newline, the value's length as
// 64 bits little-endian, the value and a newline.
void appendField(std::string& entry, std::string_view name, std::string_view value) {
    entry.append(name);
    if (value.find('\n') == std::string_view::npos) {
        entry += '=';
        entry.append(value);
    } else {
        entry += '\n';
        uint64_t size = value.size();
        for (int i = 0; i < 8; i++) entry += static_cast<char>((size >> (8 * i)) & 0xff);
        entry.append(value);
    }
    entry += '\n';
}

// One socket for the process; datagrams are sent whole, whichever thread sends them.
// Never waits: a journal that has fallen behind loses lines (the rotating log keeps
// them) rather than stalling the thread that logs, which may be serving a client.
int journalSocket() {
    static const int fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    return fd;
}

bool sendDatagram(const std::string& entry, const sockaddr_un& addr) {
    const ssize_t n = ::sendto(journalSocket(), entry.data(), entry.size(), MSG_NOSIGNAL | MSG_DONTWAIT,
                               reinterpret_cast<const sockaddr*>(&addr), sizeof addr);
    return n == static_cast<ssize_t>(entry.size());
}

// Too big for one datagram: the entry goes in a sealed memory file, passed alone.
bool sendInMemoryFile(const std::string& entry, const sockaddr_un& addr) {
    UniqueFd file(::memfd_create("journal-entry", MFD_CLOEXEC | MFD_ALLOW_SEALING));
    if (!file) return false;
    size_t done = 0;
    while (done < entry.size()) {
        const ssize_t n = ::write(file.get(), entry.data() + done, entry.size() - done);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) return false;
        done += static_cast<size_t>(n);
    }
    if (::fcntl(file.get(), F_ADD_SEALS, F_SEAL_SHRINK | F_SEAL_GROW | F_SEAL_WRITE | F_SEAL_SEAL) != 0) return false;
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    msghdr message{};
    message.msg_name = const_cast<sockaddr_un*>(&addr);
    message.msg_namelen = sizeof addr;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof(int));
    const int fd = file.get();
    std::memcpy(CMSG_DATA(header), &fd, sizeof fd);
    return ::sendmsg(journalSocket(), &message, MSG_NOSIGNAL | MSG_DONTWAIT) >= 0;
}

}  // namespace

const std::string& journalSocketPath() {
    static const std::string path = decideSocketPath();
    return path;
}

bool journalTakesLogWrite() {
    static const bool on = startedByServiceManager();
    return on;
}

bool journalSend(const std::vector<JournalField>& fields) {
    const std::string& path = journalSocketPath();
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    if (path.size() >= sizeof addr.sun_path || journalSocket() < 0) return false;
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    std::string entry;
    for (const auto& field : fields) appendField(entry, field.name, field.value);
    appendField(entry, "SYSLOG_IDENTIFIER", kIdentifier);
    forEachLogField([&](const char* name, std::string_view value) { appendField(entry, name, value); });
    if (sendDatagram(entry, addr)) return true;
    return (errno == EMSGSIZE || errno == ENOBUFS) && sendInMemoryFile(entry, addr);
}

}  // namespace vsl
