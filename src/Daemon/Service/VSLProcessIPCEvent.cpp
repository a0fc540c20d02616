#include "Daemon/Service/VSLProcessIPCEvent.h"

#include "Client/VSLProtocol.h"
#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Core/VSLExceptionGuard.h"
#include "Daemon/Service/VSLCommandTable.h"
#include "Daemon/Service/VSLEntitlements.h"
#include "Platform/Log.h"

namespace vsl {

namespace {

const char* const kFn = "VSLProcessIPCEvent";
const char* const kRightsFn = "checkEntitlementsAndInitClientObject";

VSLClientConnectionRef checkEntitlementsAndInitClientObject(const VSLPeerCredentials& peer, const VSLCommandRow& row) {
    auto commandQueue = VSLCommandQueue::create();
    auto identity = VSLClientIdentity::clientIdentityWithIPCConnection(peer);
    if (!identity) {
        if (row.flags & kVSLCommandFlagAllowUnentitled)
            return VSLClientConnection::create(nullptr, false, false, false, std::nullopt, std::nullopt, commandQueue);
        return nullptr;
    }

    bool allowOtherIdLookup = false;
    bool unrestricted = false;
    std::optional<Value> lookup;
    if (identity->boolValueOfEntitlement(kVSLEntitlementAllowed)) {
        allowOtherIdLookup = true;
        unrestricted = std::string_view(row.entitlement) != kVSLEntitlementTestability;
    } else {
        allowOtherIdLookup = identity->boolValueOfEntitlement(kVSLEntitlementOtherIdLookup);
        const Value* l = identity->entitlement(kVSLEntitlementLookup);
        if ((row.flags & kVSLCommandFlagLookupDictionary) && l && l->isDictionary()) lookup = *l;
    }

    bool entitled = false;
    std::optional<std::vector<std::string>> wipeList;
    if (std::string_view(row.entitlement) == kVSLEntitlementWipeContainer) {
        const Value* wipe = identity->entitlement(kVSLEntitlementWipeContainer);
        if (wipe && wipe->arrayValue()) {
            entitled = true;
            wipeList.emplace();
            for (const Value& v : *wipe->arrayValue())
                if (v.stringValue()) wipeList->push_back(*v.stringValue());
        } else {
            LogWrite(kLogLevelError, kRightsFn, "No entitled containers to wipe");
            entitled = unrestricted;
        }
    } else {
        entitled = unrestricted || identity->boolValueOfEntitlement(row.entitlement);
    }

    if (entitled || (row.flags & kVSLCommandFlagAllowUnentitled) || lookup) {
        auto mapping = VSLCodeSigningMapping::sharedInstance();
        uint64_t rc = mapping ? mapping->processCallerRegisteredEntitlements(identity->entitlements(),
                                                                             identity->bundleIdentifier(), commandQueue)
                              : uint64_t(kVSLErrorDatabase);
        if (rc != kVSLSuccess)
            LogWrite(kLogLevelError, kRightsFn, "Error processing entitlements for %@ : %llu",
                     identity->bundleIdentifier(), rc);
        return VSLClientConnection::create(identity, entitled, allowOtherIdLookup, unrestricted, std::move(lookup),
                                           std::move(wipeList), commandQueue);
    }
    LogWrite(kLogLevelError, kRightsFn, "connection attempt from pid %d (%@) is not entitled", peer.pid,
             identity->bundleIdentifier());
    return nullptr;
}

// Runs `body`; an exception ends in code 40 (or stops an internal build) and false.
template <class F>
bool guarded(int line, uint64_t* code, F&& body) {
    VSLErrorRef error;
    if (guardExceptions(kFn, line, &error, [&] {
            body();
            return true;
        }))
        return true;
    *code = codeForError(error, kVSLErrorException);
    return false;
}

}  // namespace

void runCommandRow(const VSLCommandRow& row, const Value& request, const VSLReplyRef& reply,
                   const VSLClientConnectionRef& connection, uint64_t* code) {
    if (!row.handler) {
        LogWrite(kLogLevelError, kFn, "Command %llu (%s) is not available in this build", row.number,
                 commandName(row.number));
        *code = kVSLErrorInvalidCommand;
    } else {
        // A handler that threw may have written half its keys.
        if (!guarded(__LINE__, code, [&] { row.handler(request, reply, connection, code); })) reply->discardValues();
    }
    guarded(__LINE__, code, [&] { connection->completeWithError(code); });
}

void VSLProcessIPCEvent(const VSLPeerCredentials& peer, const Value& request, VSLReply::Sender send,
                        const std::function<void()>& cancelPeer) {
    // A "Command" of any other type reads as absent, i.e. 0.
    const Value* c = request.find("Command");
    uint64_t command = c && c->uint64Value() ? *c->uint64Value() : 0;

    if (!send) {
        LogWrite(kLogLevelError, kFn, "Dictionary does not have reply context");
        if (cancelPeer) cancelPeer();
        return;
    }
    auto reply = std::make_shared<VSLReply>(std::move(send));
    SignpostInterval interval(LogCategory::Ipc, "IPCEventProcessing", " command=%{public, signpost.description:attribute}llu ",
                              command);
    uint64_t code = kVSLSuccess;
    uint64_t flags = kVSLCommandFlagReplyOnReturn;
    VSLClientConnectionRef connection;

    if (command >= kVSLCommandCount) {
        LogWrite(kLogLevelError, kFn, "Invalid command index: %lld", static_cast<long long>(command));
        code = kVSLErrorInvalidCommand;
    } else if (commandRow(command).number != command) {
        LogWrite(kLogLevelError, kFn, "Invalid command at index %llu", command);
        code = kVSLErrorInvalidCommand;
    } else {
        const VSLCommandRow& row = commandRow(command);
        flags = row.flags;
        guarded(__LINE__, &code, [&] { connection = checkEntitlementsAndInitClientObject(peer, row); });
        if (connection)
            runCommandRow(row, request, reply, connection, &code);
        else if (code == kVSLSuccess)
            code = kVSLErrorNotEntitled;
    }

    std::string client = connection && connection->clientIdentity() ? connection->clientBundleIdentifier()
                                                                     : std::string("<unknown>");
    interval.end(" command=%{public, signpost.description:attribute}llu  clientIdentifier=%{private, "
                 "signpost.description:attribute}@ ",
                 command, client);
    osLog(LogCategory::Ipc, OSLogLevel::Default, "command=%llu, client=%@, error=%llu", command, client, code);
    connection.reset();

    if ((flags & kVSLCommandFlagReplyOnReturn) || code != kVSLSuccess) reply->sendWithCode(code);
}

}  // namespace vsl
