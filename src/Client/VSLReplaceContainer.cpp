#include "Client/VSLReplaceContainer.h"

#include "Client/VSLProtocol.h"

namespace vsl::client {

namespace {

void addReference(Dictionary& request, const std::string& prefix, const VSLContainerReference& container) {
    request.insert_or_assign(prefix + "Identifier", Value::string(container.identifier));
    request.insert_or_assign(prefix + "ContainerClass", Value::uint64(container.containerClass));
    request.insert_or_assign(prefix + "ContainerUUID", Value::uuid(container.uuid));
    if (container.personaUniqueString)
        request.insert_or_assign(prefix + "PersonaUniqueString", Value::string(*container.personaUniqueString));
}

}  // namespace

Value replaceContainerRequest(const std::optional<VSLContainerReference>& oldContainer,
                              const VSLContainerReference& newContainer) {
    Dictionary request{{"Command", Value::uint64(*commandNumberForName("replaceContainer"))}};
    if (oldContainer) addReference(request, "Old", *oldContainer);
    addReference(request, "New", newContainer);
    return Value::dictionary(std::move(request));
}

uint64_t replaceContainer(VSLConnection& connection, const std::optional<VSLContainerReference>& oldContainer,
                          const VSLContainerReference& newContainer, std::string* error,
                          std::optional<std::chrono::milliseconds> timeout) {
    return resultCode(connection.sendRequest(replaceContainerRequest(oldContainer, newContainer), timeout), error);
}

}  // namespace vsl::client
