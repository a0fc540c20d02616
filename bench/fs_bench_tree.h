// Shared by the file-system benchmarks: a container-like tree of about 50,000 small
// files made in a temporary directory, timing helpers and the ratio line.
#pragma once

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <vector>

#include "bench_table.h"

namespace fsbench {

constexpr int kTopDirs = 50, kSubDirs = 10, kFilesPerDir = 100;  // 50,000 files, 550 directories

inline std::string makeScratchDir() {
    const char* tmp = std::getenv("TMPDIR");
    std::string templ = std::string(tmp ? tmp : "/tmp") + "/vessel-fsbench-XXXXXX";
    if (!::mkdtemp(templ.data())) {
        std::perror("mkdtemp");
        std::exit(1);
    }
    return templ;
}

// Files of 0..4095 bytes, as the small files of application containers mostly are.
inline void makeTree(const std::string& top) {
    std::string buf(4096, 'x');
    ::mkdir(top.c_str(), 0755);
    int n = 0;
    for (int d = 0; d < kTopDirs; d++) {
        std::string dir = top + "/d" + std::to_string(d);
        ::mkdir(dir.c_str(), 0755);
        for (int s = 0; s < kSubDirs; s++) {
            std::string sub = dir + "/s" + std::to_string(s);
            ::mkdir(sub.c_str(), 0755);
            for (int f = 0; f < kFilesPerDir; f++, n++) {
                std::string file = sub + "/f" + std::to_string(f);
                int fd = ::open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
                if (fd < 0 || ::write(fd, buf.data(), static_cast<size_t>((n * 37) % 4096)) < 0) {
                    std::perror(file.c_str());
                    std::exit(1);
                }
                ::close(fd);
            }
        }
    }
}

inline double millisecondsOf(const std::function<void()>& work) {
    auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
}

inline void runShell(const std::string& command) {
    if (std::system(command.c_str()) != 0) {
        std::fprintf(stderr, "failed: %s\n", command.c_str());
        std::exit(1);
    }
}

inline double median(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    size_t n = v.size();
    return n % 2 ? v[n / 2] : (v[n / 2 - 1] + v[n / 2]) / 2;
}

inline std::string runs(const std::vector<double>& v) {
    std::string s;
    for (double ms : v) s += (s.empty() ? "" : " ") + std::to_string(static_cast<long>(ms));
    return s;
}

// The table row of a timed comparison: medians of both sides, every run on stderr.
inline void printRatio(const char* name, const std::vector<double>& ours, const std::vector<double>& floor,
                       const char* target) {
    std::fprintf(stderr, "%s: runs [%s] ms, floor runs [%s] ms\n", name, runs(ours).c_str(), runs(floor).c_str());
    vslbench::printRow(name, median(ours), median(floor), "ms", target);
}

}  // namespace fsbench
