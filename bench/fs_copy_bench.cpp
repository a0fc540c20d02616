// Recursive copy of a ~50,000-file tree: the file manager against
// `cp -a --reflink=auto`, warm cache, alternating order; copies are removed untimed.
#include "Daemon/Storage/VSLFileManager.h"
#include "fs_bench_tree.h"

int main() {
    std::string scratch = fsbench::makeScratchDir();
    std::string tree = scratch + "/tree", copy = scratch + "/copy";
    fsbench::makeTree(tree);
    fsbench::runShell("du -s '" + tree + "' > /dev/null");

    const vsl::VSLFileManager& fm = vsl::VSLFileManager::defaultManager();
    std::vector<double> ours, cp;
    for (int round = 0; round < 3; round++) {
        for (int turn = 0; turn < 2; turn++) {
            if ((round + turn) % 2 == 0) {
                ours.push_back(fsbench::millisecondsOf([&] {
                    vsl::VSLErrorRef error;
                    if (!fm.copyItemAtURL(tree, copy, &error)) std::exit(1);
                }));
            } else {
                cp.push_back(fsbench::millisecondsOf(
                    [&] { fsbench::runShell("cp -a --reflink=auto '" + tree + "' '" + copy + "'"); }));
            }
            fsbench::runShell("rm -rf '" + copy + "'");
            ::sync();
        }
    }
    fsbench::printRatio("copy", fsbench::median(ours), fsbench::median(cp), "cp -a --reflink=auto");
    fsbench::runShell("rm -rf '" + scratch + "'");
    return 0;
}
