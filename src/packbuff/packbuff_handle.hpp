// For C++ callers: a packbuff handle freed on every way out.
#pragma once

#include <memory>

#include "packbuff/packbuff.h"

struct PackbuffHandleDeleter {
    void operator()(sb_packbuff* pb) const { sb_packbuff_free(pb); }
};
using PackbuffHandle = std::unique_ptr<sb_packbuff, PackbuffHandleDeleter>;
