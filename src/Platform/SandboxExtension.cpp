#include "Platform/SandboxExtension.h"

#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <mutex>
#include <vector>

#include "Platform/DurableIO.h"
#include "Platform/Sha256.h"
#include "Platform/Value.h"
#include "Platform/SystemRoot.h"

namespace vsl {

namespace {

constexpr size_t kKeyLength = 32;
const char* const kVersion = "vsx1";

std::optional<std::vector<uint8_t>> readKey(const std::string& path) {
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return std::nullopt;
    std::vector<uint8_t> key(kKeyLength);
    ssize_t n = ::read(fd, key.data(), key.size());
    ::close(fd);
    if (n != static_cast<ssize_t>(kKeyLength)) {
        errno = EINVAL;
        return std::nullopt;
    }
    return key;
}

// One key per boot: made on first use, kept in run/ which a boot clears.
std::optional<std::vector<uint8_t>> keyForIssuing() {
    static std::mutex mutex;
    std::lock_guard<std::mutex> g(mutex);
    std::string path = sandboxExtensionKeyPath();
    if (auto key = readKey(path)) return key;
    std::vector<uint8_t> key(kKeyLength);
    // Early in boot the pool may not be ready yet: this waits for it, as a key must not be guessable.
    for (size_t got = 0; got < key.size();) {
        const ssize_t n = ::getrandom(key.data() + got, key.size() - got, 0);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) return std::nullopt;
        got += static_cast<size_t>(n);
    }
    ::mkdir(parentPath(parentPath(path)).c_str(), 0755);
    ::mkdir(parentPath(path).c_str(), 0755);
    std::string temp = path + ".new";
    if (int rc = durable::writeFile(temp, key.data(), key.size(), 0600)) {
        errno = rc;
        return std::nullopt;
    }
    // Another process may have won the race: keep whichever key landed first.
    if (durable::renameNoReplace(temp, path) != 0) ::unlink(temp.c_str());
    return readKey(path);
}

std::string mac(const std::vector<uint8_t>& key, const std::string& extensionClass, const std::string& path,
                const SandboxAuditToken& token) {
    std::string message = std::string(kVersion) + '\0' + extensionClass + '\0' + path + '\0';
    for (uint32_t w : token)
        for (int i = 0; i < 4; i++) message += static_cast<char>((w >> (8 * i)) & 0xff);
    const Sha256Digest digest =
        hmacSha256(std::string_view(reinterpret_cast<const char*>(key.data()), key.size()), message);
    return hexDigits(digest.data(), digest.size());
}

}  // namespace

std::string sandboxExtensionKeyPath() { return rootedPath("/run/vesseld/sandbox-extension.key"); }

std::optional<std::string> issueSandboxFileExtension(const std::string& extensionClass, const std::string& path,
                                                     const SandboxAuditToken& token) {
    auto key = keyForIssuing();
    if (!key) return std::nullopt;
    return std::string(kVersion) + ";" + mac(*key, extensionClass, path, token);
}

bool verifySandboxFileExtension(const std::string& token, const std::string& extensionClass,
                                const std::string& path, const SandboxAuditToken& auditToken,
                                const std::string& keyPath) {
    auto key = readKey(keyPath);
    if (!key) return false;
    std::string expected = std::string(kVersion) + ";" + mac(*key, extensionClass, path, auditToken);
    return constantTimeEqual(token, expected);
}

}  // namespace vsl
