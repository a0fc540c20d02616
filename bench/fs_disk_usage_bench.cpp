// Disk usage of a ~50,000-file tree: the file manager's walk against `du -s`, warm cache.
#include "Daemon/Storage/VSLFileManager.h"
#include "fs_bench_tree.h"

int main() {
    if (!vslbench::haveProgram("du")) vslbench::floorUnavailable("fs_disk_usage_bench", "du is not on PATH");
    std::string scratch = fsbench::makeScratchDir();
    std::string tree = scratch + "/tree";
    fsbench::makeTree(tree);
    fsbench::runShell("du -s '" + tree + "' > /dev/null");  // warm the caches for both

    const vsl::VSLFileManager& fm = vsl::VSLFileManager::defaultManager();
    std::vector<double> ours, du;
    uint64_t bytes = 0;
    for (int round = 0; round < 7; round++) {
        ours.push_back(fsbench::millisecondsOf([&] { bytes = fm.diskUsageForURL(tree); }));
        du.push_back(fsbench::millisecondsOf([&] { fsbench::runShell("du -s '" + tree + "' > /dev/null"); }));
    }
    std::fprintf(stderr, "tree: %d files, %llu bytes in regular files\n",
                 fsbench::kTopDirs * fsbench::kSubDirs * fsbench::kFilesPerDir, static_cast<unsigned long long>(bytes));
    fsbench::printRatio("disk usage, 50k files / du -s", ours, du, "<= 1.0");
    fsbench::runShell("rm -rf '" + scratch + "'");
    return 0;
}
