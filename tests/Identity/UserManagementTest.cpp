#include <gtest/gtest.h>

#include <cmath>
#include <unistd.h>

#include "Identity/PersonaTestSupport.h"
#include "Platform/PropertyList.h"
#include "Platform/UserManagement.h"

using namespace vsl;
using namespace vsl::test;

namespace {

class CountingObserver : public PersonaListObserver {
public:
    void personaListDidUpdate() override {
        std::lock_guard g(mutex);
        count++;
        changed.notify_all();
    }
    bool waitForCount(int n) { return waitUntil(mutex, changed, [&] { return count >= n; }); }

    std::mutex mutex;
    std::condition_variable changed;
    int count = 0;
};

std::string plistBytes(const Value& v) { return encodeBinaryPropertyList(v, nullptr).value(); }

}  // namespace

TEST(UserManagement, ReadsThePersonaFileAndFindsTheCallersPersona) {
    TempRoot root;
    auto service = UserManagement::create();
    EXPECT_TRUE(service->allPersonas().empty()) << "no file means no personas";

    auto rows = standardPersonas();
    rows.push_back({Kind::Enterprise, 1004, "E-4", {}, 501, std::nullopt});  // shares the personal uid
    writePersonas(root, rows);
    PersonaAttributesList list = service->allPersonas();
    EXPECT_EQ(attributesFor(rows), list);
    ASSERT_EQ(7u, list.size());
    EXPECT_EQ(root.at("private/var/PersonaVolumes/E-1"), list[1].layoutPath) << "homes are inside the root";
    EXPECT_TRUE(list[3].isUniversal && !list[3].isSystem && !list[3].isPersonal);
    EXPECT_TRUE(list[4].isSystem && !list[4].isUniversal);

    auto current = [&](uid_t uid, std::optional<uint32_t> personaID = std::nullopt) {
        auto p = service->currentPersona({uid, uid, personaID});
        return p ? p->uniqueString.value_or("(no string)") : std::string("(none)");
    };
    EXPECT_EQ("P-1", current(501)) << "the personal persona wins among those of one uid";
    EXPECT_EQ("E-1", current(502));
    EXPECT_EQ("(none)", current(0));
    EXPECT_EQ("E-2", current(0, 1002)) << "a named kernel persona ID decides";
    EXPECT_EQ("(none)", current(501, 4242)) << "an unknown persona ID does not fall back to the uid";

    // Operators write XML.
    const std::string xml =
        "<?xml version=\"1.0\" encoding=\"UTF-8\"?><plist version=\"1.0\"><array><dict>"
        "<key>PersonaType</key><integer>2</integer><key>KernelPersonaID</key><integer>900</integer>"
        "<key>Universal</key><true/><key>HomeDirectory</key><string>var/u</string>"
        "<key>BundleIdentifiers</key><array><string>com.example.phone</string></array></dict></array></plist>";
    std::string error;
    auto parsed = parsePersonaList(xml, "/r", &error);
    ASSERT_TRUE(parsed) << error;
    ASSERT_EQ(1u, parsed->size());
    EXPECT_TRUE((*parsed)[0].isUniversal);
    EXPECT_EQ(900u, (*parsed)[0].kernelPersonaID);
    EXPECT_EQ("/r/var/u", (*parsed)[0].layoutPath);
    EXPECT_EQ(std::vector<std::string>{"com.example.phone"}, (*parsed)[0].bundleIdentifiers);
}

TEST(UserManagement, UnreadableOrMalformedFilesKeepTheLastGoodList) {
    TempRoot root;
    LogCapture log(root.at("logs"));
    auto service = UserManagement::create();
    writePersonas(root, standardPersonas());
    const PersonaAttributesList good = service->allPersonas();
    ASSERT_EQ(6u, good.size());

    auto entry = [](Dictionary extra) {
        Dictionary d{{"PersonaType", Value::uint64(1)}, {"KernelPersonaID", Value::uint64(7)}};
        for (auto& [k, v] : extra) d[k] = v;
        return Value::array({Value::dictionary(std::move(d))});
    };
    const std::vector<std::pair<std::string, std::string>> bad = {
        {"not a property list", "garbage"},
        {"empty file", ""},
        {"dictionary root", plistBytes(dict({{"PersonaType", Value::uint64(0)}}))},
        {"type 3", plistBytes(entry({{"PersonaType", Value::uint64(3)}}))},
        {"no kernel persona ID", plistBytes(Value::array({dict({{"PersonaType", Value::uint64(0)}})}))},
        {"string persona ID", plistBytes(entry({{"KernelPersonaID", Value::string("7")}}))},
        {"universal enterprise", plistBytes(entry({{"Universal", Value::boolean(true)}}))},
        {"bundle list of numbers", plistBytes(entry({{"BundleIdentifiers", Value::array({Value::uint64(1)})}}))},
        {"home not a string", plistBytes(entry({{"HomeDirectory", Value::boolean(true)}}))},
        // Numbers no 64-bit integer holds are no numbers (the first was found by fuzzing).
        {"type -1e111", readFile(std::string(VESSEL_SOURCE_DIR) + "/fuzz/regressions/personas/number-beyond-int64")},
        {"persona ID 1e300", plistBytes(entry({{"KernelPersonaID", Value::real(1e300)}}))},
        {"uid NaN", plistBytes(entry({{"UID", Value::real(std::nan(""))}}))},
    };
    for (const auto& [why, bytes] : bad) {
        root.writeFile("etc/vesseld/personas.plist", bytes);
        EXPECT_EQ(good, service->allPersonas()) << why;
        EXPECT_FALSE(service->reload()) << why;
        std::string error;
        EXPECT_FALSE(parsePersonaList(bytes, "", &error)) << why;
        EXPECT_FALSE(error.empty()) << why;
    }

    // Unreadable: a link to a directory where the file should be.
    makePersonasUnreadable(root);
    EXPECT_EQ(good, service->allPersonas());
    EXPECT_NE(std::string::npos, log.contents().find("Could not read the persona list"));

    // Removing the file is a real answer: no personas.
    ASSERT_EQ(0, ::unlink(root.at("etc/vesseld/personas.plist").c_str()));
    EXPECT_TRUE(service->allPersonas().empty());
}

TEST(UserManagement, WatcherTellsObserversAboutChangesUntilStopped) {
    TempRoot root;  // no etc/vesseld yet: the watcher must wait for it to appear
    auto service = UserManagement::create();
    auto observer = std::make_shared<CountingObserver>();
    ASSERT_EQ(std::nullopt, service->registerPersonaListObserver(observer, "com.tarrow.vesseld.personaobserver"));

    auto rows = standardPersonas();
    writePersonas(root, rows);
    ASSERT_TRUE(observer->waitForCount(1)) << "directory and file created after registration";
    EXPECT_EQ(attributesFor(rows), service->allPersonas());

    rows.erase(rows.begin() + 1);
    writePersonas(root, rows);
    ASSERT_TRUE(observer->waitForCount(2)) << "rewritten in place";

    rows.erase(rows.begin() + 1);
    replacePersonasAtomically(root, rows);
    ASSERT_TRUE(observer->waitForCount(3)) << "renamed over";
    EXPECT_EQ(attributesFor(rows), service->allPersonas());

    // An observer that is gone is skipped; destroying the service stops its watcher.
    observer.reset();
    writePersonas(root, standardPersonas());
    EXPECT_TRUE(service->reload());
    service.reset();
}

TEST(UserManagement, InjectedSourceStandsInForTheFile) {
    int calls = 0;
    std::optional<PersonaAttributesList> next = attributesFor({{Kind::Personal, 1, "P", {}, 501, std::nullopt}});
    auto service = UserManagement::createWithSource([&] {
        calls++;
        return next;
    });
    auto observer = std::make_shared<CountingObserver>();
    ASSERT_EQ(std::nullopt, service->registerPersonaListObserver(observer, "test"));
    EXPECT_EQ("P", service->currentPersona({501, 501, std::nullopt})->uniqueString);
    EXPECT_TRUE(service->reload());
    EXPECT_EQ(1, observer->count) << "the first list differs from the empty start";
    EXPECT_TRUE(service->reload());
    EXPECT_EQ(1, observer->count) << "an unchanged list is not announced";
    next.reset();
    EXPECT_FALSE(service->reload());
    EXPECT_EQ(1u, service->allPersonas().size()) << "a failed read keeps the last good list";
    EXPECT_EQ(5, calls);
}
