// Two-channel logging: composition, the listener, level filtering and
// configuration from a properties file.
#include <HGLog/HGLogger.h>
#include <HGLog/HGMessageBuffer.h>
#include <IC/Error.h>

#include "LogCapture.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <sstream>
#include <atomic>
#include <string>
#include <thread>
#include <unistd.h>
#include <vector>

namespace {

std::string readFile(std::string const& path)
{
    std::ifstream in(path);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

// A scratch directory for configuration and output files.
class TempDir {
public:
    TempDir()
    {
        char tmpl[] = "/tmp/hglog-test-XXXXXX";
        char* d = mkdtemp(tmpl);
        if (d)
            path_ = d;
    }
    ~TempDir()
    {
        if (!path_.empty())
            std::system(("rm -rf '" + path_ + "'").c_str());
    }
    std::string file(std::string const& name) const { return path_ + "/" + name; }

private:
    std::string path_;
};

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

TEST(HGMessageBuffer, StreamOperatorsRenderValuesAsTheStandardStreamDoes)
{
    int x = 0;
    int* p = &x;
    int* null = nullptr;
    std::ostringstream expectP, expectNull;
    expectP << static_cast<void const*>(p);
    expectNull << static_cast<void const*>(null);

    HGLog::HGMessageBuffer buf;
    buf << p;
    EXPECT_EQ(buf.str(buf), expectP.str());
    buf << null;
    EXPECT_EQ(buf.str(buf), expectNull.str());
    unsigned char const a = 65;
    buf << a;
    EXPECT_EQ(buf.str(buf), "A");
    IC::Error const e(1, IC::Number(3u), "bad");
    buf << e;
    EXPECT_EQ(buf.str(buf), static_cast<std::string>(e));
    buf << true << false;
    EXPECT_EQ(buf.str(buf), "10");
    buf << static_cast<char const*>(nullptr);
    EXPECT_EQ(buf.str(buf), "(null)");
}

TEST(HGLogger, ListenerSeesEveryEventOnBothChannels)
{
    ictest::LogCapture cap;
    HGLog::logEvent("fn", "Source", 17, "Test.Listener", 3000, "count=", 5u, " name=", std::string("x"));
    auto const all = cap.records();
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0].channel, HGLog::Channel::Log);
    EXPECT_EQ(all[1].channel, HGLog::Channel::Trace);
    for (auto const& r : all) {
        EXPECT_EQ(r.function, "fn");
        EXPECT_EQ(r.file, "Source");
        EXPECT_EQ(r.line, 17);
        EXPECT_EQ(r.logger, "Test.Listener");
        EXPECT_EQ(r.level, 3000);
        EXPECT_EQ(r.message, "count=5 name=x");
    }
}

TEST(HGLogger, MacroPassesTheEnclosingFunctionAndLine)
{
    ictest::LogCapture cap;
    int const line = __LINE__ + 1;
    HGLOG_EVENT("Mod", std::string("Test.Macro"), 6000, "boom");
    HGLog::Record r;
    ASSERT_TRUE(cap.find("boom", &r));
    EXPECT_EQ(r.function, "TestBody");
    EXPECT_EQ(r.line, line);
    EXPECT_EQ(r.file, "Mod");
    EXPECT_EQ(r.level, 6000);
}

TEST(HGLogger, EmptyListenerRemovesTheListener)
{
    std::vector<std::string> seen;
    HGLog::HGLogger::setListener([&seen](HGLog::Record const& r) { seen.push_back(r.message); });
    HGLog::logEvent("f", "S", 1, "Test.Remove", 6000, "one");
    HGLog::HGLogger::setListener(HGLog::Listener());
    HGLog::logEvent("f", "S", 1, "Test.Remove", 6000, "two");
    EXPECT_EQ(seen, (std::vector<std::string>{"one", "one"}));
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
    HGLog::HGLogger::configureDefault();
    EXPECT_FALSE(HGLog::HGLogger::isEnabled("Test.Quiet", 3000));
    EXPECT_TRUE(HGLog::HGLogger::isEnabled("Test.Quiet", 4000));
    EXPECT_TRUE(HGLog::HGLogger::isEnabled("Test.Quiet", 6000));

    int rendered = 0;
    HGLog::logEvent("f", "S", 1, "Test.Quiet", 3000, "x", RenderProbe{&rendered});
    EXPECT_EQ(rendered, 0);

    // A listener takes everything, so then the message is composed once
    // for both channels.
    ictest::LogCapture cap;
    EXPECT_TRUE(HGLog::HGLogger::isEnabled("Test.Quiet", 3000));
    EXPECT_TRUE(HGLog::HGLogger::isEnabled("Test.Quiet", 1));
    HGLog::logEvent("f", "S", 1, "Test.Quiet", 3000, "x", RenderProbe{&rendered});
    EXPECT_EQ(rendered, 1);
    EXPECT_EQ(cap.count("xprobe"), 1u);
    EXPECT_EQ(cap.records().size(), 2u);
}

TEST(HGLogger, ConfigurationSelectsLoggersAndTheTraceChannelSeparately)
{
    TempDir dir;
    std::string const logOut = dir.file("log.txt");
    std::string const traceOut = dir.file("trace.txt");
    std::string const config = dir.file("log4cxx.properties");
    {
        std::ofstream c(config);
        c << "log4j.rootLogger=ERROR, logFile\n"
             "log4j.logger.Test.Cfg.A=INFO\n"
             "log4j.appender.logFile=org.apache.log4j.FileAppender\n"
             "log4j.appender.logFile.File="
          << logOut
          << "\n"
             "log4j.appender.logFile.layout=org.apache.log4j.PatternLayout\n"
             "log4j.appender.logFile.layout.ConversionPattern=%c|%p|%m%n\n"
             "log4j.logger.HGTrace.Test.Cfg.B=INFO, traceFile\n"
             "log4j.appender.traceFile=org.apache.log4j.FileAppender\n"
             "log4j.appender.traceFile.File="
          << traceOut
          << "\n"
             "log4j.appender.traceFile.layout=org.apache.log4j.PatternLayout\n"
             "log4j.appender.traceFile.layout.ConversionPattern=%c|%p|%m%n\n";
    }
    ASSERT_TRUE(HGLog::HGLogger::configure(config));
    EXPECT_TRUE(HGLog::HGLogger::isEnabled("Test.Cfg.A", 3000));
    EXPECT_TRUE(HGLog::HGLogger::isEnabled("Test.Cfg.A.Child", 3000));
    EXPECT_TRUE(HGLog::HGLogger::isEnabled("Test.Cfg.B", 3000)); // through its trace channel
    EXPECT_FALSE(HGLog::HGLogger::isEnabled("Test.Cfg.C", 3000));
    EXPECT_FALSE(HGLog::HGLogger::isEnabled("Test.Cfg.C", 4000));

    HGLog::logEvent("f", "S", 1, "Test.Cfg.A", 3000, "progress of A");
    HGLog::logEvent("f", "S", 1, "Test.Cfg.B", 3000, "progress of B");
    HGLog::logEvent("f", "S", 1, "Test.Cfg.C", 6000, "error of C");
    HGLog::logEvent("f", "S", 1, "Test.Cfg.C", 3000, "progress of C");
    HGLog::HGLogger::configureDefault(); // closes the files

    std::string const log = readFile(logOut);
    EXPECT_NE(log.find("Test.Cfg.A|INFO|progress of A"), std::string::npos) << log;
    EXPECT_NE(log.find("Test.Cfg.C|ERROR|error of C"), std::string::npos) << log;
    EXPECT_EQ(log.find("progress of B"), std::string::npos) << log;
    EXPECT_EQ(log.find("progress of C"), std::string::npos) << log;
    // The trace channel stays off unless selected, and never doubles the
    // log channel's lines.
    EXPECT_EQ(log.find("HGTrace"), std::string::npos) << log;

    std::string const trace = readFile(traceOut);
    EXPECT_NE(trace.find("HGTrace.Test.Cfg.B|INFO|progress of B"), std::string::npos) << trace;
    EXPECT_EQ(trace.find("of A"), std::string::npos) << trace;
    EXPECT_EQ(trace.find("of C"), std::string::npos) << trace;
}

TEST(HGLogger, MissingConfigurationFileKeepsTheDefault)
{
    HGLog::HGLogger::configureDefault();
    EXPECT_FALSE(HGLog::HGLogger::configure("/nonexistent/log4cxx.properties"));
    EXPECT_FALSE(HGLog::HGLogger::isEnabled("Test.Missing", 3000));
    EXPECT_TRUE(HGLog::HGLogger::isEnabled("Test.Missing", 6000));
}

TEST(HGLoggerDeathTest, EnvironmentNamesTheConfigurationAtStartUp)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    // The child process re-runs this test from the start: it finds the
    // directory through the environment instead of making its own, and the
    // configuration variable is set before its logging starts up.
    char const* const inherited = std::getenv("HGLOG_TEST_ENV_DIR");
    std::unique_ptr<TempDir> owned;
    std::string dir;
    if (inherited) {
        dir = inherited;
    } else {
        owned = std::make_unique<TempDir>();
        dir = owned->file("");
        setenv("HGLOG_TEST_ENV_DIR", dir.c_str(), 1);
    }
    std::string const out = dir + "env.txt";
    std::string const config = dir + "env.properties";
    {
        std::ofstream c(config);
        c << "log4j.rootLogger=INFO, f\n"
             "log4j.appender.f=org.apache.log4j.FileAppender\n"
             "log4j.appender.f.File="
          << out
          << "\n"
             "log4j.appender.f.layout=org.apache.log4j.PatternLayout\n"
             "log4j.appender.f.layout.ConversionPattern=%m%n\n";
    }
    setenv("HGLOG_CONFIG", config.c_str(), 1);
    EXPECT_EXIT(
        {
            HGLog::logEvent("f", "S", 1, "Test.Env", 3000, "from the environment");
            std::_Exit(HGLog::HGLogger::isEnabled("Test.Env", 3000) ? 0 : 1);
        },
        testing::ExitedWithCode(0), "");
    unsetenv("HGLOG_CONFIG");
    unsetenv("HGLOG_TEST_ENV_DIR");
    EXPECT_NE(readFile(out).find("from the environment"), std::string::npos);
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
        HGLog::HGLogger::setListener([&delivered](HGLog::Record const&) { ++delivered; });
        HGLog::HGLogger::setListener(HGLog::Listener());
    }
    ictest::LogCapture cap;
    while (cap.records().size() < 8)
        std::this_thread::yield();
    stop = true;
    for (auto& t : loggers)
        t.join();
    for (auto const& r : cap.records())
        EXPECT_EQ(r.message, "thread " + std::to_string(r.line));
}

} // namespace
