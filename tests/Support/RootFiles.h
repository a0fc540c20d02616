// Reading and writing files below a test daemon's root.
#pragma once

#include <string>
#include <vector>

#include "Support/DaemonProcess.h"

namespace vsl::test {

// Writes a file below the root, making its parent directories.
void writeRootFile(const DaemonProcess& daemon, const std::string& relative, const std::string& bytes);

// The entries of a directory but "." and "..", sorted; empty when it cannot be read.
std::vector<std::string> entriesOf(const std::string& directory);

}  // namespace vsl::test
