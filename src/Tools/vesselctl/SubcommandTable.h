// The table of vesselctl's subcommands: one entry each, in the order `vesselctl help`
// lists them. A new subcommand is one entry here and a run function in its group's file.
#pragma once

#include <span>
#include <string>
#include <vector>

#include "Output.h"

struct SubcommandArgs {
    std::string name;                // the subcommand as typed
    std::vector<std::string> words;  // what follows it, --json and --plist taken out
};

struct Subcommand {
    const char* name;
    const char* synopsis;  // the arguments after the name
    const char* summary;
    int (*run)(const CtlOptions& options, const SubcommandArgs& args);
};

std::span<const Subcommand> subcommands();
const Subcommand* findSubcommand(const std::string& name);

// The run functions, by group (each defined in the file named).
// Verbs.cpp, VerbsInfo.cpp: create lookup list delete du wipe; info protect groups replace.
int runCreate(const CtlOptions&, const SubcommandArgs&);
int runLookup(const CtlOptions&, const SubcommandArgs&);
int runList(const CtlOptions&, const SubcommandArgs&);
int runDelete(const CtlOptions&, const SubcommandArgs&);
int runDiskUsage(const CtlOptions&, const SubcommandArgs&);
int runWipe(const CtlOptions&, const SubcommandArgs&);
int runInfo(const CtlOptions&, const SubcommandArgs&);
int runProtect(const CtlOptions&, const SubcommandArgs&);
int runGroups(const CtlOptions&, const SubcommandArgs&);
int runReplace(const CtlOptions&, const SubcommandArgs&);
// Status.cpp, Doctor.cpp.
int runStatus(const CtlOptions&, const SubcommandArgs&);
int runDoctor(const CtlOptions&, const SubcommandArgs&);
// Subcommands.cpp, GroupSubcommands.cpp, ContentSubcommands.cpp: requests built from
// the words, sent as they are.
int runRequestSubcommand(const CtlOptions&, const SubcommandArgs&);
// Keybag.cpp, Upcall.cpp.
int runKeybag(const CtlOptions&, const SubcommandArgs&);
int runUpcall(const CtlOptions&, const SubcommandArgs&);
