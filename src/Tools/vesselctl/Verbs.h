// Helpers of the verbs (Verbs.cpp, VerbsInfo.cpp): the everyday names for the
// protocol's container commands, taking the identifier as a word and the class as
// --class (data unless given). key=value arguments still add to or override the request.
#pragma once

#include <functional>

#include "SubcommandTable.h"
#include "VerbArguments.h"

// Parses the words, lets `build` fill the request (false: a usage error), adds the
// key=value arguments and sends it; a usage error prints the entry's synopsis.
// Commands that name a container by its UUID as well (`needsUUID`) get it from a
// lookup first unless UUID= was given.
int runVerb(const CtlOptions& options, const SubcommandArgs& args,
            const std::function<bool(const VerbArguments&, vsl::Dictionary&)>& build, bool needsUUID = false);

// Identifier (when given as a word) and ContainerClass (--class, else data).
void setContainer(vsl::Dictionary& request, const VerbArguments& parsed, const std::string* identifier);
