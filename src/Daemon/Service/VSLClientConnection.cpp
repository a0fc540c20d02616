#include "Daemon/Service/VSLClientConnection.h"

#include "Daemon/Core/VSLUserIdentityCache.h"

namespace vsl {

VSLClientConnectionRef VSLClientConnection::create(VSLClientIdentityRef clientIdentity, bool entitled,
                                                   bool allowOtherIdLookup, bool unrestricted,
                                                   std::optional<Value> lookup,
                                                   std::optional<std::vector<std::string>> entitledWipeIdentifiers,
                                                   std::shared_ptr<VSLCommandQueue> commandQueue) {
    auto c = std::shared_ptr<VSLClientConnection>(new VSLClientConnection());
    c->clientIdentity_ = std::move(clientIdentity);
    c->entitled_ = entitled;
    c->allowOtherIdLookup_ = allowOtherIdLookup;
    c->unrestricted_ = unrestricted;
    c->lookup_ = std::move(lookup);
    c->wipeIdentifiers_ = std::move(entitledWipeIdentifiers);
    c->commandQueue_ = commandQueue ? std::move(commandQueue) : VSLCommandQueue::create();
    return c;
}

VSLClientConnectionRef VSLClientConnection::createPrivileged() {
    return create(VSLClientIdentity::anonymousPrivilegedClientIdentity(), true, false, true, std::nullopt,
                  std::nullopt, VSLCommandQueue::create());
}

VSLClientConnectionRef VSLClientConnection::privilegedClientConnectionWithUserIdentity(
    VSLUserIdentityRef userIdentity, bool kernel) {
    return create(VSLClientIdentity::privilegedClientIdentityWithUserIdentity(std::move(userIdentity), kernel), true,
                  true, true, std::nullopt, std::nullopt, VSLCommandQueue::create());
}

VSLClientConnectionRef VSLClientConnection::sharedClientConnection() {
    static const VSLClientConnectionRef shared = createPrivileged();
    return shared;
}

std::string VSLClientConnection::clientBundleIdentifier() const {
    return clientIdentity_ ? clientIdentity_->bundleIdentifier() : std::string();
}

std::shared_ptr<VSLUserIdentityCache> VSLClientConnection::userIdentityCache() const {
    return VSLUserIdentitySharedCache::sharedInstance();
}

const std::shared_ptr<WorkQueue>& VSLClientConnection::backgroundQueue() {
    static const auto queue = WorkQueue::serial("com.tarrow.vesseld.background", QueuePriority::Background);
    return queue;
}

std::optional<std::set<std::string>> VSLClientConnection::lookupForContainerClass(VSLContainerClass c) {
    const char* key = containerClassShortName(c);
    if (!key) return std::nullopt;
    std::shared_ptr<std::pair<std::mutex, std::map<std::string, std::set<std::string>>>> cache;
    {
        std::lock_guard<std::mutex> g(mutex_);
        if (!lookup_) return std::set<std::string>();
        if (!sanitizedLookup_) sanitizedLookup_ = std::make_shared<decltype(sanitizedLookup_)::element_type>();
        cache = sanitizedLookup_;
    }
    std::lock_guard<std::mutex> g(cache->first);
    auto it = cache->second.find(key);
    if (it != cache->second.end()) return it->second;
    std::set<std::string> entry;
    const Value* v = lookup_->find(key);
    if (v && v->arrayValue())
        for (const Value& item : *v->arrayValue())
            if (item.stringValue()) entry.insert(*item.stringValue());
    cache->second.emplace(key, entry);
    return entry;
}

bool VSLClientConnection::isEntitledForLookupWithClass(VSLContainerClass c, const std::string& identifier) {
    auto set = lookupForContainerClass(c);
    return set && set->count(identifier) != 0;
}

bool VSLClientConnection::completeWithError(uint64_t* code) {
    return commandQueue_->executeAllUntilExhaustedOrError(code);
}

}  // namespace vsl
