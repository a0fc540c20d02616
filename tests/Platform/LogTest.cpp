#include "Platform/Log.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <set>
#include <sstream>
#include <thread>

using namespace vsl;
using testing::HasSubstr;
using testing::Not;

namespace {

struct Thing {
    std::string text;
    std::string description() const { return text; }
};

struct Counted {
    static inline int calls = 0;
    std::string description() const {
        calls++;
        return "counted";
    }
};

template <class T>
std::string cPrintf(const char* format, T value) {
    char buffer[1024];
    std::snprintf(buffer, sizeof buffer, format, value);
    return buffer;
}

std::string readFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
}

std::vector<std::string> lines(const std::string& text) {
    std::vector<std::string> out;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) out.push_back(line);
    return out;
}

// "<time> <pid> <rest>" with the time as 2024-05-01T12:34:56.789Z; false when the shape differs.
bool splitLine(const std::string& line, std::string* time, long* pid, std::string* rest) {
    const std::string shape = "dddd-dd-ddTdd:dd:dd.dddZ ";
    if (line.size() <= shape.size()) return false;
    for (size_t k = 0; k < shape.size(); k++)
        if (shape[k] == 'd' ? !std::isdigit(static_cast<unsigned char>(line[k])) : line[k] != shape[k]) return false;
    size_t space = line.find(' ', shape.size());
    if (space == std::string::npos || space == shape.size()) return false;
    *time = line.substr(0, 19);
    *pid = std::stol(line.substr(shape.size(), space - shape.size()));
    *rest = line.substr(space + 1);
    return true;
}

struct TempDir {
    std::string path;
    TempDir() {
        char templ[] = "/tmp/vessel-logtest-XXXXXX";
        path = mkdtemp(templ);
    }
    ~TempDir() { std::filesystem::remove_all(path); }
};

}  // namespace

TEST(LogFormat, RendersTheDaemonsMessages) {
    std::shared_ptr<Thing> none;
    EXPECT_EQ(formatLog("Cache: %@%@: INCONSISTENT-No Metadata at: %@ for id: %@, class: %llu", Thing{"user"},
                        std::string(""), Thing{"/a/b"}, none, uint64_t{2}),
              "Cache: user: INCONSISTENT-No Metadata at: /a/b for id: (null), class: 2");
    EXPECT_EQ(formatLog("%d: %@ (%@)", 21, std::make_shared<Thing>(Thing{"Not found"}), nullptr), "21: Not found ((null))");
    EXPECT_EQ(formatLog("Invalid command at index %llu", UINT64_MAX), "Invalid command at index 18446744073709551615");
    EXPECT_EQ(formatLog("Failed to set ACL on %@: %s", std::string("/x"), std::strerror(EPERM)),
              std::string("Failed to set ACL on /x: ") + std::strerror(EPERM));

    int local = 0;
    const void* somewhere = &local;
    std::optional<std::string> noUnique;
    EXPECT_EQ(formatLog("(%d/%d) No persona (<%p>) or no unique string [%@], using: %@", 1, 3, somewhere, noUnique,
                        Thing{"P-1"}),
              "(1/3) No persona (<" + cPrintf("%p", somewhere) + ">) or no unique string [(null)], using: P-1");
    EXPECT_EQ(formatLog("<%p>", static_cast<const void*>(nullptr)), "<0x0>");

    // Annotations are dropped, whatever they hold.
    EXPECT_EQ(formatLog("%{public}@ %{private}s %{public}d%{public, signpost.description:attribute}llu|%{public}5s|",
                        Thing{"t"}, "s", -4, uint64_t{9}, "ab"),
              "t s -49|   ab|");
}

TEST(LogFormat, NumbersPrintAsPrintfDoesFor64BitValues) {
    EXPECT_EQ(formatLog("%ld", int64_t{-1}), "-1");
    EXPECT_EQ(formatLog("%d", UINT64_MAX), "-1") << "same bits, read as signed";
    EXPECT_EQ(formatLog("%u", int64_t{-1}), "18446744073709551615");
    EXPECT_EQ(formatLog("%lld %lld", INT64_MIN, INT64_MAX), cPrintf("%lld", INT64_MIN) + " " + cPrintf("%lld", INT64_MAX));
    EXPECT_EQ(formatLog("%hhd %zu %jd %td %qd", int64_t{300}, size_t{7}, -8, 9, 10), "300 7 -8 9 10");

    const char* integerSpecs[] = {"%x", "%X", "%o", "%#x", "%#o", "%08.3d", "%-6d|", "%+d", "% d", "%06d", "%.0d"};
    for (long long v : {0LL, 1LL, -42LL, 255LL, 123456789LL}) {
        for (const char* spec : integerSpecs) {
            std::string wide = std::string(spec).insert(std::string(spec).find_first_of("xXod"), "ll");
            EXPECT_EQ(formatLog(spec, v), cPrintf(wide.c_str(), v)) << spec << " of " << v;
        }
    }
    for (double d : {0.0, 3.14159, -2.5e-7, 1e300}) {
        for (const char* spec : {"%f", "%.2f", "%10.3e", "%g", "%-9G|", "%E"})
            EXPECT_EQ(formatLog(spec, d), cPrintf(spec, d)) << spec << " of " << d;
    }
    EXPECT_EQ(formatLog("%c%c", 'O', 'K'), "OK");
    EXPECT_EQ(formatLog("[%5s][%-5s][%.2s]", "ab", "ab", "abcdef"), "[   ab][ab   ][ab]");
    EXPECT_EQ(formatLog("[%*d][%.*s]", 4, 7, 1, "xyz"), "[   7][x]");
    EXPECT_EQ(formatLog("%@ %@ %s", -3, true, 2.5), "-3 1 2.5");
}

TEST(LogFormat, MalformedFormatsNeverFail) {
    EXPECT_EQ(formatLog("a %@ b %d c %s", 1), "a 1 b (null) c (null)");
    EXPECT_EQ(formatLog("100%% sure %k %@", 5), "100% sure %k 5") << "unknown conversions take no argument";
    EXPECT_EQ(formatLog("ends with %"), "ends with %");
    EXPECT_EQ(formatLog("ends with %-5l"), "ends with %-5l");
    EXPECT_EQ(formatLog("open %{public", 1), "open %{public");
    EXPECT_EQ(formatLog("%99999999999d|", 1).size(), 4097u) << "absurd widths are clamped";
    EXPECT_EQ(formatLog("no conversions", 1, 2), "no conversions");
    EXPECT_EQ(formatLog(std::string_view("%d%", 2), 5), "5") << "nothing past the view is read";
}

TEST(LogFile, WritesTimestampedLinesAndAppendsAcrossOpens) {
    TempDir tmp;
    LogFileOptions options;
    options.directory = tmp.path + "/Library/Logs";  // not there yet
    ASSERT_TRUE(openLogFile(options));
    setDebugLogging(false);
    LogWrite(kLogLevelError, "-[VSLThing doIt:]", "Failed: %d", 13);
    LogWrite(kLogLevelDebug, "quiet", "not written");
    closeLogFile();
    ASSERT_TRUE(openLogFile(options));
    LogWrite(kLogLevelNotice, "vesseld_init", "%@", Thing{"again"});
    closeLogFile();

    auto got = lines(readFile(options.directory + "/vesseld.log"));
    ASSERT_EQ(got.size(), 2u);
    std::string time, rest;
    long pid = 0;
    ASSERT_TRUE(splitLine(got[0], &time, &pid, &rest)) << got[0];
    EXPECT_EQ(pid, getpid());
    EXPECT_EQ(rest, "3 -[VSLThing doIt:]: Failed: 13");
    tm parts{};
    ASSERT_NE(strptime(time.c_str(), "%Y-%m-%dT%H:%M:%S", &parts), nullptr);
    EXPECT_LT(std::labs(timegm(&parts) - std::time(nullptr)), 600) << "the time is UTC";
    EXPECT_THAT(got[1], testing::EndsWith(" 5 vesseld_init: again"));
}

TEST(LogFile, RotatesBeforePassingTheCapAndKeepsNFiles) {
    TempDir tmp;
    LogFileOptions options;
    options.directory = tmp.path;
    options.maxBytes = 300;
    options.rotatedFiles = 2;
    ASSERT_TRUE(openLogFile(options));
    for (int i = 0; i < 40; i++) LogWrite(kLogLevelError, "fn", "line %03d", i);
    closeLogFile();

    std::string base = tmp.path + "/vesseld.log";
    EXPECT_FALSE(std::filesystem::exists(base + ".3"));
    std::string current = readFile(base), one = readFile(base + ".1"), two = readFile(base + ".2");
    size_t lineSize = lines(current).at(0).size() + 1;
    size_t perFile = options.maxBytes / lineSize;
    EXPECT_EQ(one.size(), perFile * lineSize) << "a rotated file is filled up to the cap";
    EXPECT_EQ(two.size(), perFile * lineSize);
    EXPECT_LE(current.size(), options.maxBytes);

    // The kept lines are the newest, in order, with none missing.
    auto kept = lines(two + one + current);
    ASSERT_EQ(kept.size(), 2 * perFile + lines(current).size());
    for (size_t k = 0; k < kept.size(); k++) {
        char expect[16];
        std::snprintf(expect, sizeof expect, "line %03zu", 40 - kept.size() + k);
        EXPECT_THAT(kept[k], testing::EndsWith(expect));
    }

    options.rotatedFiles = 0;  // no history: the file starts over
    ASSERT_TRUE(openLogFile(options));
    for (int i = 0; i < 20; i++) LogWrite(kLogLevelError, "fn", "line %03d", i);
    closeLogFile();
    EXPECT_LE(readFile(base).size(), options.maxBytes);
    EXPECT_THAT(readFile(base), HasSubstr("line 019"));
}

TEST(LogFile, ConcurrentWritersNeverInterleave) {
    TempDir tmp;
    LogFileOptions options;
    options.directory = tmp.path;
    options.maxBytes = 2048;
    options.rotatedFiles = 100;
    ASSERT_TRUE(openLogFile(options));
    std::vector<std::thread> writers;
    for (int t = 0; t < 4; t++)
        writers.emplace_back([t] {
            for (int i = 0; i < 150; i++) LogWrite(kLogLevelNotice, "writer", "thread %d line %d end", t, i);
        });
    for (auto& w : writers) w.join();
    closeLogFile();

    std::string all = readFile(tmp.path + "/vesseld.log");
    for (int k = 1; std::filesystem::exists(tmp.path + "/vesseld.log." + std::to_string(k)); k++)
        all += readFile(tmp.path + "/vesseld.log." + std::to_string(k));
    auto got = lines(all);
    EXPECT_EQ(got.size(), 600u);
    std::set<std::string> distinct;
    for (const auto& line : got) {
        std::string time, rest;
        long pid = 0;
        int thread = -1, index = -1, used = 0;
        ASSERT_TRUE(splitLine(line, &time, &pid, &rest)) << line;
        ASSERT_EQ(std::sscanf(rest.c_str(), "5 writer: thread %d line %d end%n", &thread, &index, &used), 2) << line;
        EXPECT_EQ(static_cast<size_t>(used), rest.size()) << line;
        distinct.insert(rest);
    }
    EXPECT_EQ(distinct.size(), 600u) << "every line arrives once";
}

TEST(LogFile, DebugLinesAreNotEvenFormattedWhenOff) {
    TempDir tmp;
    LogFileOptions options;
    options.directory = tmp.path;
    ASSERT_TRUE(openLogFile(options));
    setOSLogSink([](const OSLogRecord&) {});
    Counted counted;
    Counted::calls = 0;

    setDebugLogging(false);
    EXPECT_FALSE(isDebugLogging());
    LogWrite(kLogLevelDebug, "fn", "debug %@", counted);
    osLog(LogCategory::Cache, OSLogLevel::Debug, "debug %@", counted);
    EXPECT_EQ(Counted::calls, 0);
    LogWrite(kLogLevelNotice, "fn", "notice %@", counted);
    EXPECT_EQ(Counted::calls, 1);

    setDebugLogging(true);
    LogWrite(kLogLevelDebug, "fn", "debug %@", counted);
    osLog(LogCategory::Cache, OSLogLevel::Debug, "debug %@", counted);
    EXPECT_EQ(Counted::calls, 3);
    setDebugLogging(false);
    setOSLogSink(nullptr);
    closeLogFile();

    auto got = lines(readFile(tmp.path + "/vesseld.log"));
    ASSERT_EQ(got.size(), 2u);
    EXPECT_THAT(got[0], testing::EndsWith(" 5 fn: notice counted"));
    EXPECT_THAT(got[1], testing::EndsWith(" 7 fn: debug counted"));
}

TEST(LogStructured, SinkSeesCategoriesLevelsAndSignposts) {
    std::mutex mutex;
    std::vector<OSLogRecord> records;
    setOSLogSink([&](const OSLogRecord& r) {
        std::lock_guard lock(mutex);
        records.push_back(r);
    });

    const std::pair<LogCategory, const char*> categories[] = {
        {LogCategory::Unspecified, "unspecified"}, {LogCategory::Cache, "cache"},     {LogCategory::Sandbox, "sandbox"},
        {LogCategory::Ipc, "ipc"},                 {LogCategory::Locking, "locking"}, {LogCategory::Database, "database"},
        {LogCategory::Upcall, "upcall"},           {LogCategory::Lifecycle, "lifecycle"}, {LogCategory::Fs, "fs"},
        {LogCategory::Startup, "startup"},         {LogCategory::Test, "test"},       {LogCategory::Metadata, "metadata"},
        {LogCategory::CodeSignMapping, "codesignmapping"}, {LogCategory::Daemon, "daemon"}};
    for (auto [category, name] : categories) osLog(category, OSLogLevel::Error, "in %s", name);
    ASSERT_EQ(records.size(), std::size(categories));
    for (size_t k = 0; k < records.size(); k++) {
        const char* name = categories[k].second;
        EXPECT_STREQ(logCategoryName(records[k].category), name);
        EXPECT_STREQ(logSubsystemName(records[k].category),
                     std::strcmp(name, "daemon") == 0 ? "com.tarrow.vesseld" : "com.tarrow.vessel");
        EXPECT_EQ(records[k].message, std::string("in ") + name);
        EXPECT_EQ(records[k].level, OSLogLevel::Error);
        EXPECT_EQ(records[k].signpostEvent, nullptr);
    }

    records.clear();
    {
        SignpostInterval first(LogCategory::Locking, "GlobalWriteLock", " uuid=%@ ", Thing{"U"});
        SignpostInterval second(LogCategory::Fs, "TraversingDirectory", std::string());
        first.end(" count=%llu ", uint64_t{3});
        first.end("again");  // ends once
    }
    setOSLogSink(nullptr);
    ASSERT_EQ(records.size(), 4u);
    auto check = [&](size_t k, const char* event, const char* name, const std::string& attributes) {
        EXPECT_STREQ(records[k].signpostEvent, event);
        EXPECT_STREQ(records[k].signpostName, name);
        EXPECT_EQ(records[k].message, attributes);
    };
    check(0, "begin", "GlobalWriteLock", " uuid=U ");
    check(1, "begin", "TraversingDirectory", "");
    check(2, "end", "GlobalWriteLock", " count=3 ");
    check(3, "end", "TraversingDirectory", "");
    EXPECT_EQ(records[0].signpostId, records[2].signpostId);
    EXPECT_EQ(records[1].signpostId, records[3].signpostId);
    EXPECT_GT(records[1].signpostId, records[0].signpostId);
    EXPECT_EQ(records[1].category, LogCategory::Fs);
}

// Each death-test child is a fresh process, so the once-only environment reads happen there.
TEST(LogDeathTest, WithoutFileOrJournalLinesGoToStderr) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(
        {
            setenv("VESSELD_OSLOG", "stderr", 1);
            setenv("VESSELD_DEBUG", "1", 1);
            LogWrite(kLogLevelDebug, "early", "before the file %d", 1);
            osLog(LogCategory::Daemon, OSLogLevel::Fault, "exiting: %@", Thing{"why"});
            SignpostInterval interval(LogCategory::Ipc, "StartingUp", "");
            interval.end(" command=%llu ", uint64_t{4});
            std::exit(0);
        },
        testing::ExitedWithCode(0),
        testing::AllOf(
            testing::ContainsRegex("Z [0-9]+ 7 early: before the file 1"),
            testing::ContainsRegex("Z com\\.tarrow\\.vesseld\\[daemon\\] fault: exiting: why"),
            testing::ContainsRegex("com\\.tarrow\\.vessel\\[ipc\\] signpost begin StartingUp #[0-9]+: \n"),
            testing::ContainsRegex("com\\.tarrow\\.vessel\\[ipc\\] signpost end StartingUp #[0-9]+:  command=4 \n")));
    EXPECT_EXIT(
        {
            setenv("VESSELD_OSLOG", "off", 1);
            osLog(LogCategory::Cache, OSLogLevel::Error, "silent");
            std::exit(0);
        },
        testing::ExitedWithCode(0), Not(HasSubstr("silent")));
}
