#include "Daemon/CodeSigning/VSLWhitelistTable.h"

namespace vsl {

const std::array<const char*, 2> kVSLWellKnownSystemContainers = {
    "com.tarrow.settingsd",
    "com.tarrow.diagnosticsd",
};

const std::array<const char*, 8> kVSLWellKnownSystemGroupContainers = {
    "systemgroup.com.tarrow.sharedsettings", "systemgroup.com.tarrow.deviceconfiguration",
    "systemgroup.com.tarrow.networkpolicy",  "systemgroup.com.tarrow.installlogs",
    "systemgroup.com.tarrow.mediaindex",     "systemgroup.com.tarrow.telephony",
    "systemgroup.com.tarrow.fontregistry",   "systemgroup.com.tarrow.sharedcredentials",
};

const char* const kVSLInternalSystemGroupContainer = "systemgroup.com.tarrow.coveragedata";

const std::array<VSLWhitelistContainerRow, 1> kVSLLookupByContainer = {{
    {kVSLClassInternalDaemon, "com.tarrow.diagnostics.shared"},
}};

const std::array<VSLWhitelistCallerRow, 9> kVSLLookupByCodeSignIdentifier = {{
    {"com.tarrow.installd", kVSLClassUndefined, nullptr},
    {"com.tarrow.backupd", kVSLClassUndefined, nullptr},
    {"com.tarrow.restored", kVSLClassUndefined, nullptr},
    {"com.tarrow.migrationd", kVSLClassUndefined, nullptr},
    {"com.tarrow.diagnosticsd", kVSLClassUndefined, nullptr},
    {"com.tarrow.filesharingd", kVSLClassUndefined, nullptr},
    {"com.tarrow.mediasyncd", kVSLClassAppGroup, "group.com.tarrow.sharedmedia"},
    {"com.tarrow.feedbackd", kVSLClassApplicationData, "com.tarrow.feedback"},
    {"com.tarrow.crashreporterd", kVSLClassApplicationData, "com.tarrow.crashreporter"},
}};

}  // namespace vsl
