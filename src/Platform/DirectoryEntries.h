// The names in an open directory, read in one go so that the caller may change the
// directory while it works through them.
#pragma once

#include <string>
#include <vector>

namespace vsl {

struct DirectoryEntry {
    std::string name;
    unsigned char type;  // DT_* from the directory; DT_UNKNOWN when the file system does not say
};

// Reads every entry but "." and ".." of the directory `dirfd` refers to. The
// descriptor's offset is consumed. Returns 0 or an errno value.
int readDirectoryEntries(int dirfd, std::vector<DirectoryEntry>* entries);

}  // namespace vsl
