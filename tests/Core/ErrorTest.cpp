#include <gtest/gtest.h>

#include <stdexcept>

#include "Daemon/Core/VSLExceptionGuard.h"
#include <sys/stat.h>
#include <unistd.h>

#include "Platform/CrashAnnotation.h"
#include "Platform/DeviceFacts.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Platform/Log.h"
#include "Support/TempRoot.h"

using namespace vsl;

TEST(VSLError, CarriesFunctionAndLineAndLogsOnce) {
    std::string dir = test::makeTempDir("vessel-log-");
    LogFileOptions options;
    options.directory = dir;
    ASSERT_TRUE(openLogFile(options));

    auto quiet = createVSLError("quietFn", 12, kVSLErrorNotFound, nullptr, false);
    EXPECT_EQ(VSLErrorDomain, quiet->domain);
    EXPECT_EQ(21, quiet->code);
    EXPECT_FALSE(quiet->localizedDescription.has_value()) << "no format, no description";
    EXPECT_EQ("quietFn", quiet->functionName);
    EXPECT_EQ(12, quiet->sourceFileLine);

    auto under = createPOSIXError("posixFn", 7, 13, "open %@ failed", std::string("/x"));
    EXPECT_EQ(VSLPOSIXErrorDomain, under->domain);
    EXPECT_EQ(13, under->code);
    EXPECT_EQ("open /x failed", under->localizedDescription.value_or(""));
    EXPECT_EQ("posixFn", under->functionName);

    auto loud = createVSLError("-[VSLThing doIt:]", 99, kVSLErrorReadFile, under, true,
                               "Failed to read metadata at URL %@", std::string("/a/b"));
    EXPECT_EQ("Failed to read metadata at URL /a/b", loud->localizedDescription.value_or(""));
    EXPECT_EQ(under, loud->underlyingError);
    EXPECT_EQ(kVSLErrorReadFile, codeForError(loud, 0));
    EXPECT_EQ(42u, codeForError(under, 42)) << "only our domain's codes are read as codes";

    createVSLError("silentFn", 5, kVSLErrorNotFound, nullptr, false, "Container with identifier: \"%@\" Not Found",
                   std::string("com.quiet"));
    closeLogFile();

    std::string log = test::readFile(dir + "/vesseld.log");
    EXPECT_NE(std::string::npos, log.find(" 3 -[VSLThing doIt:]: 99: Failed to read metadata at URL /a/b ("))
        << log;
    EXPECT_EQ(std::string::npos, log.find("com.quiet")) << "the log flag off writes nothing";
    EXPECT_NE(std::string::npos, log.find("(Error Domain=POSIXErrorDomain Code=13 \"open /x failed\""))
        << "the underlying error's description is in the parenthesis";
    test::removeTree(dir);
}

TEST(ExceptionGuard, NonInternalBuildReturnsCode40AndGoesOn) {
    test::TempRoot root;  // no device facts: not an internal build
    VSLErrorRef error;
    bool ran = VSL_GUARD_EXCEPTIONS(&error, [] () -> bool { throw std::runtime_error("boom"); });
    EXPECT_FALSE(ran);
    ASSERT_TRUE(error);
    EXPECT_EQ(kVSLErrorException, codeForError(error, 0));
    EXPECT_EQ(0u, error->localizedDescription.value_or("").find("Got exception: std::runtime_error: boom : "));

    error.reset();
    EXPECT_TRUE(VSL_GUARD_EXCEPTIONS(&error, [] { return true; }));
    EXPECT_FALSE(error);
}

TEST(ExceptionGuard, ReportTextShape) {
    VSLExceptionInfo info{"std::logic_error", "bad state", {"frame0", "frame1"}};
    EXPECT_EQ("** INTERNAL ERROR: Uncaught Exception **\nException: <worker> std::logic_error: bad state\nStack:\n"
              "frame0\nframe1",
              uncaughtExceptionReport(info, "worker"));
    VSLExceptionInfo bare{"", "", {}};
    EXPECT_EQ("** INTERNAL ERROR: Uncaught Exception **\nException: \nStack:\n", uncaughtExceptionReport(bare, ""));
}

TEST(ExceptionGuardDeathTest, InternalBuildAbortsWithReportInAnnotation) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    // The child re-runs this body: every path here must come out the same in both.
    std::string root = ::testing::TempDir() + "vessel-internal-root";
    std::string annotation = ::testing::TempDir() + "vessel-crash-annotation.txt";
    ::unlink(annotation.c_str());
    auto setUpRoot = [&] {
        test::removeTree(root);
        ::mkdir(root.c_str(), 0755);
        ::mkdir((root + "/etc").c_str(), 0755);
        ::mkdir((root + "/etc/vesseld").c_str(), 0755);
        auto bytes = encodeBinaryPropertyList(dict({{"InternalBuild", Value::boolean(true)}}), nullptr);
        FILE* f = fopen((root + "/etc/vesseld/device.plist").c_str(), "w");
        fwrite(bytes->data(), 1, bytes->size(), f);
        fclose(f);
        setSystemRoot(root);
        reloadDeviceFacts();
    };
    EXPECT_DEATH(
        {
            setUpRoot();
            setCrashAnnotationFile(annotation);
            VSLErrorRef error;
            VSL_GUARD_EXCEPTIONS(&error, [] () -> bool { throw std::out_of_range("index 9"); });
        },
        "INTERNAL ERROR: Uncaught Exception \\*\\*\nException: .*std::out_of_range: index 9\nStack:");
    std::string text = test::readFile(annotation);
    EXPECT_EQ(0u, text.find("** INTERNAL ERROR: Uncaught Exception **\nException: ")) << text;
    test::removeTree(root);
    ::unlink(annotation.c_str());
}
