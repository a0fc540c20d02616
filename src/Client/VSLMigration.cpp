#include "Client/VSLMigration.h"

#include "Client/VSLProtocol.h"

namespace vsl::client {

namespace {

VSLReply send(VSLConnection& connection, const char* command) {
    return connection.sendRequest(
        Value::dictionary(Dictionary{{"Command", Value::uint64(*commandNumberForName(command))}}));
}

}  // namespace

VSLReply performDataMigration(VSLConnection& connection) { return send(connection, "performDataMigration"); }

VSLReply performPerUserDataMigration(VSLConnection& connection) {
    return send(connection, "performPerUserDataMigration");
}

}  // namespace vsl::client
