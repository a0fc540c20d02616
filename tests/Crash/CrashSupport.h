// Helpers of the crash tests: the durable-step trace a test daemon writes, the
// audit of its renames, and the one creation and deletion the tests drive.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "Support/DaemonProcess.h"
#include "Support/RootFiles.h"

namespace vsl::test {

struct TraceStep {
    uint64_t n = 0;
    std::string kind;
    std::string path;  // a rename's destination
    std::string from;  // a rename's source
};

std::vector<TraceStep> readTrace(const std::string& file);

// Every rename outside the volatile run/ directory of `root` must move an item synced
// after its last change (an fsync of it, the write that made it, or a synced item
// renamed to its name) and be followed, before the next rename, by an fsync of the
// directory it left and of the one it entered. Returns one line per fault.
std::vector<std::string> auditRenames(const std::vector<TraceStep>& steps, const std::string& root);

extern const char* const kIdentifier;

// Data containers (class 2) of the root's mobile user.
DaemonProcess::CtlResult createContainer(const DaemonProcess& d, const std::string& identifier = kIdentifier);
DaemonProcess::CtlResult lookUpContainer(const DaemonProcess& d, const std::string& identifier = kIdentifier);
DaemonProcess::CtlResult deleteContainer(const DaemonProcess& d, const std::string& identifier = kIdentifier);
DaemonProcess::CtlResult destroyDeathRow(const DaemonProcess& d);

std::string replyPath(const DaemonProcess::CtlResult& r);

}  // namespace vsl::test
