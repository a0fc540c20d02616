// Recursive copy of a ~50,000-file tree: the file manager against
// `cp -a --reflink=auto`, warm cache, alternating order. Every copy gets its own
// destination and all are removed at the end: creating files next to freshly freed
// inodes is slow on ext4 for minutes and would blur the comparison.
#include "Daemon/Storage/VSLFileManager.h"
#include "fs_bench_tree.h"

int main() {
    if (!vslbench::haveProgram("cp")) vslbench::floorUnavailable("fs_copy_bench", "cp is not on PATH");
    std::string scratch = fsbench::makeScratchDir();
    std::string tree = scratch + "/tree";
    fsbench::makeTree(tree);
    fsbench::runShell("du -s '" + tree + "' > /dev/null");

    const vsl::VSLFileManager& fm = vsl::VSLFileManager::defaultManager();
    std::vector<double> ours, cp;
    for (int round = 0; round < 2; round++) {
        for (int turn = 0; turn < 2; turn++) {
            std::string copy = scratch + "/copy" + std::to_string(round) + "-" + std::to_string(turn);
            ::sync();
            if ((round + turn) % 2 == 0) {
                ours.push_back(fsbench::millisecondsOf([&] {
                    vsl::VSLErrorRef error;
                    if (!fm.copyItemAtURL(tree, copy, &error)) std::exit(1);
                }));
            } else {
                cp.push_back(fsbench::millisecondsOf(
                    [&] { fsbench::runShell("cp -a --reflink=auto '" + tree + "' '" + copy + "'"); }));
            }
        }
    }
    fsbench::printRatio("copy, 50k files / cp -a --reflink=auto", ours, cp, "<= 1.3");
    fsbench::runShell("rm -rf '" + scratch + "'");
    return 0;
}
