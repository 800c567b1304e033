// Two-channel logging: composition, the listener, level filtering and
// configuration from a properties file.
#include <HGLog/HGLogger.h>
#include <HGLog/HGMessageBuffer.h>
#include <IC/Error.h>

#include "TestSupport.h"

namespace {

using HGLog::HGLogger;

std::string readFile(std::string const& path)
{
    std::ifstream in(path);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

// A file appender writing "%c|%p|%m" lines of one logger to file.
std::string appender(std::string const& name, std::string const& file)
{
    std::string const a = "log4j.appender." + name;
    return a + "=org.apache.log4j.FileAppender\n" + a + ".File=" + file + "\n" + a +
           ".layout=org.apache.log4j.PatternLayout\n" + a +
           ".layout.ConversionPattern=%c|%p|%m%n\n";
}

TEST(HGMessageBuffer, AppendsInOrderAcrossBufferAndStream)
{
    HGLog::HGMessageBuffer buf;
    buf << "a=" << 1 << " b=" << 2u << " c=" << 3ul;
    std::ostream& os = buf;
    os << " d=" << 4.5;
    buf << " e";
    EXPECT_EQ(buf.str(buf), "a=1 b=2 c=3 d=4.5 e");
    // str() leaves the buffer empty, so the same buffer composes again.
    buf << "again";
    EXPECT_EQ(buf.str(buf), "again");
    std::ostream& os2 = buf;
    os2 << "via stream";
    EXPECT_EQ(buf.str(os2), "via stream");
    EXPECT_EQ(buf.str(buf), "");
}

TEST(HGMessageBuffer, RendersOtherValuesAsTheStandardStreamDoes)
{
    int x = 0;
    int* p = &x;
    int* null = nullptr;
    IC::Error const e(1, IC::Number(3u), "bad");
    HGLog::HGMessageBuffer buf;
    buf << p;
    EXPECT_EQ(buf.str(buf), ictest::ptrText(p));
    buf << null;
    EXPECT_EQ(buf.str(buf), ictest::ptrText(nullptr));
    buf << static_cast<unsigned char>(65);
    EXPECT_EQ(buf.str(buf), "A");
    buf << e;
    EXPECT_EQ(buf.str(buf), static_cast<std::string>(e));
    buf << true << false;
    EXPECT_EQ(buf.str(buf), "10");
    buf << static_cast<char const*>(nullptr);
    EXPECT_EQ(buf.str(buf), "(null)");
}

TEST(HGLogger, ListenerSeesEveryEventOnBothChannelsUntilRemoved)
{
    {
        ictest::LogCapture cap;
        HGLog::logEvent("fn", "Source", 17, "Test.Listener", 3000, "count=", 5u, " name=",
                        std::string("x"));
        ictest::expectEvent(cap, {"Test.Listener", "Source"}, "count=5 name=x", 3000, "fn");
        auto const all = cap.records();
        ASSERT_EQ(all.size(), 2u);
        EXPECT_EQ(all[0].channel, HGLog::Channel::Log);
        EXPECT_EQ(all[0].line, 17);
    }
    std::vector<std::string> seen;
    HGLogger::setListener([&seen](HGLog::Record const& r) { seen.push_back(r.message); });
    HGLog::logEvent("f", "S", 1, "Test.Remove", 6000, "one");
    HGLogger::setListener(HGLog::Listener());
    HGLog::logEvent("f", "S", 1, "Test.Remove", 6000, "two");
    EXPECT_EQ(seen, (std::vector<std::string>{"one", "one"}));
}

TEST(HGLogger, MacroPassesTheEnclosingFunctionAndLine)
{
    ictest::LogCapture cap;
    int const line = __LINE__ + 1;
    HGLOG_EVENT("Mod", std::string("Test.Macro"), 6000, "boom");
    ictest::expectEvent(cap, {"Test.Macro", "Mod"}, "boom", 6000, "TestBody");
    EXPECT_EQ(cap.logs()[0].line, line);
}

// A message part that counts how often it is rendered.
struct RenderProbe {
    int* rendered;
};
std::ostream& operator<<(std::ostream& os, RenderProbe const& p)
{
    ++*p.rendered;
    return os << "probe";
}

TEST(HGLogger, QuietDefaultComposesNothingBelowWarnings)
{
    // A missing file keeps the default.
    EXPECT_FALSE(HGLogger::configure("/nonexistent/log4cxx.properties"));
    EXPECT_FALSE(HGLogger::isEnabled("Test.Quiet", 3000));
    EXPECT_TRUE(HGLogger::isEnabled("Test.Quiet", 4000));
    EXPECT_TRUE(HGLogger::isEnabled("Test.Quiet", 6000));
    int rendered = 0;
    HGLog::logEvent("f", "S", 1, "Test.Quiet", 3000, "x", RenderProbe{&rendered});
    EXPECT_EQ(rendered, 0);

    // A listener takes everything; the message is composed once for both
    // channels.
    ictest::LogCapture cap;
    EXPECT_TRUE(HGLogger::isEnabled("Test.Quiet", 1));
    HGLog::logEvent("f", "S", 1, "Test.Quiet", 3000, "x", RenderProbe{&rendered});
    EXPECT_EQ(rendered, 1);
    EXPECT_EQ(cap.count("xprobe"), 1u);
    EXPECT_EQ(cap.records().size(), 2u);
}

TEST(HGLogger, ConfigurationSelectsLoggersAndTheTraceChannelSeparately)
{
    ictest::TempDir dir("hglog");
    std::string const logOut = dir.path("log.txt"), traceOut = dir.path("trace.txt");
    std::string const config = dir.write(
        "log4cxx.properties", "log4j.rootLogger=ERROR, logFile\nlog4j.logger.Test.Cfg.A=INFO\n" +
                                  appender("logFile", logOut) +
                                  "log4j.logger.HGTrace.Test.Cfg.B=INFO, traceFile\n" +
                                  appender("traceFile", traceOut));
    ASSERT_TRUE(HGLogger::configure(config));
    EXPECT_TRUE(HGLogger::isEnabled("Test.Cfg.A", 3000));
    EXPECT_TRUE(HGLogger::isEnabled("Test.Cfg.A.Child", 3000));
    EXPECT_TRUE(HGLogger::isEnabled("Test.Cfg.B", 3000)); // through its trace channel
    EXPECT_FALSE(HGLogger::isEnabled("Test.Cfg.C", 4000));

    HGLog::logEvent("f", "S", 1, "Test.Cfg.A", 3000, "progress of A");
    HGLog::logEvent("f", "S", 1, "Test.Cfg.B", 3000, "progress of B");
    HGLog::logEvent("f", "S", 1, "Test.Cfg.C", 6000, "error of C");
    HGLog::logEvent("f", "S", 1, "Test.Cfg.C", 3000, "progress of C");
    HGLogger::configureDefault(); // closes the files
    EXPECT_FALSE(HGLogger::isEnabled("Test.Cfg.A", 3000));

    // The trace channel stays off unless selected, and never doubles the log
    // channel's lines.
    std::string const log = readFile(logOut), trace = readFile(traceOut);
    EXPECT_NE(log.find("Test.Cfg.A|INFO|progress of A"), std::string::npos) << log;
    EXPECT_NE(log.find("Test.Cfg.C|ERROR|error of C"), std::string::npos) << log;
    for (char const* absent : {"progress of B", "progress of C", "HGTrace"})
        EXPECT_EQ(log.find(absent), std::string::npos) << log;
    EXPECT_NE(trace.find("HGTrace.Test.Cfg.B|INFO|progress of B"), std::string::npos) << trace;
    EXPECT_EQ(trace.find("of A"), std::string::npos) << trace;
    EXPECT_EQ(trace.find("of C"), std::string::npos) << trace;
}

TEST(HGLoggerDeathTest, EnvironmentNamesTheConfigurationAtStartUp)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    // The child re-runs this test from the start: it finds the directory
    // through the environment instead of making its own, and the
    // configuration variable is set before its logging starts up.
    char const* const inherited = std::getenv("HGLOG_TEST_ENV_DIR");
    std::unique_ptr<ictest::TempDir> owned;
    if (!inherited)
        owned = std::make_unique<ictest::TempDir>("hglog");
    std::string const dir = inherited ? inherited : owned->root();
    ictest::EnvGuard dirEnv("HGLOG_TEST_ENV_DIR", dir);
    std::string const out = dir + "/env.txt";
    std::ofstream(dir + "/env.properties")
        << "log4j.rootLogger=INFO, f\n" << appender("f", out);
    ictest::EnvGuard config("HGLOG_CONFIG", dir + "/env.properties");
    EXPECT_EXIT(
        {
            HGLog::logEvent("f", "S", 1, "Test.Env", 3000, "from the environment");
            std::_Exit(HGLogger::isEnabled("Test.Env", 3000) ? 0 : 1);
        },
        testing::ExitedWithCode(0), "");
    EXPECT_NE(readFile(out).find("Test.Env|INFO|from the environment"), std::string::npos);
}

TEST(HGLogger, ConcurrentLoggingAndListenerChanges)
{
    std::atomic<bool> stop{false};
    std::atomic<int> delivered{0};
    std::vector<std::thread> loggers;
    for (int t = 0; t < 4; ++t)
        loggers.emplace_back([&stop, t] {
            while (!stop.load())
                HGLog::logEvent("f", "S", t, "Test.Threads", 3000, "thread ", t);
        });
    for (int i = 0; i < 200; ++i) {
        HGLogger::setListener([&delivered](HGLog::Record const&) { ++delivered; });
        HGLogger::setListener(HGLog::Listener());
    }
    ictest::LogCapture cap;
    EXPECT_TRUE(ictest::eventually([&] { return cap.records().size() >= 8; }));
    stop = true;
    for (auto& t : loggers)
        t.join();
    for (auto const& r : cap.records())
        EXPECT_EQ(r.message, "thread " + std::to_string(r.line));
}

} // namespace
