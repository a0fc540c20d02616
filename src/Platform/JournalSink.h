// The journal as a destination of both logs, spoken in its native protocol: one
// datagram of NAME=value fields per entry to the journal's socket (an entry too big
// for a datagram goes in a sealed memory file passed along with an empty one).
//
// Entries of the rotating log go to the journal too when the service manager started
// the daemon (INVOCATION_ID or JOURNAL_STREAM set), with PRIORITY (3, 5, 7),
// SUBSYSTEM, CATEGORY, CODE_FUNC and the thread's log fields (LogFields.h).
// Test builds: VESSELD_TEST_JOURNAL_SOCKET names a datagram socket to send to instead
// of the journal's, and also turns the rotating log's entries on.
#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace vsl {

struct JournalField {
    std::string_view name;
    std::string_view value;
};

// "/run/systemd/journal/socket", or the test socket.
const std::string& journalSocketPath();
// Whether the rotating log's entries also go to the journal (decided once).
bool journalTakesLogWrite();

// Sends one entry: the given fields, SYSLOG_IDENTIFIER and the thread's log fields.
// False when the journal did not take it.
bool journalSend(const std::vector<JournalField>& fields);

}  // namespace vsl
