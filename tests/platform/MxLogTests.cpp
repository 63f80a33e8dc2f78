#include "platform/MxLog.h"

#include <algorithm>
#include <cstdlib>

#include <gtest/gtest.h>

#include "fakes/CapturingLogSink.h"

namespace mx::testing {
namespace {

TEST(MxLogTest, EveryLineCarriesFileLineAndFunctionPrefix)
{
    CapturingLogSink sink;
    ScopedInstall<MxLogSink> install(sink);
    MXLOG(nullptr, Error, "value {}", 7);
    auto lines = sink.lines();
    ASSERT_EQ(lines.size(), 1u);
    EXPECT_EQ(lines[0].message, fmt::format("MxLogTests.cpp:{}:TestBody: value 7", __LINE__ - 3));
    EXPECT_EQ(lines[0].level, MxLogLevel::Error);

    [] {
        MXLOG(nullptr, Default, "from a lambda");
    }();
    EXPECT_EQ(sink.lines().back().function, "TestBody") << "a lambda's line names the function it is written in";
    EXPECT_EQ(MxLogFunctionName("std::optional<int> mx::A<T>::get(int (*)(int)) const [with T = int]"), "get");
    EXPECT_EQ(MxLogFunctionName("auto mx::B::run()::(anonymous class)::operator()() const"), "run");
    EXPECT_EQ(MxLogFunctionName("mx::C::C(std::function<void(int)>)::<lambda(int)>::<lambda()>"), "C");
}

TEST(MxLogTest, VerboseLinesNeedTheScopesSwitchAtLevelFive)
{
    // Before any scope reads the environment, and no other thread of this test runs.
    ::setenv("mxlog_test_loud", "5", 1);  // NOLINT(concurrency-mt-unsafe)
    ::setenv("mxlog_test_quiet", "4", 1); // NOLINT(concurrency-mt-unsafe)
    const MxLogScope* loud =
        MxLogRegisterScope(1, MxFourCharCode("loud"), "loud", "com.kestrel.harmonia", "mxlog_test_loud", 31);
    const MxLogScope* quiet =
        MxLogRegisterScope(1, MxFourCharCode("quit"), "quit", "com.kestrel.harmonia", "mxlog_test_quiet", 31);
    EXPECT_EQ(MxLogRegisterScope(1, 0, "loud", "other", "other", 31), loud) << "registered once";

    CapturingLogSink sink;
    ScopedInstall<MxLogSink> install(sink);
    int formatted = 0;
    auto count = [&] {
        return ++formatted;
    };
    MXLOG_VERBOSE(loud, "loud {}", count());
    MXLOG_VERBOSE(quiet, "quiet {}", count());
    MXLOG_VERBOSE(nullptr, "default {}", count());
    EXPECT_EQ(sink.texts(), std::vector<std::string>{"loud 1"});
    EXPECT_EQ(sink.lines()[0].level, MxLogLevel::Debug);
    EXPECT_EQ(formatted, 1) << "a silent verbose line is not even formatted";
}

TEST(MxLogTest, OwnLinesAreCutByPlaceAndCountedOnALineOfTheirOwnWhileTheServicesLinesAllPass)
{
    CapturingLogSink sink;
    ScopedInstall<MxLogSink> install(sink);
    auto ignore = [](int row) {
        MXLOG_LIMITED(nullptr, Default, "datagram {} ignored", row);
    };
    for (int row = 0; row < 1000; ++row) {
        MXLOG(nullptr, Error, "failed to find reporting session {}", row % 5);
        ignore(row);
    }
    auto errors = sink.texts(MxLogLevel::Error);
    EXPECT_EQ(errors.size(), 1000u) << "the service's own lines are written each time";
    EXPECT_EQ(std::count(errors.begin(), errors.end(), "failed to find reporting session 3"), 200);
    auto flood = sink.texts(MxLogLevel::Default);
    ASSERT_EQ(flood.size(), 100u) << "one place of the daemon's own, texts all different";
    EXPECT_EQ(flood.back(), "datagram 99 ignored");

    sink.clear();
    MxLogEndBurstWindowsForTesting();
    ignore(1000);
    EXPECT_EQ(sink.texts(),
              (std::vector<std::string>{"900 more lines from here were held back", "datagram 1000 ignored"}))
        << "the count stands apart from the next line's text";
    EXPECT_EQ(sink.lines()[0].message.substr(0, 20), sink.lines()[1].message.substr(0, 20)) << "from the same place";
}

TEST(MxLogTest, TextsAreOnePrintableLine)
{
    CapturingLogSink sink;
    ScopedInstall<MxLogSink> install(sink);
    MXLOG(nullptr, Default, "client {} left", "ev\x1b]0;owned\x07il\nINFO fake line\t\xc2\x9b\xff é");
    EXPECT_EQ(sink.texts(),
              std::vector<std::string>{"client ev\\x1b]0;owned\\x07il\\nINFO fake line\\t\\u009b\\xff é left"});
}

} // namespace
} // namespace mx::testing
