// A datagram socket bound at a path, standing in for the service manager's end of a
// channel (notifications, the journal) in tests.
#pragma once

#include <string>
#include <vector>

#include "Platform/UniqueFd.h"

namespace vsl::test {

class DatagramListener {
public:
    explicit DatagramListener(const std::string& path);
    bool bound() const { return bound_; }
    // The datagrams that have arrived since the last call, without waiting.
    std::vector<std::string> receive();

private:
    UniqueFd fd_;
    bool bound_ = false;
};

}  // namespace vsl::test
