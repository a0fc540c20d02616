// Data-protection classes of files and directories: the class number lives in the
// extended attribute "trusted.vessel.protection-class" ("user.vessel.protection-class"
// when the process is not root, so an unprivileged daemon works too). An item that
// never had a class reads as 0. While the keybag is locked a change from or to class
// 1 (complete protection) is refused with EPERM, as the platform refuses it.
#pragma once

#include <string>

namespace vsl {

constexpr int kProtectionClassNone = 0;
constexpr int kProtectionClassComplete = 1;

const char* protectionClassAttributeName();

// `fd` is a descriptor of the item (O_PATH is fine). Return 0 or an errno value.
int getProtectionClass(int fd, int* protectionClass);
// Writes only when the class differs; `path` names the durable step.
int setProtectionClass(int fd, const std::string& path, int protectionClass);

}  // namespace vsl
