// The kernel upcall channel: a Unix stream socket, mode 0600, on which the kernel
// stand-in asks for a process's containers.
//
//   request: u32 length | u32 message id | packbuff bytes
//   reply:   u32 length | u32 message id (request id + 100) | i32 return code
//            | packbuff bytes, only when the code is 0
//
// Little-endian. The length counts the bytes after itself and is at most 1 MiB; a
// longer or shorter one is a protocol error that closes the connection, as does a
// connection that ends inside a frame. A request whose id nobody handles gets no reply.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "Platform/AuditToken.h"
#include "Platform/IpcFraming.h"

namespace vsl {

constexpr uint32_t kUpcallMaxFrameLength = 1u << 20;
constexpr uint32_t kUpcallReplyIdOffset = 100;
constexpr size_t kUpcallRequestHeader = 8;  // length, message id
constexpr size_t kUpcallReplyHeader = 12;   // length, message id, return code

// The body of an upcall reply handed to IpcPeer::sendReply: the return code (int64)
// and, when it is 0, the reply packbuff (data).
inline constexpr const char* kUpcallReturnCodeKey = "ReturnCode";
inline constexpr const char* kUpcallReplyBytesKey = "Reply";
Value upcallReplyBody(int32_t returnCode, const std::string& packbuff);

// Framing of the daemon's side: each request becomes a message whose id is the
// request's message id and whose body is the packbuff bytes (data).
const std::shared_ptr<const IpcFraming>& upcallServerFraming();

std::optional<std::string> encodeUpcallRequestFrame(uint32_t messageId, const std::string& packbuff);
std::optional<std::string> encodeUpcallReplyFrame(uint32_t requestId, int32_t returnCode,
                                                  const std::string& packbuff);

struct UpcallReplyFrame {
    uint32_t messageId = 0;
    int32_t returnCode = 0;
    std::string packbuff;  // empty unless the code is 0
};
enum class UpcallDecodeStatus { NeedMore, Frame, Error };
// Reads one reply frame from the front of `bytes`; *consumed is its size.
UpcallDecodeStatus decodeUpcallReplyFrame(const uint8_t* bytes, size_t size, UpcallReplyFrame* frame,
                                          size_t* consumed, std::string* error);

// "run/vesseld/com.tarrow.vesseld.upcall" under the system root.
std::string defaultUpcallServicePath();

// Whether a peer of that uid stands for the kernel: root, or the daemon's own uid
// when it runs unprivileged.
bool isUpcallKernelStandIn(uid_t peerUID);
// The sender's audit token as the routine sees it: the kernel stand-in's carries pid 0.
AuditToken upcallSenderToken(const AuditToken& peerToken, uid_t peerUID);

}  // namespace vsl
