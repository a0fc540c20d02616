// Writes a few small, valid packbuffs as the fuzzer's seed corpus: packbuff_make_seeds <directory>.
#include "packbuff/packbuff.h"

#include <cstdio>
#include <functional>
#include <string>

namespace {

bool write(const std::string& dir, const char* name, const std::function<void(sb_packbuff*)>& fill) {
    sb_packbuff* pb = sb_packbuff_new(64);
    if (pb == nullptr) return false;
    fill(pb);
    const std::string path = dir + "/" + name;
    FILE* f = fopen(path.c_str(), "wb");
    bool ok = f != nullptr && fwrite(sb_packbuff_get_bytes(pb), 1, sb_packbuff_get_size(pb), f) == sb_packbuff_get_size(pb);
    if (f != nullptr) ok = fclose(f) == 0 && ok;
    sb_packbuff_free(pb);
    return ok;
}

void str(sb_packbuff* pb, uint16_t type, const std::string& s) { sb_packbuff_pack_string(pb, type, s.c_str(), s.size()); }

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        fprintf(stderr, "usage: %s <directory>\n", argv[0]);
        return 2;
    }
    const std::string dir = argv[1];
    bool ok = write(dir, "empty", [](sb_packbuff*) {});
    ok &= write(dir, "uint32", [](sb_packbuff* pb) { sb_packbuff_pack_uint32(pb, 3, 5); });
    ok &= write(dir, "string", [](sb_packbuff* pb) { str(pb, 1, "ab"); });
    ok &= write(dir, "bytes", [](sb_packbuff* pb) {
        sb_packbuff_pack_bytes(pb, 9, "\x00\x01\x02\x03\x04\x05\x06\x07", 8);
        sb_packbuff_pack_bytes(pb, 9, "\xFF", 1);
        sb_packbuff_pack_bytes(pb, 9, nullptr, 0);
    });
    // Shaped like the kernel's container request and the daemon's reply.
    ok &= write(dir, "request", [](sb_packbuff* pb) {
        str(pb, 0, "com.example.app");
        str(pb, 1, "com.example.app");
        str(pb, 2, "ABCDE12345.com.example.app");
        sb_packbuff_pack_uint32(pb, 3, 501);
        str(pb, 4, "group.com.example.shared");
        sb_packbuff_pack_uint32(pb, 5, 0);
        str(pb, 6, "systemgroup.com.example.sys");
        str(pb, 7, "systemgroup.com.example.logs");
        sb_packbuff_pack_uint32(pb, 8, 0xFFFFFFFF);
    });
    ok &= write(dir, "reply", [](sb_packbuff* pb) {
        str(pb, 100, "/var/mobile");
        str(pb, 1, "/var/mobile/Containers/Data/Application/0A1B");
        str(pb, 2, "/var/mobile/Containers/Data/Application/0A1B/tmp");
        sb_packbuff_pack_key_with_string_value(pb, 3, "group.com.example.shared", 4, "/var/mobile/Containers/Shared/AppGroup/2C3D");
        sb_packbuff_pack_key_with_string_value(pb, 102, "systemgroup.com.example.sys", 103, "/var/containers/Shared/SystemGroup/4E5F");
        sb_packbuff_pack_uint32(pb, 0, 1);
    });
    if (!ok) fprintf(stderr, "could not write every seed into %s\n", dir.c_str());
    return ok ? 0 : 1;
}
