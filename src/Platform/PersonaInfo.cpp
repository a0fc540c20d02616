#include "Platform/PersonaInfo.h"

namespace vsl {

std::optional<KernelPersonaInfo> kernelPersonaInfo(UserManagement& userManagement, uint32_t personaID) {
    for (const PersonaAttributes& persona : userManagement.allPersonas()) {
        if (persona.kernelPersonaID != personaID) continue;
        KernelPersonaInfo info;
        info.personaID = personaID;
        info.type = persona.kernelPersonaType.value_or(persona.isEnterprise ? kKernelPersonaTypeEnterprise
                                                                            : kKernelPersonaTypeOther);
        info.uid = persona.uid;
        info.gid = persona.gid;
        return info;
    }
    return std::nullopt;
}

}  // namespace vsl
