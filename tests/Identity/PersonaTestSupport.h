// Helpers shared by the persona tests: persona lists in both of their forms, the
// rotating log captured into a file, and bounded waits for notifications.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Platform/UserManagement.h"
#include "Platform/Value.h"
#include "Support/TempRoot.h"

namespace vsl::test {

enum class Kind { Personal, Enterprise, Universal, System };

struct PersonaRow {
    Kind kind;
    uint32_t kernelPersonaID;
    std::optional<std::string> uniqueString;
    std::vector<std::string> bundles;
    std::optional<uid_t> uid;
    std::optional<std::string> home;  // as written in the file (inside the root)
};

PersonaAttributes attributesFor(const PersonaRow& row);
PersonaAttributesList attributesFor(const std::vector<PersonaRow>& rows);
Value entryFor(const PersonaRow& row);

// Writes etc/vesseld/personas.plist in place (truncate and write).
void writePersonas(const TempRoot& root, const std::vector<PersonaRow>& rows);
// Writes a temporary file next to it and renames it over the name.
void replacePersonasAtomically(const TempRoot& root, const std::vector<PersonaRow>& rows);

// Turns personas.plist into a link to its own directory in one rename, so that it is
// unreadable without ever being missing.
void makePersonasUnreadable(const TempRoot& root);

// Personal P-1 (uid 501), enterprise E-1 (uid 502) and E-2, universal U-1, a system
// persona without a string, and an enterprise persona without one.
std::vector<PersonaRow> standardPersonas();

// LogWrite lines go to <dir>/vesseld.log while this lives.
class LogCapture {
public:
    explicit LogCapture(std::string directory);
    ~LogCapture();
    std::string contents() const;

private:
    std::string directory_;
};

// Waits for `done` (checked under `mutex`, signalled through `changed`) for at most a
// generous bound, so that a missing notification fails instead of hanging.
bool waitUntil(std::mutex& mutex, std::condition_variable& changed, const std::function<bool()>& done);

}  // namespace vsl::test
