#include "Daemon/Upcall/VSLUpcallDemux.h"

#include "Client/VSLUpcallProtocol.h"
#include "Daemon/Upcall/VSLUpcallRoutine.h"
#include "Platform/Log.h"

namespace vsl {

bool demux_server(const VSLUpcallMessage& request, VSLUpcallReply* reply) {
    *reply = VSLUpcallReply();
    LogWrite(kLogLevelDebug, "demux_server", "in demux_server(); request->msgh_id: %d", static_cast<int32_t>(request.id));
    if (request.id != kVSLUpcallGetProcessContainersID && request.id != kVSLUpcallUnusedID) return false;
    LogWrite(kLogLevelDebug, "demux_server", "handling incomming request for vesselward server");
    reply->prepared = true;
    if (request.id == kVSLUpcallUnusedID) {
        reply->returnCode = kVSLUpcallBadID;
        LogWrite(kLogLevelDebug, "demux_server", "vesselward server returns: %d", reply->returnCode);
        return false;
    }
    // The message-header checks of a kernel message have no counterpart here: the
    // framing has already refused what is too long or cut short.
    reply->returnCode = server_get_process_containers(request.auditToken, request.bytes, request.size, &reply->bytes);
    if (reply->returnCode != kVSLUpcallSuccess) reply->bytes.clear();
    LogWrite(kLogLevelDebug, "demux_server", "vesselward server returns: %d", reply->returnCode);
    return true;
}

}  // namespace vsl
