// `vesselctl upcall`: asks the kernel upcall channel for a process's containers, as
// the kernel would, and prints the reply items (runUpcall, SubcommandTable.h).
//   upcall uid=N [container-id=ID] [signature-id=ID] [application-id=ID] [type=0|1]
//          [group=ID]... [system-container=ID] [system-group=ID]... [persona=N]
// Exit status: 0 for return code 0 with status 1, 1 for any other answer, 2 for a
// usage error, 3 when the channel cannot be reached or does not answer.
#pragma once
