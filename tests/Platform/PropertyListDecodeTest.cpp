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

// A date beyond 32-bit seconds, in a file found by fuzzing: refused, since it could not
// be written back; a date that reads writes back.
TEST(PropertyListDecode, DatesBeyondWhatCanBeWrittenAreRefused) {
    std::ifstream in(std::string(VESSEL_SOURCE_DIR) + "/fuzz/regressions/policy_store/date-beyond-int32-seconds",
                     std::ios::binary);
    std::string file(std::istreambuf_iterator<char>(in), {});
    ASSERT_FALSE(file.empty());
    std::string why;
    EXPECT_FALSE(decodePropertyList(file.data(), file.size(), &why));
    EXPECT_EQ("date out of range for a property list", why);

    Value early = dict({{"d", Value::date(Date{-123456789123456789})}});
    auto bytes = encodeBinaryPropertyList(early, nullptr);
    ASSERT_TRUE(bytes);
    auto read = decodePropertyList(bytes->data(), bytes->size(), nullptr);
    ASSERT_TRUE(read);
    EXPECT_TRUE(encodeBinaryPropertyList(*read, nullptr));
}
