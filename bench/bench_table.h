// The one output format of every benchmark: a row per measure,
//   name  value  floor  ratio  target
// with the floor measured in the same run on the same tree, ratio = value / floor
// and the target the ratio must meet. A figure without a floor (memory, a reply
// time) prints "-" for floor and ratio and its target in its own unit. Everything
// else a benchmark says goes to stderr, so bench/run can gather the rows of all of
// them into one table.
#pragma once

#include <cstdio>
#include <cstdlib>
#include <string>

namespace vslbench {

inline void printHeaderOnce() {
    static bool printed = false;
    if (printed) return;
    printed = true;
    std::printf("%-54s %14s %14s %7s  %s\n", "name", "value", "floor", "ratio", "target");
}

inline std::string withUnit(double v, const char* unit) {
    char buf[64];
    std::snprintf(buf, sizeof buf, v >= 100 ? "%.0f %s" : v >= 10 ? "%.1f %s" : "%.2f %s", v, unit);
    return buf;
}

// `target` reads as a bound on the ratio, e.g. "<= 1.3" or ">= 0.8".
inline void printRow(const std::string& name, double value, double floor, const char* unit, const char* target) {
    printHeaderOnce();
    std::printf("%-54s %14s %14s %7.2f  %s\n", name.c_str(), withUnit(value, unit).c_str(),
                withUnit(floor, unit).c_str(), value / floor, target);
    std::fflush(stdout);
}

// A figure with no floor of its own; `target` in the figure's unit.
inline void printFigure(const std::string& name, double value, const char* unit, const char* target) {
    printHeaderOnce();
    std::printf("%-54s %14s %14s %7s  %s\n", name.c_str(), withUnit(value, unit).c_str(), "-", "-", target);
    std::fflush(stdout);
}

// A benchmark whose floor cannot be measured prints no ratio: it says why and fails.
[[noreturn]] inline void floorUnavailable(const char* benchmark, const std::string& why) {
    std::fprintf(stderr, "%s: cannot measure the floor: %s\n", benchmark, why.c_str());
    std::exit(2);
}

// A process's resident set in KiB ("self" or a pid), or -1.
inline long residentKiB(const std::string& pid = "self") {
    FILE* f = std::fopen(("/proc/" + pid + "/status").c_str(), "re");
    if (!f) return -1;
    char line[256];
    long kib = -1;
    while (std::fgets(line, sizeof line, f))
        if (std::sscanf(line, "VmRSS: %ld", &kib) == 1) break;
    std::fclose(f);
    return kib;
}

// Whether a program the floor needs is on PATH.
inline bool haveProgram(const char* name) {
    return std::system((std::string("command -v ") + name + " >/dev/null 2>&1").c_str()) == 0;
}

}  // namespace vslbench
