// The database file itself: schema and settings, what a row holds, and the end of
// the process when the file cannot be used.
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <cmath>

#include "CodeSigning/CodeSigningTestSupport.h"
#include "Daemon/CodeSigning/VSLPropertyListCompare.h"
#include "Daemon/CodeSigning/VSLSQLiteDB.h"
#include "Platform/SystemRoot.h"

using namespace vsl;
using namespace vsl::test;

namespace {

// A second look at the file while the daemon's connection is closed.
class RawDatabase {
public:
    explicit RawDatabase(const std::string& path) { EXPECT_EQ(SQLITE_OK, sqlite3_open(path.c_str(), &db_)); }
    ~RawDatabase() { sqlite3_close(db_); }
    std::vector<std::string> column(const std::string& sql) {
        std::vector<std::string> out;
        sqlite3_stmt* s = nullptr;
        EXPECT_EQ(SQLITE_OK, sqlite3_prepare_v2(db_, sql.c_str(), -1, &s, nullptr)) << sqlite3_errmsg(db_);
        while (sqlite3_step(s) == SQLITE_ROW) {
            const unsigned char* t = sqlite3_column_text(s, 0);
            out.emplace_back(t ? reinterpret_cast<const char*>(t) : "");
        }
        sqlite3_finalize(s);
        return out;
    }
    std::string one(const std::string& sql) {
        auto c = column(sql);
        return c.empty() ? "<none>" : c[0];
    }
    void exec(const std::string& sql) {
        EXPECT_EQ(SQLITE_OK, sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr));
    }

private:
    sqlite3* db_ = nullptr;
};

std::string databasePath(const std::string& dir) {
    return joinPath(dir, kVSLCodeSigningDatabaseFileName);
}

VSLCodeSigningEntry entryWith(const std::string& marker, std::vector<std::string> children = {}) {
    auto entry = VSLCodeSigningEntry::initWithCodeSigningInfo(dict({{"marker", Value::string(marker)}}), 2);
    if (!children.empty()) entry.childBundleIdentifiers = std::move(children);
    return entry;
}

bool isCode(const VSLErrorRef& e, uint64_t code) {
    return e && e->isVSLDomain() && uint64_t(e->code) == code;
}

}  // namespace

TEST(VSLSQLiteDB, SchemaAndSettingsAreMadeOnFirstOpenAndTheFileReopensIntact) {
    std::string dir = freshDirectory("schema");
    {
        auto db = VSLSQLiteDB::initWithParentDirectoryURL(dir);
        ASSERT_TRUE(db);
        EXPECT_EQ(databasePath(dir), db->url());
        auto entry = entryWith("one", {"com.example.one.child"});
        ASSERT_TRUE(db->addCodeSigningEntry(&entry, std::string("com.example.one"), nullptr));
    }
    {
        RawDatabase raw(databasePath(dir));
        EXPECT_EQ(
            (std::vector<std::string>{"child_bundles", "code_signing_data", "code_signing_info"}),
            raw.column("SELECT name FROM sqlite_master WHERE type='table' AND name NOT LIKE 'sqlite_%' ORDER BY name"));
        EXPECT_EQ(
            (std::vector<std::string>{"code_signing_id_text_idx", "cs_info_id_idx", "parent_id_idx"}),
            raw.column("SELECT name FROM sqlite_master WHERE type='index' AND name NOT LIKE 'sqlite_%' ORDER BY name"));
        EXPECT_EQ("wal", raw.one("PRAGMA journal_mode"));
        EXPECT_EQ("1", raw.one("PRAGMA auto_vacuum")) << "full auto-vacuum";
        EXPECT_EQ("1", raw.one("SELECT count(*) FROM pragma_foreign_key_list('child_bundles') WHERE "
                               "\"table\"='code_signing_info' AND on_delete='CASCADE'"));
    }
    auto db = VSLSQLiteDB::initWithParentDirectoryURL(dir);
    ASSERT_TRUE(db);
    auto entry = db->codeSigningEntryWithIdentifier("com.example.one", nullptr);
    ASSERT_TRUE(entry);
    EXPECT_EQ(entryWith("one", {"com.example.one.child"}), *entry);
    EXPECT_EQ(std::set<std::string>{"com.example.one"}, db->identifiersWithError(nullptr));

    EXPECT_FALSE(VSLSQLiteDB::initWithParentDirectoryURL("")) << "no location, no database";
}

TEST(VSLSQLiteDB, TheDataBlobRoundTripsEveryPropertyListValueType) {
    auto db = VSLSQLiteDB::initWithParentDirectoryURL(freshDirectory("blob"));
    Uuid uuid = Uuid::random();
    Date date{(Date::now().nanoseconds / 1000000000) * 1000000000};  // whole seconds survive the format exactly
    Value info = dict({
        {"string", Value::string("h\xC3\xA9llo, \"quoted\"")},
        {"empty", Value::string("")},
        {"uint", Value::uint64(42)},
        {"bigUint", Value::uint64(uint64_t(1) << 62)},
        {"negative", Value::int64(-7)},
        {"positiveSigned", Value::int64(9)},
        {"real", Value::real(2.5)},
        {"true", Value::boolean(true)},
        {"false", Value::boolean(false)},
        {"data", Value::data({0, 1, 2, 255})},
        {"date", Value::date(date)},
        {"uuid", Value::uuid(uuid)},
        {"array", Value::array({Value::string("a"), Value::uint64(1), Value::array({}), dict({})})},
        {"nested", dict({{"deeper", dict({{"k", Value::array({Value::boolean(false)})}})}})},
    });
    auto entry = VSLCodeSigningEntry::initWithCodeSigningInfo(info, 4);
    ASSERT_TRUE(db->addCodeSigningEntry(&entry, std::string("com.example.types"), nullptr));
    auto back = db->codeSigningEntryWithIdentifier("com.example.types", nullptr);
    ASSERT_TRUE(back && back->codeSigningInfo);
    const Value& got = *back->codeSigningInfo;
    EXPECT_TRUE(propertyListValuesEqual(info, got)) << got.description();
    // Types survive where the format keeps them apart.
    EXPECT_EQ(Value::Type::Bool, got.find("true")->type());
    EXPECT_EQ(Value::Type::Double, got.find("real")->type());
    EXPECT_EQ(Value::Type::Date, got.find("date")->type());
    EXPECT_EQ(date, *got.find("date")->dateValue());
    EXPECT_EQ(Value::Type::Int64, got.find("negative")->type());
    EXPECT_EQ(Value::data(Data(uuid.bytes.begin(), uuid.bytes.end())), *got.find("uuid"));
    EXPECT_EQ(*info.find("string"), *got.find("string"));
    EXPECT_EQ(4u, back->dataContainerClass);
}

TEST(VSLSQLiteDB, RowsUpdateInPlaceChildrenAccumulateAndMoveBetweenParents) {
    std::string dir = freshDirectory("rows");
    {
        auto db = VSLSQLiteDB::initWithParentDirectoryURL(dir);
        auto first = entryWith("v1", {"c1"});
        auto other = entryWith("other");
        ASSERT_TRUE(db->addCodeSigningEntry(&first, std::string("X"), nullptr));
        ASSERT_TRUE(db->addCodeSigningEntry(&other, std::string("Y"), nullptr));
        auto second = entryWith("v2", {"c2"});
        second.invalid = true;
        second.registeredByCaller = true;
        ASSERT_TRUE(db->addCodeSigningEntry(&second, std::string("X"), nullptr));

        auto x = db->codeSigningEntryWithIdentifier("X", nullptr);
        ASSERT_TRUE(x);
        EXPECT_EQ("v2", *x->codeSigningInfo->find("marker")->stringValue());
        EXPECT_TRUE(x->invalid && x->registeredByCaller);
        EXPECT_EQ((std::vector<std::string>{"c1", "c2"}), x->childBundleIdentifiers)
            << "dropped children keep their rows";

        auto z = entryWith("z", {"c1"});
        ASSERT_TRUE(db->addCodeSigningEntry(&z, std::string("Z"), nullptr));
        EXPECT_EQ("Z", db->parentIdentifierForChildIdentifier("c1", nullptr));
        EXPECT_EQ((std::vector<std::string>{"c2"}), db->childIdentifiersForParentIdentifier("X", nullptr));

        VSLErrorRef error;
        EXPECT_FALSE(db->childIdentifiersForParentIdentifier("Y", &error));
        EXPECT_TRUE(isCode(error, kVSLErrorNotInDatabase));
        EXPECT_FALSE(db->parentIdentifierForChildIdentifier("nobody", &error));
        EXPECT_TRUE(isCode(error, kVSLErrorNotInDatabase));
        EXPECT_FALSE(db->addCodeSigningEntry(nullptr, std::string("X"), &error));
        EXPECT_TRUE(isCode(error, kVSLErrorInvalidArgument));
        EXPECT_FALSE(db->addCodeSigningEntry(&z, std::nullopt, &error));
        EXPECT_TRUE(isCode(error, kVSLErrorInvalidArgument));
    }
    RawDatabase raw(databasePath(dir));
    EXPECT_EQ("1", raw.one("SELECT id FROM code_signing_info WHERE code_signing_id_text='X'")) << "updated in place";
    EXPECT_EQ("1", raw.one("SELECT count(*) FROM code_signing_data WHERE cs_info_id=1")) << "data replaced";
    EXPECT_EQ("1", raw.one("SELECT invalid FROM code_signing_info WHERE code_signing_id_text='X'"));
}

TEST(VSLSQLiteDB, DeletionCascadesInvalidationReachesChildrenAndAdvanceCopiesArePurged) {
    std::string dir = freshDirectory("delete");
    {
        auto db = VSLSQLiteDB::initWithParentDirectoryURL(dir);
        auto parent = entryWith("p", {"kid"});
        auto kid = entryWith("kid");
        ASSERT_TRUE(db->addCodeSigningEntry(&parent, std::string("P"), nullptr));
        ASSERT_TRUE(db->addCodeSigningEntry(&kid, std::string("kid"), nullptr));

        ASSERT_TRUE(db->invalidateCodeSigningForIdentifierAndAllChildren("P", nullptr));
        EXPECT_TRUE(db->codeSigningEntryWithIdentifier("P", nullptr)->invalid);
        EXPECT_TRUE(db->codeSigningEntryWithIdentifier("kid", nullptr)->invalid);
        EXPECT_TRUE(db->invalidateCodeSigningForIdentifierAndAllChildren("childless", nullptr));

        ASSERT_TRUE(db->deleteCodeSigningEntryWithIdentifier(std::string("P"), nullptr));
        VSLErrorRef error;
        EXPECT_FALSE(db->codeSigningEntryWithIdentifier("P", &error));
        EXPECT_TRUE(isCode(error, kVSLErrorNotInDatabase));
        EXPECT_FALSE(db->parentIdentifierForChildIdentifier("kid", nullptr)) << "child row went with its parent";
        EXPECT_TRUE(db->codeSigningEntryWithIdentifier("kid", nullptr)) << "the child's own entry stays";
        EXPECT_FALSE(db->deleteCodeSigningEntryWithIdentifier(std::string("P"), &error));
        EXPECT_TRUE(isCode(error, kVSLErrorDatabase)) << "deleting what is not stored fails";

        struct Flags {
            const char* id;
            bool placeholder;
            bool advanceCopy;
        };
        for (Flags f :
             {Flags{"placeholderOnly", true, false}, Flags{"advanceOnly", false, true}, Flags{"both", true, true}}) {
            auto e = entryWith(f.id);
            e.placeholder = f.placeholder;
            e.advanceCopy = f.advanceCopy;
            ASSERT_TRUE(db->addCodeSigningEntry(&e, std::string(f.id), nullptr));
            auto back = db->codeSigningEntryWithIdentifier(f.id, nullptr);
            EXPECT_EQ(f.placeholder, back->placeholder);
            EXPECT_EQ(f.advanceCopy, back->advanceCopy);
        }
        ASSERT_TRUE(db->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(nullptr));
        EXPECT_EQ((std::set<std::string>{"kid", "placeholderOnly"}), db->identifiersWithError(nullptr));
    }
    RawDatabase raw(databasePath(dir));
    EXPECT_EQ(
        "0",
        raw.one("SELECT count(*) FROM code_signing_data WHERE cs_info_id NOT IN (SELECT id FROM code_signing_info)"));
    EXPECT_EQ("1", raw.one("SELECT placeholder FROM code_signing_info WHERE code_signing_id_text='placeholderOnly'"));
}

TEST(VSLSQLiteDB, ARowWithoutDataIsNotFoundAndEnumerationSkipsIt) {
    std::string dir = freshDirectory("nodata");
    {
        auto db = VSLSQLiteDB::initWithParentDirectoryURL(dir);
        auto a = entryWith("a", {"a.kid"});
        ASSERT_TRUE(db->addCodeSigningEntry(&a, std::string("A"), nullptr));
    }
    {
        RawDatabase raw(databasePath(dir));
        raw.exec("INSERT INTO code_signing_info (code_signing_id_text) VALUES ('bare')");
    }
    auto db = VSLSQLiteDB::initWithParentDirectoryURL(dir);
    VSLErrorRef error;
    EXPECT_FALSE(db->codeSigningEntryWithIdentifier("bare", &error));
    EXPECT_TRUE(isCode(error, kVSLErrorNotInDatabase));
    EXPECT_EQ((std::set<std::string>{"A", "bare"}), db->identifiersWithError(nullptr));
    auto b = entryWith("b");
    ASSERT_TRUE(db->addCodeSigningEntry(&b, std::string("B"), nullptr));
    // The same query again while the first is still stepping gets a statement of its own.
    std::vector<std::string> seen;
    EXPECT_FALSE(db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& id, const VSLCodeSigningEntry& entry) {
            seen.push_back(id);
            EXPECT_EQ(id == "A" ? std::optional(std::vector<std::string>{"a.kid"}) : std::nullopt,
                      entry.childBundleIdentifiers);
            size_t inner = 0;
            EXPECT_FALSE(db->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
                [&](const std::string&, const VSLCodeSigningEntry&) { inner++; }));
            EXPECT_EQ(2u, inner);
        }));
    EXPECT_EQ((std::vector<std::string>{"A", "B"}), seen);
}

TEST(VSLSQLiteDBDeathTest, AFileThatCannotBeUsedEndsTheProcessWithTheCrashMessage) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    std::string garbage = freshDirectory("garbage");
    codeSigningTestRoot().writeFile("scratch/garbage/containers.sqlite3", std::string(4096, 'x'));
    EXPECT_DEATH(VSLSQLiteDB::initWithParentDirectoryURL(garbage),
                 "table create for .*containers.sqlite3 failed(.|\n)*Move it aside(.|\n)*Failed to initialize "
                 "database, err = 26");

    // A real database of another layout: our index cannot be made over its table.
    std::string foreign = freshDirectory("foreign");
    {
        RawDatabase raw(databasePath(foreign));
        raw.exec("CREATE TABLE code_signing_info (name TEXT, payload BLOB)");
    }
    EXPECT_DEATH(VSLSQLiteDB::initWithParentDirectoryURL(foreign), "Failed to initialize database, err = 1[^0-9]");

    EXPECT_DEATH(VSLSQLiteDB::initWithParentDirectoryURL(codeSigningTestRoot().at("scratch/no/such/dir")),
                 "opening .*containers.sqlite3 failed(.|\n)*Failed to open database, err = 14");
}

TEST(VSLSQLiteDB, AFailedCommitIsRolledBackAndTheNextTransactionWorks) {
    std::string dir = freshDirectory("commit");
    VSLSQLiteDB::initWithParentDirectoryURL(dir);  // the schema
    {
        // Storing "com.example.doomed" adds a row whose deferred foreign key points
        // nowhere: its COMMIT fails and leaves SQLite inside the transaction.
        RawDatabase raw(databasePath(dir));
        raw.exec("CREATE TABLE doom (ref INTEGER REFERENCES code_signing_info(id) DEFERRABLE INITIALLY DEFERRED);"
                 "CREATE TRIGGER doom_on_insert AFTER INSERT ON code_signing_info "
                 "WHEN NEW.code_signing_id_text = 'com.example.doomed' "
                 "BEGIN INSERT INTO doom (ref) VALUES (-1); END;");
    }
    auto db = VSLSQLiteDB::initWithParentDirectoryURL(dir);
    ASSERT_TRUE(db);
    auto doomed = entryWith("doomed");
    db->addCodeSigningEntry(&doomed, std::string("com.example.doomed"), nullptr);
    VSLErrorRef error;
    EXPECT_FALSE(db->codeSigningEntryWithIdentifier("com.example.doomed", &error)) << "rolled back";
    EXPECT_TRUE(isCode(error, kVSLErrorNotInDatabase));

    auto fine = entryWith("fine", {"com.example.fine.child"});
    ASSERT_TRUE(db->addCodeSigningEntry(&fine, std::string("com.example.fine"), &error))
        << (error ? error->description() : "");
    ASSERT_TRUE(db->invalidateCodeSigningForIdentifierAndAllChildren("com.example.fine", &error))
        << (error ? error->description() : "");
    db.reset();
    db = VSLSQLiteDB::initWithParentDirectoryURL(dir);
    auto back = db->codeSigningEntryWithIdentifier("com.example.fine", nullptr);
    ASSERT_TRUE(back) << "committed, so it outlives the connection";
    EXPECT_TRUE(back->invalid);
    EXPECT_EQ(std::set<std::string>{"com.example.fine"}, db->identifiersWithError(nullptr));
}
