// The checks of `vesselctl doctor`, each looking at the current system root without
// changing it and adding what is wrong, with its fix, to the findings.
#pragma once

#include <string>
#include <vector>

struct DoctorFinding {
    std::string check;
    std::string problem;
    std::string fix;
};

struct DoctorCheck {
    const char* name;
    void (*run)(const std::string& socketPath, std::vector<DoctorFinding>* findings);
};

// In the order doctor runs them.
const std::vector<DoctorCheck>& doctorChecks();
