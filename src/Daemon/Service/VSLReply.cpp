#include "Daemon/Service/VSLReply.h"

namespace vsl {

void VSLReply::set(const std::string& key, Value value) {
    std::lock_guard<std::mutex> g(mutex_);
    values_.insert_or_assign(key, std::move(value));
}

bool VSLReply::has(const std::string& key) const {
    std::lock_guard<std::mutex> g(mutex_);
    return values_.count(key) != 0;
}

Dictionary VSLReply::values() const {
    std::lock_guard<std::mutex> g(mutex_);
    return values_;
}

void VSLReply::discardValues() {
    std::lock_guard<std::mutex> g(mutex_);
    values_.clear();
}

void VSLReply::sendWithCode(uint64_t code) {
    if (sent_.exchange(true)) return;
    Dictionary body;
    {
        std::lock_guard<std::mutex> g(mutex_);
        values_.insert_or_assign("ReplyError", Value::uint64(code));
        body = values_;
    }
    if (sender_) sender_(Value::dictionary(std::move(body)));
}

}  // namespace vsl
