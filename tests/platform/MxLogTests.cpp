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

TEST(MxLogTest, BurstsAreCutByTextAndByPlaceAndCountedOnTheNextLineShown)
{
    CapturingLogSink sink;
    ScopedInstall<MxLogSink> install(sink);
    for (int row = 0; row < 1000; ++row) {
        MXLOG(nullptr, Error, "write failed");
        MXLOG(nullptr, Error, "failed to find reporting session {}", row % 5);
        MXLOG(nullptr, Default, "datagram {} ignored", row);
        MXLOG_VERBOSE(nullptr, "never cut {}", row);
    }
    auto errors = sink.texts(MxLogLevel::Error);
    EXPECT_EQ(std::count(errors.begin(), errors.end(), "write failed"), 10);
    EXPECT_EQ(std::count(errors.begin(), errors.end(), "failed to find reporting session 3"), 10)
        << "each text has its own count";
    auto flood = sink.texts(MxLogLevel::Default);
    ASSERT_EQ(flood.size(), 100u) << "one place, texts all different";
    EXPECT_EQ(flood.back(), "datagram 99 ignored");

    // What a place held back is counted on its next line shown.
    sink.clear();
    for (int i = 0; i < 12; ++i)
        MxLogWrite(nullptr, MxLogLevel::Error, "place.cpp", 7, "void f()", "same");
    MxLogWrite(nullptr, MxLogLevel::Error, "place.cpp", 7, "void f()", "other");
    EXPECT_EQ(sink.texts().back(), "other (2 more like it suppressed)");
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
