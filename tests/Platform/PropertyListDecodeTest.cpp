#include <gtest/gtest.h>

#include <fstream>
#include <iterator>

#include "Platform/PropertyList.h"

using namespace vsl;

namespace {
std::string corpus(const char* name) {
    std::ifstream in(std::string(VESSEL_SOURCE_DIR) + "/fuzz/corpus/metadata/" + name, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}
}  // namespace

// Files that once made the parser abort the daemon: they must be refused instead.
TEST(PropertyListDecode, RefusesNulsAndBrokenTextInsteadOfAborting) {
    for (const char* name : {"string_with_nul", "key_with_nul", "string_not_utf8"}) {
        std::string bytes = corpus(name);
        ASSERT_FALSE(bytes.empty()) << name;
        std::string why;
        EXPECT_FALSE(decodePropertyList(bytes.data(), bytes.size(), &why)) << name;
        EXPECT_FALSE(why.empty()) << name;
    }
    const std::string xmlWithNul =
        "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>a&#0;b</key><string>x</string></dict></plist>";
    EXPECT_FALSE(decodePropertyList(xmlWithNul.data(), xmlWithNul.size(), nullptr));

    // What we write ourselves still reads back.
    Value good = dict({{"k\xc3\xa9y", Value::string("v\xe2\x82\xac")}, {"n", Value::uint64(7)}});
    auto bytes = encodeBinaryPropertyList(good, nullptr);
    ASSERT_TRUE(bytes);
    EXPECT_EQ(good, decodePropertyList(bytes->data(), bytes->size(), nullptr));
    for (size_t cut = 0; cut < bytes->size(); cut += 7)
        decodePropertyList(bytes->data(), cut, nullptr);  // never aborts
}
