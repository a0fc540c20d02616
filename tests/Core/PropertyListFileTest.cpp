#include <gtest/gtest.h>

#include "Daemon/Core/VSLPropertyListFile.h"
#include "Platform/PropertyList.h"
#include "Support/TempRoot.h"

using namespace vsl;

namespace {

Value everyType() {
    return dict({
        {"bool", Value::boolean(true)},
        {"uint", Value::uint64(18446744073709551615ull >> 1)},
        {"neg", Value::int64(-42)},
        {"real", Value::real(2.5)},
        {"string", Value::string("héllo")},
        {"data", Value::data({0, 1, 2, 255})},
        {"date", Value::date(Date{1700000000123456000})},
        {"array", Value::array({Value::string("a"), Value::uint64(1)})},
        {"nested", dict({{"k", Value::string("v")}})},
    });
}

}  // namespace

TEST(PropertyListFile, WritesBinaryOneZeroThatReadsBackEqual) {
    std::string dir = test::makeTempDir("vessel-plist-");
    std::string path = dir + "/f.plist";
    VSLErrorRef error;
    ASSERT_TRUE(VSL_writeToURL(everyType(), path, kVSLWriteAtomic, &error));
    std::string bytes = test::readFile(path);
    EXPECT_EQ(0u, bytes.find("bplist00")) << "binary format version 1.0";

    auto back = VSL_dictionaryWithContentsOfURL(path, 0, &error);
    ASSERT_TRUE(back) << (error ? error->description() : "");
    EXPECT_EQ(everyType(), *back);

    // A uuid is stored as its 16 bytes.
    Uuid u = Uuid::random();
    ASSERT_TRUE(VSL_writeToURL(dict({{"u", Value::uuid(u)}}), path, kVSLWriteNone, &error));
    back = VSL_dictionaryWithContentsOfURL(path, 0, &error);
    ASSERT_TRUE(back);
    EXPECT_EQ(Data(u.bytes.begin(), u.bytes.end()), *back->find("u")->dataValue());
    test::removeTree(dir);
}

TEST(PropertyListFile, ReadsXMLAndRefusesWhatIsNotADictionaryFile) {
    std::string dir = test::makeTempDir("vessel-plist-");
    auto write = [&](const std::string& name, const std::string& text) {
        FILE* f = fopen((dir + "/" + name).c_str(), "w");
        fwrite(text.data(), 1, text.size(), f);
        fclose(f);
        return dir + "/" + name;
    };
    const std::string head = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">";
    VSLErrorRef error;

    auto xml = VSL_dictionaryWithContentsOfURL(
        write("x.plist", head + "<dict><key>VSLMetadataVersion</key><string>2</string><key>n</key><integer>7"
                                "</integer></dict></plist>"),
        0, &error);
    ASSERT_TRUE(xml);
    EXPECT_EQ("2", *xml->find("VSLMetadataVersion")->stringValue());
    EXPECT_EQ(7u, xml->find("n")->unsignedNumber());

    error.reset();
    EXPECT_FALSE(VSL_dictionaryWithContentsOfURL(
        write("a.plist", head + "<array><string>x</string></array></plist>"), 0, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(VSLGeneralErrorDomain, error->domain);
    EXPECT_EQ(2048, error->code) << "a root that is not a dictionary";

    // Binary root of another type too.
    auto bytes = encodeBinaryPropertyList(Value::array({Value::uint64(1)}), nullptr);
    ASSERT_TRUE(bytes);
    error.reset();
    EXPECT_FALSE(VSL_dictionaryWithContentsOfURL(write("b.plist", *bytes), 0, &error));
    EXPECT_EQ(2048, error ? error->code : 0);

    // Torn, empty and missing files are errors, never an empty dictionary.
    auto good = encodeBinaryPropertyList(everyType(), nullptr);
    for (size_t cut : {size_t(0), size_t(8), good->size() / 2, good->size() - 1}) {
        error.reset();
        EXPECT_FALSE(VSL_dictionaryWithContentsOfURL(write("t.plist", good->substr(0, cut)), 0, &error))
            << "cut at " << cut;
        EXPECT_TRUE(error);
    }
    error.reset();
    EXPECT_FALSE(VSL_dictionaryWithContentsOfURL(dir + "/missing.plist", 0, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(VSLPOSIXErrorDomain, error->domain);
    EXPECT_EQ(ENOENT, error->code);
    test::removeTree(dir);
}

TEST(PropertyListFile, DotDotComponents) {
    EXPECT_TRUE(containsDotDotPathComponents("/a/../b"));
    EXPECT_TRUE(containsDotDotPathComponents(".."));
    EXPECT_TRUE(containsDotDotPathComponents("a/.."));
    EXPECT_FALSE(containsDotDotPathComponents("/a/..b/c"));
    EXPECT_FALSE(containsDotDotPathComponents("/a/b.."));
    EXPECT_FALSE(containsDotDotPathComponents("/a/./b"));
}
