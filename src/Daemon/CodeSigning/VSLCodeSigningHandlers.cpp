#include "Daemon/CodeSigning/VSLCodeSigningHandlers.h"

#include "Daemon/CodeSigning/VSLCodeSigningMapping.h"
#include "Daemon/Core/VSLErrorCodes.h"
#include "Daemon/Service/VSLRequestDecoding.h"

namespace vsl {

namespace {

std::optional<Value> dictionaryFromRequest(const Value& request, const char* key) {
    auto v = objectFromRequest(request, key);
    if (v && v->isDictionary()) return v;
    return std::nullopt;
}

}  // namespace

void processCodeSigningInfoCommand(const Value& request, const VSLReplyRef&, const VSLClientConnectionRef& connection,
                                   uint64_t* code) {
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    if (!mapping) {
        *code = kVSLErrorDatabase;
        return;
    }
    // An empty identifier names nothing: it is missing, not a record keyed "".
    auto identifier = stringFromRequest(request, "Identifier");
    if (identifier && identifier->empty()) identifier.reset();
    uint64_t result = mapping->processCodeSigningInfo(dictionaryFromRequest(request, "CodeSigningInfo"), identifier,
                                                      dictionaryFromRequest(request, "OptionsDictionary"),
                                                      connection->commandQueue());
    if (result != kVSLSuccess) *code = result;
}

void getCodeSigningInfoCommand(const Value& request, const VSLReplyRef& reply, const VSLClientConnectionRef&,
                               uint64_t* code) {
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    if (!mapping) {
        *code = kVSLErrorDatabase;
        return;
    }
    auto identifier = stringFromRequest(request, "Identifier");
    std::optional<Value> info = identifier ? mapping->getCodeSigningInfoForIdentifier(*identifier) : std::nullopt;
    if (!info || !info->isDictionary()) {
        *code = kVSLErrorNotFound;
        return;
    }
    reply->set("ReplyInfoDictionary", *info);
}

void invalidateCodeSigningInfoCommand(const Value&, const VSLReplyRef&, const VSLClientConnectionRef&, uint64_t* code) {
    auto mapping = VSLCodeSigningMapping::sharedInstance();
    if (!mapping) {
        *code = kVSLErrorDatabase;
        return;
    }
    uint64_t result = mapping->invalidateCodeSigningInfoForAppsWithoutBundleContainer();
    if (result != kVSLSuccess) *code = result;
}

}  // namespace vsl
