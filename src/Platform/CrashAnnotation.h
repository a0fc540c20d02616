// The crash-report message annotation: one process-wide record that a crash log
// includes. Here it is kept in memory (visible in a core dump), written to stderr
// and, when configured, to a file in the log directory.
#pragma once

#include <string>
#include <vector>

namespace vsl {

void setCrashAnnotationFile(const std::string& path);
void setCrashReportMessage(const std::string& text);
const char* crashReportMessage();

// The current thread's call stack as printable lines.
std::vector<std::string> currentCallStackSymbols(int skip = 0);
// The current thread's name ("" when none was set).
std::string currentThreadName();

}  // namespace vsl
