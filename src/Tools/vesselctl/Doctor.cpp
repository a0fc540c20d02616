// vesselctl doctor: runs every check of DoctorChecks.cpp against the root; changes
// nothing. Keys (--json): Healthy Root Checks Findings (each: Check Problem Fix).
// Exit status 1 when anything is wrong.
#include <cstdio>

#include "Client/VSLArguments.h"
#include "DoctorChecks.h"
#include "Platform/SystemRoot.h"
#include "SubcommandTable.h"

using namespace vsl;

int runDoctor(const CtlOptions& options, const SubcommandArgs& args) {
    if (!args.words.empty()) return printUsageError(options, "doctor");
    setSystemRoot(options.root);
    std::vector<DoctorFinding> findings;
    Array checks;
    for (const auto& check : doctorChecks()) {
        check.run(options.daemonSocketPath(), &findings);
        checks.push_back(Value::string(check.name));
    }
    if (options.json) {
        Array list;
        for (const auto& f : findings)
            list.push_back(Value::dictionary({{"Check", Value::string(f.check)},
                                              {"Problem", Value::string(f.problem)},
                                              {"Fix", Value::string(f.fix)}}));
        const Value out = Value::dictionary({{"Healthy", Value::boolean(findings.empty())},
                                             {"Root", Value::string(systemRoot())},
                                             {"Checks", Value::array(std::move(checks))},
                                             {"Findings", Value::array(std::move(list))}});
        std::printf("%s\n", client::renderJson(out).c_str());
    } else {
        for (const auto& f : findings) std::printf("problem (%s): %s\n  fix: %s\n", f.check.c_str(), f.problem.c_str(), f.fix.c_str());
        std::printf("%s: %zu problem%s found by %zu checks\n", systemRoot().c_str(), findings.size(),
                    findings.size() == 1 ? "" : "s", doctorChecks().size());
    }
    return findings.empty() ? kExitSuccess : kExitFailed;
}
