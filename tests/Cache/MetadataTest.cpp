#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>

#include "Cache/CacheTestSupport.h"
#include "Daemon/Core/VSLPropertyListFile.h"
#include "Daemon/Storage/VSLFileManager.h"
#include "Daemon/Storage/VSLGlobalConfiguration.h"
#include "Daemon/Storage/VSLMetadata.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

const char* const kIdentifier = "com.example.app";

class Metadata : public ::testing::Test {
protected:
    void SetUp() override {
        resetCacheTestRoot();
        identities = identityCacheWithoutPersonas();
        mobile = VSLUserIdentityCache::defaultUserIdentity();
        ASSERT_TRUE(mobile);
    }

    // A well-formed class 2 file of the mobile user.
    Dictionary goodDictionary() const {
        return Dictionary{
            {kVSLMetadataIdentifierKey, Value::string(kIdentifier)},
            {kVSLMetadataUUIDKey, Value::string(Uuid::random().string())},
            {kVSLMetadataContentClassKey, Value::uint64(2)},
            {kVSLMetadataVersionKey, Value::string("2")},
            {kVSLMetadataUserIdentityKey, mobile->plist()},
        };
    }

    // A container directory in the class directory holding `bytes` as its metadata file.
    std::string containerWithBytes(const std::string& bytes, VSLContainerClass containerClass = 2) {
        std::string dir = joinPath(classDirectory(mobile, containerClass), Uuid::random().string());
        EXPECT_EQ(0, ::mkdir(dir.c_str(), 0755));
        writeBytes(metadataPathOf(dir), bytes);
        return dir;
    }

    VSLMetadataRef read(const std::string& dir, VSLErrorRef* error, bool checkClassPath = true,
                        VSLUserIdentityRef expected = nullptr) {
        return VSLMetadata::readAndValidateMetadataAtUrl(dir, expected ? expected : mobile, checkClassPath, error,
                                                         identities.get());
    }

    // The read fails with `code` and exactly `message`.
    void expectFailure(const std::string& dir, uint64_t code, const std::string& message) {
        VSLErrorRef error;
        EXPECT_FALSE(read(dir, &error));
        ASSERT_TRUE(error);
        EXPECT_EQ(VSLErrorDomain, error->domain);
        EXPECT_EQ(static_cast<int64_t>(code), error->code);
        EXPECT_EQ(message, error->localizedDescription.value_or(""));
    }

    std::shared_ptr<VSLUserIdentityCache> identities;
    VSLUserIdentityRef mobile;
};

TEST_F(Metadata, WriteStagesARenamedFileThatReadsBackWhole) {
    std::string dir = joinPath(classDirectory(mobile, 2), Uuid::random().string());
    ASSERT_EQ(0, ::mkdir(dir.c_str(), 0755));
    uint64_t code = kVSLSuccess;
    auto identity = VSLConcreteContainerIdentity::containerIdentityWithUUID(Uuid::random(), mobile, kIdentifier, 2, &code);
    auto metadata = VSLMetadata::initWithContainerIdentity(identity, dict({{"Key", Value::string("value")}}), dir,
                                                           std::string("Assets"));
    // A name still linked to the previous file shows that the new one was renamed in,
    // not written over it in place.
    std::string file = metadataPathOf(dir);
    writeBytes(file, "previous");
    ASSERT_EQ(0, ::link(file.c_str(), (dir + "/previous").c_str()));

    VSLErrorRef error;
    ASSERT_TRUE(metadata->writeMetadataToDiskWithError(&error)) << error->description();
    EXPECT_EQ("previous", readFile(dir + "/previous"));
    std::string staging = *VSLGlobalConfiguration::sharedInstance()->stagingDirectoryURLForUserIdentity(mobile, 2);
    std::string stagingFile = joinPath(staging, "temp_metadata-" + identity->uuid().string() + ".plist");
    EXPECT_FALSE(VSLFileManager::defaultManager().itemExistsAtURL(stagingFile));

    std::string bytes = readFile(file);
    EXPECT_EQ(0u, bytes.rfind("bplist00", 0));
    auto raw = decodePropertyList(bytes.data(), bytes.size(), nullptr);
    ASSERT_TRUE(raw);
    EXPECT_EQ(Value::string("2"), *raw->find(kVSLMetadataVersionKey));
    EXPECT_EQ(Value::string(identity->uuid().string()), *raw->find(kVSLMetadataUUIDKey));
    EXPECT_TRUE(raw->find(kVSLMetadataUserIdentityKey));
    EXPECT_FALSE(raw->find(kVSLMetadataPersonaKey));

    auto back = read(dir, &error);
    ASSERT_TRUE(back) << error->description();
    EXPECT_EQ(kIdentifier, back->identifier());
    EXPECT_EQ(identity->uuid(), back->uuid());
    EXPECT_EQ(2u, back->containerClass());
    EXPECT_EQ(dir, back->url());
    EXPECT_EQ(std::optional<std::string>("Assets"), back->userManagedAssetsDirName());
    EXPECT_EQ(dict({{"Key", Value::string("value")}}), back->info());
    EXPECT_TRUE(sameUserIdentity(mobile, back->userIdentity()));
    EXPECT_TRUE(back->containerIdentity()->isEqual(*identity));

    // The staging name is where the bytes go first: when it cannot be written, nothing moves.
    ASSERT_EQ(0, ::mkdir(stagingFile.c_str(), 0755));
    EXPECT_FALSE(metadata->writeMetadataToDiskWithError(&error));
    EXPECT_EQ(kVSLErrorWriteFile, static_cast<uint64_t>(error->code));
    EXPECT_EQ(formatLog("Failed to write metadata dictionary to URL %@ : %@:%ld", stagingFile, VSLPOSIXErrorDomain,
                        static_cast<long>(EISDIR)),
              error->localizedDescription.value_or(""));
    ASSERT_EQ(0, ::rmdir(stagingFile.c_str()));

    // A destination that cannot take the rename leaves the staged file behind.
    std::string nowhere = joinPath(dir, "missing/metadata.plist");
    EXPECT_FALSE(metadata->writeMetadataToFileURL(nowhere, &error));
    EXPECT_EQ(kVSLErrorWriteFile, static_cast<uint64_t>(error->code));
    EXPECT_EQ(formatLog("Failed to move metadata from staging: %@ to final: %@", stagingFile, nowhere),
              error->localizedDescription.value_or(""));
    EXPECT_TRUE(VSLFileManager::defaultManager().itemExistsAtURL(stagingFile));
}

TEST_F(Metadata, WriterRefusesWhatTheReaderWouldRefuseAndWritesNothing) {
    std::string dir = joinPath(classDirectory(mobile, 2), Uuid::random().string());
    ASSERT_EQ(0, ::mkdir(dir.c_str(), 0755));
    uint64_t code = kVSLSuccess;
    auto identity = VSLConcreteContainerIdentity::containerIdentityWithUUID(Uuid::random(), mobile, kIdentifier, 2, &code);
    auto withInfo = [&](size_t blobSize) {
        return VSLMetadata::initWithContainerIdentity(
            identity, dict({{"Blob", Value::data(Data(blobSize, 0x78))}}), dir, std::nullopt);
    };
    std::string file = metadataPathOf(dir);
    std::string staging = *VSLGlobalConfiguration::sharedInstance()->stagingDirectoryURLForUserIdentity(mobile, 2);
    std::string stagingFile = joinPath(staging, "temp_metadata-" + identity->uuid().string() + ".plist");

    // Just under the limit: written, and read back whole after a restart would.
    VSLErrorRef error;
    ASSERT_TRUE(withInfo(kVSLMaxPropertyListFileSize - 4096)->writeMetadataToDiskWithError(&error))
        << error->description();
    auto back = read(dir, &error);
    ASSERT_TRUE(back) << error->description();
    const std::string before = readFile(file);

    // Over it: refused with a code, the old file untouched, no staged bytes left anywhere.
    error.reset();
    EXPECT_FALSE(withInfo(kVSLMaxPropertyListFileSize)->writeMetadataToDiskWithError(&error));
    ASSERT_TRUE(error);
    EXPECT_EQ(kVSLErrorWriteFile, static_cast<uint64_t>(error->code));
    ASSERT_TRUE(error->underlyingError);
    EXPECT_TRUE(isPOSIXError(error->underlyingError, EFBIG)) << error->underlyingError->description();
    EXPECT_TRUE(before == readFile(file)) << "the container's file is the one written before";
    EXPECT_FALSE(VSLFileManager::defaultManager().itemExistsAtURL(stagingFile));

    // The same for a first write: no file appears at all.
    std::string fresh = joinPath(classDirectory(mobile, 2), Uuid::random().string());
    ASSERT_EQ(0, ::mkdir(fresh.c_str(), 0755));
    EXPECT_FALSE(withInfo(kVSLMaxPropertyListFileSize)->writeMetadataToFileURL(metadataPathOf(fresh), &error));
    EXPECT_FALSE(VSLFileManager::defaultManager().itemExistsAtURL(metadataPathOf(fresh)));
    EXPECT_FALSE(VSLFileManager::defaultManager().itemExistsAtURL(stagingFile));
}

TEST_F(Metadata, BundleRecordKeepsNoUserIdentityAndReadsAsTheDefault) {
    auto other = VSLUserIdentity::create(600, 600, cacheTestRoot().at("private/var/other"), std::nullopt,
                                         kVSLPersonaTypePersonal, 600);
    auto metadata = makeContainer(other, 1, "com.example.bundle");
    ASSERT_TRUE(metadata);
    auto raw = decodePropertyList(readFile(metadataPathOf(metadata->url())).data(),
                                  readFile(metadataPathOf(metadata->url())).size(), nullptr);
    ASSERT_TRUE(raw);
    EXPECT_FALSE(raw->find(kVSLMetadataUserIdentityKey));
    EXPECT_EQ(Value::string("2"), *raw->find(kVSLMetadataVersionKey));

    VSLErrorRef error;
    auto back = read(metadata->url(), &error, true, other);
    ASSERT_TRUE(back) << error->description();
    EXPECT_TRUE(sameUserIdentity(VSLUserIdentityCache::defaultUserIdentity(), back->userIdentity()));
}

TEST_F(Metadata, EachCheckFailsInOrderWithItsCodeAndMessage) {
    struct Case {
        const char* name;
        std::function<void(Dictionary&)> change;
        uint64_t code;
        std::function<std::string(const Dictionary&, const std::string& file)> message;
    };
    auto at = [](const char* format, const char* key) {
        return [format, key](const Dictionary& d, const std::string& file) {
            return formatLog(format, d.at(key), file);
        };
    };
    const std::vector<Case> cases = {
        {"identifier not a string", [](Dictionary& d) { d[kVSLMetadataIdentifierKey] = Value::uint64(5); }, 29,
         at("Invalid metadata Identifier: %@ at %@", kVSLMetadataIdentifierKey)},
        {"uuid not a string", [](Dictionary& d) { d[kVSLMetadataUUIDKey] = Value::boolean(true); }, 29,
         at("Invalid metadata UUID String: %@ at %@", kVSLMetadataUUIDKey)},
        {"uuid does not parse",
         [](Dictionary& d) {
             d[kVSLMetadataUUIDKey] = Value::string("not-a-uuid");
             d[kVSLMetadataContentClassKey] = Value::uint64(14);  // later fault, not reported
         },
         29, [](const Dictionary&, const std::string& file) { return "Invalid metadata UUID: (null) at " + file; }},
        {"class not a number", [](Dictionary& d) { d[kVSLMetadataContentClassKey] = Value::string("2"); }, 29,
         at("Invalid metadata Class: %@ at %@", kVSLMetadataContentClassKey)},
        {"class 0", [](Dictionary& d) { d[kVSLMetadataContentClassKey] = Value::uint64(0); }, 29,
         [](const Dictionary&, const std::string& file) { return "Invalid metadata Content Class: 0 at " + file; }},
        {"class 14", [](Dictionary& d) { d[kVSLMetadataContentClassKey] = Value::uint64(14); }, 29,
         [](const Dictionary&, const std::string& file) { return "Invalid metadata Content Class: 14 at " + file; }},
        {"persona of another uid",
         [](Dictionary& d) {
             d.erase(kVSLMetadataUserIdentityKey);
             d[kVSLMetadataPersonaKey] = Value::uint64(700);
         },
         29,
         [](const Dictionary& d, const std::string& file) {
             return formatLog("Incorrect UserId: %@, expecting: %u for %@ at %@", d.at(kVSLMetadataPersonaKey), 501u,
                              kIdentifier, file);
         }},
        {"user identity unreadable",
         [](Dictionary& d) { d[kVSLMetadataUserIdentityKey] = dict({{"version", Value::string("2")}}); }, 29,
         [](const Dictionary& d, const std::string& file) {
             return formatLog("Invalid metadata User Identity: %@ for %@ at %@: %llu", d.at(kVSLMetadataUserIdentityKey),
                              kIdentifier, file, uint64_t{75});
         }},
        {"info not a dictionary", [](Dictionary& d) { d[kVSLMetadataInfoKey] = Value::string("info"); }, 29,
         at("Invalid metadata Info: %@ at %@", kVSLMetadataInfoKey)},
        {"assets name not a string",
         [](Dictionary& d) { d[kVSLMetadataUserManagedAssetsKey] = Value::array({Value::string("a")}); }, 29,
         at("Invalid metadata User Managed Dir Name String: %@ at %@", kVSLMetadataUserManagedAssetsKey)},
        {"several faults report the first",
         [](Dictionary& d) {
             d[kVSLMetadataIdentifierKey] = Value::boolean(false);
             d[kVSLMetadataUUIDKey] = Value::uint64(1);
             d[kVSLMetadataInfoKey] = Value::uint64(2);
         },
         29, at("Invalid metadata Identifier: %@ at %@", kVSLMetadataIdentifierKey)},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        Dictionary d = goodDictionary();
        c.change(d);
        // What the file holds after a round trip is what the message describes.
        std::string dir = containerWithBytes(binaryPlist(Value::dictionary(d)));
        std::string file = metadataPathOf(dir);
        auto stored = decodePropertyList(readFile(file).data(), readFile(file).size(), nullptr);
        expectFailure(dir, c.code, c.message(*stored->dictionaryValue(), file));
    }

    std::string missing = joinPath(classDirectory(mobile, 2), Uuid::random().string());
    expectFailure(missing, 12, "Failed to read metadata at URL " + metadataPathOf(missing));
}

TEST_F(Metadata, UserIdentityOfAnotherUserIsRefusedAndAMissingOneFollowsTheExpectedUID) {
    Dictionary d = goodDictionary();
    auto stranger = VSLUserIdentity::create(600, 600, "/nowhere", std::nullopt, kVSLPersonaTypePersonal, 600);
    d[kVSLMetadataUserIdentityKey] = stranger->plist();
    std::string dir = containerWithBytes(binaryPlist(Value::dictionary(d)));
    VSLErrorRef error;
    EXPECT_FALSE(read(dir, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(29, error->code);
    std::string text = error->localizedDescription.value_or("");
    EXPECT_EQ(0u, text.find("Incorrect User Identity: ")) << text;
    EXPECT_NE(std::string::npos, text.find(formatLog(", expecting: %@ for %@ at %@: 1", mobile, kIdentifier,
                                                     metadataPathOf(dir))))
        << text;

    // Neither key: the owner is the expected identity's uid, used as gid as well.
    d.erase(kVSLMetadataUserIdentityKey);
    auto expected = VSLUserIdentity::create(600, 700, "/nowhere", std::nullopt, kVSLPersonaTypePersonal, 600);
    dir = containerWithBytes(binaryPlist(Value::dictionary(d)));
    auto back = read(dir, &error, false, expected);
    ASSERT_TRUE(back) << error->description();
    EXPECT_EQ(600u, back->userIdentity()->posixUID());
    EXPECT_EQ(600u, back->userIdentity()->posixGID());
    EXPECT_EQ(kVSLPersonaTypePersonal, back->userIdentity()->personaType());

    d[kVSLMetadataPersonaKey] = Value::uint64(600);
    dir = containerWithBytes(binaryPlist(Value::dictionary(d)));
    EXPECT_TRUE(read(dir, &error, false, expected));
}

TEST_F(Metadata, ClassPathCheckCatchesAContainerInTheWrongClassDirectory) {
    Dictionary d = goodDictionary();
    std::string wrongClassDir = joinPath(parentPath(classDirectory(mobile, 2)), "Wrong");
    ASSERT_EQ(0, ::mkdir(wrongClassDir.c_str(), 0755));
    std::string dir = joinPath(wrongClassDir, Uuid::random().string());
    ASSERT_EQ(0, ::mkdir(dir.c_str(), 0755));
    writeBytes(metadataPathOf(dir), binaryPlist(Value::dictionary(d)));

    std::string expected = joinPath(parentPath(parentPath(wrongClassDir)), "Data/Application");
    expectFailure(dir, 29, formatLog("Invalid metadata-URLs should match: %@ : %@", metadataPathOf(dir), expected));
    VSLErrorRef error;
    EXPECT_TRUE(read(dir, &error, false));

    // A class 2 record in the class 4 directory is equally out of place.
    dir = containerWithBytes(binaryPlist(Value::dictionary(d)), 4);
    EXPECT_FALSE(read(dir, &error));
    EXPECT_EQ(29, error->code);
}

TEST_F(Metadata, DamagedFilesAreUnreadableAndXMLFilesAreRead) {
    std::string good = binaryPlist(Value::dictionary(goodDictionary()));
    const std::pair<const char*, std::string> unreadable[] = {
        {"truncated", good.substr(0, good.size() / 2)},
        {"empty", ""},
        {"not a dictionary", binaryPlist(Value::array({Value::string(kIdentifier)}))},
        {"not a property list", "garbage"},
    };
    for (const auto& [name, bytes] : unreadable) {
        SCOPED_TRACE(name);
        std::string dir = containerWithBytes(bytes);
        expectFailure(dir, 12, "Failed to read metadata at URL " + metadataPathOf(dir));
    }
    {
        SCOPED_TRACE("oversized");
        std::string dir = containerWithBytes(good);
        ASSERT_EQ(0, ::truncate(metadataPathOf(dir).c_str(), 17 << 20));
        expectFailure(dir, 12, "Failed to read metadata at URL " + metadataPathOf(dir));
    }

    auto xml = [](const std::string& classValue) {
        return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
               "<key>VSLMetadataIdentifier</key><string>com.example.xml</string>"
               "<key>VSLMetadataUUID</key><string>" +
               Uuid::random().string() + "</string><key>VSLMetadataContentClass</key>" + classValue +
               "<key>VSLMetadataVersion</key><string>2</string></dict></plist>\n";
    };
    VSLErrorRef error;
    auto fromXML = read(containerWithBytes(xml("<integer>2</integer>")), &error);
    ASSERT_TRUE(fromXML) << error->description();
    EXPECT_EQ("com.example.xml", fromXML->identifier());
    EXPECT_EQ(mobile->posixUID(), fromXML->userIdentity()->posixUID());

    std::string bad = containerWithBytes(xml("<string>two</string>"));
    expectFailure(bad, 29, formatLog("Invalid metadata Class: %@ at %@", Value::string("two"), metadataPathOf(bad)));
}

}  // namespace
