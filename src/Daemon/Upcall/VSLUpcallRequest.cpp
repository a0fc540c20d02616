#include "Daemon/Upcall/VSLUpcallRequest.h"

#include <cstring>
#include <memory>

#include "Client/VSLUpcallProtocol.h"
#include "Platform/Log.h"
#include "packbuff/packbuff_handle.hpp"

namespace vsl {

namespace {

const char* const kFunction = "server_get_process_containers";

// Unpacks one string item; 0, or the routine's code with the failure logged.
int32_t unpackString(sb_packbuff* pb, const char* label, std::string* out) {
    int error = 0;
    size_t length = 0;
    const char* s = sb_packbuff_unpack_string(pb, &length, &error);
    if (!s || error != 0) {
        LogWrite(kLogLevelError, kFunction, "failed: to unpack string for %s. error: %d\n", label, error ? error : EINVAL);
        return kVSLUpcallFailure;
    }
    // Paths and the database stop at the first NUL: "a\0b" must never name "a".
    if (std::memchr(s, '\0', length) != nullptr) {
        LogWrite(kLogLevelError, kFunction, "string for %s holds a NUL before its end\n", label);
        return kVSLUpcallInvalidArgument;
    }
    out->assign(s, length);
    return kVSLUpcallSuccess;
}

int32_t unpackUInt32(sb_packbuff* pb, const char* label, uint32_t* out) {
    int error = 0;
    const uint32_t value = sb_packbuff_unpack_uint32(pb, &error);
    if (error != 0) {
        LogWrite(kLogLevelError, kFunction, "failed: to unpack uint32 for %s. error: %d\n", label, error);
        return kVSLUpcallFailure;
    }
    *out = value;
    return kVSLUpcallSuccess;
}

int32_t unpackOptionalString(sb_packbuff* pb, const char* label, std::optional<std::string>* out) {
    std::string s;
    const int32_t rc = unpackString(pb, label, &s);
    if (rc == kVSLUpcallSuccess) *out = std::move(s);
    return rc;
}

int32_t appendString(sb_packbuff* pb, const char* label, std::vector<std::string>* out) {
    std::string s;
    const int32_t rc = unpackString(pb, label, &s);
    if (rc == kVSLUpcallSuccess) out->push_back(std::move(s));
    return rc;
}

int32_t unpackItem(sb_packbuff* pb, uint16_t key, VSLUpcallRequest* r) {
    switch (key) {
    case VW_KERN_REQUEST_CODE_SIGNATURE_ID:
        return unpackOptionalString(pb, "VW_KERN_REQUEST_CODE_SIGNATURE_ID", &r->codeSignatureID);
    case VW_KERN_REQUEST_CONTAINER_ID:
        return unpackOptionalString(pb, "VW_KERN_REQUEST_CONTAINER_ID", &r->containerID);
    case VW_KERN_REQUEST_APPLICATION_ID:
        return unpackOptionalString(pb, "VW_KERN_REQUEST_APPLICATION_ID", &r->applicationID);
    case VW_KERN_REQUEST_UID:
        return unpackUInt32(pb, "VW_KERN_REQUEST_UID", &r->uid);
    case VW_KERN_REQUEST_APP_GROUP_ID:
        return appendString(pb, "VW_KERN_REQUEST_APP_GROUP_ID", &r->appGroupIDs);
    case VW_KERN_REQUEST_CONTAINER_TYPE:
        return unpackUInt32(pb, "VW_KERN_REQUEST_CONTAINER_TYPE", &r->containerType);
    case VW_KERN_REQUEST_SYSTEM_CONTAINER_ID:
        return unpackOptionalString(pb, "VW_KERN_REQUEST_CONTAINER_ID", &r->systemContainerID);
    case VW_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID:
        return appendString(pb, "VW_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID", &r->systemGroupIDs);
    case VW_KERN_REQUEST_PERSONA_ID:
        return unpackUInt32(pb, "VW_KERN_REQUEST_PERSONA_ID", &r->personaID);
    default:
        LogWrite(kLogLevelError, kFunction, "unexpected value: %u\n", key);
        return kVSLUpcallInvalidArgument;
    }
}

}  // namespace

int32_t unpackUpcallRequest(const void* bytes, size_t size, VSLUpcallRequest* request) {
    // A handle that holds data and owns nothing only reads its buffer.
    PackbuffHandle pb(
        sb_packbuff_init_with_buffer(const_cast<void*>(bytes), size, true, SB_PACKBUFF_DEALLOC_NONE));
    if (!pb) {
        LogWrite(kLogLevelError, kFunction, "sb_packbuff_init() of request data fails");
        return kVSLUpcallMemoryFailure;
    }
    LogWrite(kLogLevelDebug, kFunction, "request packbuff byte address:%p", bytes);
    uint16_t key = 0;
    while (sb_packbuff_get_item_value_type(pb.get(), &key)) {
        if (int32_t rc = unpackItem(pb.get(), key, request)) return rc;
    }
    // The walk stops at the end marker, or where no whole item header is left: a
    // buffer cut short inside an item.
    const size_t offset = static_cast<size_t>(pb->item - pb->item_buffer);
    if (size - offset < SB_PACKBUFF_ITEM_HEADER_SIZE) {
        LogWrite(kLogLevelError, kFunction, "request ends inside an item at offset %llu\n",
                 static_cast<unsigned long long>(offset));
        return kVSLUpcallFailure;
    }
    return kVSLUpcallSuccess;
}

}  // namespace vsl
