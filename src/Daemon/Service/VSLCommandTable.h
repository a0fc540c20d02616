// The 33 client commands: handler, entitlement and flags of each, by number.
#pragma once

#include <cstdint>

#include "Daemon/Service/VSLClientConnection.h"
#include "Daemon/Service/VSLReply.h"
#include "Platform/Value.h"

namespace vsl {

// Handlers write reply keys only on success and a code other than 1 on failure.
using VSLCommandHandler = void (*)(const Value& request, const VSLReplyRef& reply,
                                   const VSLClientConnectionRef& connection, uint64_t* code);

enum VSLCommandFlags : uint64_t {
    kVSLCommandFlagReplyOnReturn = 0x1,      // the dispatcher replies when the handler returns
    kVSLCommandFlagAllowUnentitled = 0x100,  // runs restricted to the client's own containers
    kVSLCommandFlagLookupDictionary = 0x10000,  // the lookup entitlement admits the client
};

struct VSLCommandRow {
    uint64_t number;
    VSLCommandHandler handler;  // null: not available in this build
    const char* entitlement;
    uint64_t flags;
};

constexpr uint64_t kVSLCommandCount = 33;

const VSLCommandRow& commandRow(uint64_t index);  // index < kVSLCommandCount
// Logs and counts rows whose number differs from their index; 0 when sound.
size_t validateCommandTable();

}  // namespace vsl
