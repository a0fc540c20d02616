#include "Client/VSLUpcallMessages.h"

#include <memory>

#include "Client/VSLUpcallProtocol.h"
#include "packbuff/packbuff_handle.hpp"

namespace vsl::client {

namespace {

bool fail(std::string* error, std::string why) {
    if (error) *error = std::move(why);
    return false;
}

}  // namespace

std::optional<std::string> packUpcallQuery(const VSLUpcallQuery& query) {
    PackbuffHandle pb(sb_packbuff_new(1024));
    if (!pb) return std::nullopt;
    int rc = 0;
    auto string = [&](uint16_t key, const std::string& s) {
        if (rc == 0) rc = sb_packbuff_pack_string(pb.get(), key, s.c_str(), s.size());
    };
    auto optionalString = [&](uint16_t key, const std::optional<std::string>& s) {
        if (s) string(key, *s);
    };
    auto number = [&](uint16_t key, const std::optional<uint32_t>& n) {
        if (n && rc == 0) rc = sb_packbuff_pack_uint32(pb.get(), key, *n);
    };
    optionalString(VW_KERN_REQUEST_CODE_SIGNATURE_ID, query.codeSignatureID);
    optionalString(VW_KERN_REQUEST_CONTAINER_ID, query.containerID);
    optionalString(VW_KERN_REQUEST_APPLICATION_ID, query.applicationID);
    number(VW_KERN_REQUEST_UID, query.uid);
    for (const auto& group : query.appGroupIDs) string(VW_KERN_REQUEST_APP_GROUP_ID, group);
    number(VW_KERN_REQUEST_CONTAINER_TYPE, query.containerType);
    optionalString(VW_KERN_REQUEST_SYSTEM_CONTAINER_ID, query.systemContainerID);
    for (const auto& group : query.systemGroupIDs) string(VW_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID, group);
    number(VW_KERN_REQUEST_PERSONA_ID, query.personaID);
    if (rc != 0) return std::nullopt;
    return std::string(static_cast<const char*>(sb_packbuff_get_bytes(pb.get())), sb_packbuff_get_size(pb.get()));
}

std::optional<VSLUpcallContainers> unpackUpcallReply(const std::string& packbuff, std::string* error) {
    std::string copy = packbuff;  // the reader wants a mutable buffer
    PackbuffHandle pb(sb_packbuff_init_with_buffer(copy.data(), copy.size(), true, SB_PACKBUFF_DEALLOC_NONE));
    if (!pb) {
        fail(error, "the reply is shorter than an end marker");
        return std::nullopt;
    }
    VSLUpcallContainers out;
    uint16_t key = 0;
    while (sb_packbuff_get_item_value_type(pb.get(), &key)) {
        int rc = 0;
        auto string = [&](std::optional<std::string>* into) {
            size_t length = 0;
            const char* s = sb_packbuff_unpack_string(pb.get(), &length, &rc);
            if (rc == 0) *into = std::string(s, length);
        };
        auto pair = [&](std::vector<std::pair<std::string, std::string>>* into) {
            const char* k = nullptr;
            const char* v = nullptr;
            size_t length = 0;
            rc = sb_packbuff_unpack_key_with_string_value(pb.get(), &k, nullptr, &v, &length);
            if (rc == 0) into->emplace_back(k, std::string(v, length));
        };
        switch (key) {
        case kVSLUpcallReplyHome: string(&out.home); break;
        case kVSLUpcallReplyDataContainer: string(&out.dataContainer); break;
        case kVSLUpcallReplyTemporaryDirectory: string(&out.temporaryDirectory); break;
        case kVSLUpcallReplyGroupIdentifier: pair(&out.groups); break;
        case kVSLUpcallReplySystemContainer: string(&out.systemContainer); break;
        case kVSLUpcallReplySystemGroupIdentifier: pair(&out.systemGroups); break;
        case kVSLUpcallReplyStatus: {
            const uint32_t status = sb_packbuff_unpack_uint32(pb.get(), &rc);
            if (rc == 0) out.status = status;
            break;
        }
        default:
            fail(error, "unexpected reply item " + std::to_string(key));
            return std::nullopt;
        }
        if (rc != 0) {
            fail(error, "reply item " + std::to_string(key) + " cannot be read: error " + std::to_string(rc));
            return std::nullopt;
        }
    }
    return out;
}

Value VSLUpcallContainers::value() const {
    Dictionary d;
    auto put = [&](const char* name, const std::optional<std::string>& s) {
        if (s) d.emplace(name, Value::string(*s));
    };
    auto pairs = [&](const char* name, const std::vector<std::pair<std::string, std::string>>& list) {
        if (list.empty()) return;
        Dictionary m;
        for (const auto& [identifier, path] : list) m.insert_or_assign(identifier, Value::string(path));
        d.emplace(name, Value::dictionary(std::move(m)));
    };
    put("Home", home);
    put("DataContainer", dataContainer);
    put("TemporaryDirectory", temporaryDirectory);
    pairs("Groups", groups);
    put("SystemContainer", systemContainer);
    pairs("SystemGroups", systemGroups);
    if (status) d.emplace("Status", Value::uint64(*status));
    return Value::dictionary(std::move(d));
}

}  // namespace vsl::client
