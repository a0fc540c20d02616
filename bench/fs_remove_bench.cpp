// Recursive removal of a ~50,000-file tree: the file manager against `rm -rf`. Each
// round makes the tree afresh and removes it once with each, in alternating order.
#include "Daemon/Storage/VSLFileManager.h"
#include "fs_bench_tree.h"

int main() {
    if (!vslbench::haveProgram("rm")) vslbench::floorUnavailable("fs_remove_bench", "rm is not on PATH");
    std::string scratch = fsbench::makeScratchDir();
    const vsl::VSLFileManager& fm = vsl::VSLFileManager::defaultManager();
    std::vector<double> ours, rm;
    for (int round = 0; round < 2; round++) {
        for (int turn = 0; turn < 2; turn++) {
            std::string tree = scratch + "/tree";
            fsbench::makeTree(tree);
            ::sync();
            if ((round + turn) % 2 == 0) {
                ours.push_back(fsbench::millisecondsOf([&] {
                    vsl::VSLErrorRef error;
                    if (!fm.removeItemAtURL(tree, &error)) std::exit(1);
                }));
            } else {
                rm.push_back(fsbench::millisecondsOf([&] { fsbench::runShell("rm -rf '" + tree + "'"); }));
            }
        }
    }
    fsbench::printRatio("remove, 50k files / rm -rf", ours, rm, "<= 1.3");
    fsbench::runShell("rm -rf '" + scratch + "'");
    return 0;
}
