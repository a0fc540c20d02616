// The reply of one message: handlers fill its keys; it is sent once, with
// "ReplyError", either by the dispatcher or later from a completion.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>

#include "Platform/Value.h"

namespace vsl {

class VSLReply {
public:
    using Sender = std::function<void(const Value& body)>;
    explicit VSLReply(Sender sender) : sender_(std::move(sender)) {}

    void set(const std::string& key, Value value);
    bool has(const std::string& key) const;
    Dictionary values() const;
    // Forgets the keys set so far (a failed handler's partial answer).
    void discardValues();

    // Sets "ReplyError" and sends; later calls do nothing (one reply per message).
    void sendWithCode(uint64_t code);
    bool sent() const { return sent_.load(); }

private:
    Sender sender_;
    mutable std::mutex mutex_;
    Dictionary values_;
    std::atomic<bool> sent_{false};
};

using VSLReplyRef = std::shared_ptr<VSLReply>;

}  // namespace vsl
