#include "Platform/Transaction.h"

#include <condition_variable>
#include <map>
#include <mutex>
#include <utility>

namespace vsl {

namespace {

struct Registry {
    std::mutex mutex;
    std::condition_variable none;
    std::map<std::string, size_t> open;  // name -> how many are open
    size_t count = 0;
};

// Never destroyed: transactions may close on worker threads during exit.
Registry& registry() {
    static Registry* r = new Registry;
    return *r;
}

}  // namespace

Transaction::Transaction(std::string name) : name_(std::move(name)), open_(true) {
    Registry& r = registry();
    std::lock_guard lock(r.mutex);
    ++r.open[name_];
    ++r.count;
}

Transaction::~Transaction() { close(); }

Transaction::Transaction(Transaction&& other) noexcept
    : name_(std::move(other.name_)), open_(std::exchange(other.open_, false)) {}

Transaction& Transaction::operator=(Transaction&& other) noexcept {
    if (this != &other) {
        close();
        name_ = std::move(other.name_);
        open_ = std::exchange(other.open_, false);
    }
    return *this;
}

void Transaction::close() {
    if (!open_) return;
    open_ = false;
    Registry& r = registry();
    std::lock_guard lock(r.mutex);
    auto it = r.open.find(name_);
    if (--it->second == 0) r.open.erase(it);
    if (--r.count == 0) r.none.notify_all();
}

size_t openTransactionCount() {
    Registry& r = registry();
    std::lock_guard lock(r.mutex);
    return r.count;
}

std::vector<std::string> openTransactionNames() {
    Registry& r = registry();
    std::lock_guard lock(r.mutex);
    std::vector<std::string> names;
    for (const auto& [name, n] : r.open) names.insert(names.end(), n, name);
    return names;
}

bool waitForNoTransactions(std::chrono::milliseconds timeout) {
    Registry& r = registry();
    std::unique_lock lock(r.mutex);
    return r.none.wait_for(lock, timeout, [&] { return r.count == 0; });
}

}  // namespace vsl
