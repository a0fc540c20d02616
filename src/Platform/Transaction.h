// The process keep-alive count: while a transaction is open the daemon has work in
// flight and shutdown waits for it. Open one for work that must not be cut short.
#pragma once

#include <chrono>
#include <cstddef>
#include <string>
#include <vector>

namespace vsl {

class Transaction {
public:
    explicit Transaction(std::string name);
    ~Transaction();
    Transaction(Transaction&& other) noexcept;
    Transaction& operator=(Transaction&& other) noexcept;
    Transaction(const Transaction&) = delete;
    Transaction& operator=(const Transaction&) = delete;

    const std::string& name() const { return name_; }
    bool isOpen() const { return open_; }
    // Closes early; the destructor then does nothing.
    void close();

private:
    std::string name_;
    bool open_ = false;
};

size_t openTransactionCount();
// Names of the open transactions, sorted; for shutdown diagnostics.
std::vector<std::string> openTransactionNames();
// True once no transaction is open; false if some are still open after timeout.
bool waitForNoTransactions(std::chrono::milliseconds timeout);

}  // namespace vsl
