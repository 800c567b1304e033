// Two-channel logging: composition, the listener, level filtering and
// configuration from a properties file.
#include <HGLog/HGLogger.h>
#include <HGLog/HGMessageBuffer.h>
#include <IC/Error.h>

#include "TestSupport.h"

namespace {

using HGLog::HGLogger;

// A file appender writing "%c|%p|%m" lines to file.
std::string appender(std::string const& name, std::string const& file)
{
    std::string const a = "log4j.appender." + name;
    return a + "=org.apache.log4j.FileAppender\n" + a + ".File=" + file + "\n" + a +
        ".layout=org.apache.log4j.PatternLayout\n" + a + ".layout.ConversionPattern=%c|%p|%m%n\n";
}

// A message part that counts how often it is rendered.
struct RenderProbe {
    int* rendered;
};
std::ostream& operator<<(std::ostream& os, RenderProbe const& p) { return os << (++*p.rendered, "probe"); }

TEST(HGMessageBuffer, ComposesInOrderAcrossBufferAndStreamAsTheStandardStreamWould)
{
    int x = 0;
    HGLog::HGMessageBuffer buf;
    buf << "a=" << 1 << " b=" << 2u << " c=" << 3ul;
    static_cast<std::ostream&>(buf) << " d=" << 4.5;
    buf << " e" << &x << static_cast<unsigned char>(65) << true << IC::Error(1, IC::Number(3u), "bad");
    EXPECT_EQ(buf.str(buf), "a=1 b=2 c=3 d=4.5 e" + ictest::ptrText(&x) + "A1status=1 code=3 text=bad");
    buf << "again" << static_cast<char const*>(nullptr); // str() emptied the buffer
    EXPECT_EQ(buf.str(buf), "again(null)");
}

// Composed once for both channels while a listener is set, never for nobody.
TEST(HGLogger, ListenerSeesEveryEventOnBothChannelsUntilRemovedAndNothingIsComposedForNobody)
{
    int rendered = 0;
    EXPECT_FALSE(HGLogger::configure("/nonexistent/log4cxx.properties")); // the quiet default stays
    EXPECT_TRUE(!HGLogger::isEnabled("Test.Quiet", 3000) && HGLogger::isEnabled("Test.Quiet", 4000));
    HGLog::logEvent("f", "S", 1, "Test.Quiet", 3000, "x", RenderProbe{&rendered});
    {
        ictest::LogCapture cap;
        HGLOG_EVENT("Mod", std::string("Test.Listener"), 3000, "count=", 5u, " ", RenderProbe{&rendered});
        ictest::expectEvent(cap, {"Test.Listener", "Mod"}, "count=5 probe", 3000, "TestBody");
    }
    HGLog::logEvent("f", "S", 1, "Test.Quiet", 3000, "x", RenderProbe{&rendered});
    EXPECT_EQ(rendered, 1);
}

// The trace channel never doubles the log channel's lines.
TEST(HGLogger, ConfigurationSelectsLoggersAndTheTraceChannelSeparately)
{
    ictest::TempDir dir("hglog");
    std::string const logOut = dir.path("log.txt"), traceOut = dir.path("trace.txt");
    ASSERT_TRUE(HGLogger::configure(
        dir.write("log4cxx.properties",
                  "log4j.rootLogger=ERROR, logFile\nlog4j.logger.Test.Cfg.A=INFO\n" + appender("logFile", logOut) +
                      "log4j.logger.HGTrace.Test.Cfg.B=INFO, traceFile\n" + appender("traceFile", traceOut))));
    EXPECT_TRUE(HGLogger::isEnabled("Test.Cfg.A.Child", 3000) && !HGLogger::isEnabled("Test.Cfg.C", 4000));
    for (char const* logger : {"Test.Cfg.A", "Test.Cfg.B", "Test.Cfg.C"})
        HGLog::logEvent("f", "S", 1, logger, 3000, "progress of ", logger);
    HGLog::logEvent("f", "S", 1, "Test.Cfg.C", 6000, "error of C");
    HGLogger::configureDefault(); // closes the files
    EXPECT_FALSE(HGLogger::isEnabled("Test.Cfg.A", 3000));
    EXPECT_EQ(ictest::slurp(logOut), "Test.Cfg.A|INFO|progress of Test.Cfg.A\nTest.Cfg.C|ERROR|error of C\n");
    EXPECT_EQ(ictest::slurp(traceOut), "HGTrace.Test.Cfg.B|INFO|progress of Test.Cfg.B\n");
}

TEST(HGLoggerDeathTest, EnvironmentNamesTheConfigurationAtStartUp)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    // The child runs this test again from the start: it finds the directory
    // through the environment instead of making its own.
    char const* const inherited = std::getenv("HGLOG_TEST_ENV_DIR");
    std::unique_ptr<ictest::TempDir> owned(inherited ? nullptr : new ictest::TempDir("hglog"));
    std::string const dir = inherited ? inherited : owned->root();
    ictest::EnvGuard dirEnv("HGLOG_TEST_ENV_DIR", dir), config("HGLOG_CONFIG", dir + "/env.properties");
    std::ofstream(dir + "/env.properties") << "log4j.rootLogger=INFO, f\n" << appender("f", dir + "/env.txt");
    EXPECT_EXIT((HGLog::logEvent("f", "S", 1, "Test.Env", 3000, "from the environment"), std::_Exit(0)),
                testing::ExitedWithCode(0), "");
    EXPECT_EQ(ictest::slurp(dir + "/env.txt"), "Test.Env|INFO|from the environment\n");
}

} // namespace
