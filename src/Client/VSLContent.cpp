#include "Client/VSLContent.h"

#include "Client/VSLProtocol.h"

namespace vsl::client {

namespace {

Dictionary command(const char* name) { return {{"Command", Value::uint64(*commandNumberForName(name))}}; }

VSLReply send(VSLConnection& connection, Dictionary request) {
    return connection.sendRequest(Value::dictionary(std::move(request)));
}

}  // namespace

VSLReply wipeContainer(VSLConnection& connection, const std::string& identifier) {
    Dictionary request = command("wipeContainer");
    request["Identifier"] = Value::string(identifier);
    return send(connection, std::move(request));
}

VSLReply deleteContainerContent(VSLConnection& connection, const std::string& identifier, uint64_t containerClass) {
    Dictionary request = command("deleteContainerContent");
    request["Identifier"] = Value::string(identifier);
    request["ContainerClass"] = Value::uint64(containerClass);
    return send(connection, std::move(request));
}

VSLReply stageSharedContent(VSLConnection& connection, const std::string& systemGroupIdentifier,
                            const std::string& sourcePath, const std::string& destPath) {
    Dictionary request = command("stageSharedContent");
    request["Identifier"] = Value::string(systemGroupIdentifier);
    request["SourcePath"] = Value::string(sourcePath);
    request["DestPath"] = Value::string(destPath);
    return send(connection, std::move(request));
}

VSLReply userManagedAssetsPath(VSLConnection& connection, const std::optional<std::string>& identifier,
                               bool isRelative, bool createIfNecessary) {
    Dictionary request = command("userManagedAssetsPath");
    if (identifier) request["Identifier"] = Value::string(*identifier);
    request["IsRelative"] = Value::boolean(isRelative);
    request["CreateIfNecessary"] = Value::boolean(createIfNecessary);
    return send(connection, std::move(request));
}

VSLReply deleteUserManagedAsset(VSLConnection& connection, const std::string& identifier,
                                const std::string& relativePath) {
    Dictionary request = command("deleteUserManagedAsset");
    request["Identifier"] = Value::string(identifier);
    request["SourcePath"] = Value::string(relativePath);
    return send(connection, std::move(request));
}

}  // namespace vsl::client
