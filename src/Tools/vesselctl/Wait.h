// vesselctl wait NAME [--timeout SECONDS]: returns once the daemon has posted a
// notification (exit 0), or after the timeout (exit 1).
#pragma once

#include "SubcommandTable.h"

// Keys (--json): Name Posted
int runWait(const CtlOptions& options, const SubcommandArgs& args);
