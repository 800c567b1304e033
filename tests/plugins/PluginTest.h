// Helpers shared by the plug-in loading tests: temporary plug-in directories
// filled with the test plug-ins, the environment that points the library at
// them, log look-ups, and checks that a library is really closed.
#pragma once

#include "Probe.h"

#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>
#include <IC/LoadControl.h>
#include <SD/PlatformUtilities.h>

#include <LogCapture.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

namespace ictest {

namespace fs = std::filesystem;

inline std::string const kLogIC = "Helmgard.IC.InstrumentationControl";
inline std::string const kLogMI = "Helmgard.IC.InstrumentationControl.MIControl";
inline std::string const kLogFP = "Helmgard.IC.InstrumentationControl.FPControl";
inline std::string const kLogLT = "Helmgard.IC.InstrumentationControl.LoaderThread";
inline std::string const kLogLC = "Helmgard.IC.LoadControl";

// The built plug-in of that name.
inline std::string moduleFile(std::string const& name)
{
    return std::string(IC_TEST_MODULE_DIR) + "/" + name + ".so";
}

// How the library writes a pointer into a log line.
inline std::string ptrText(void const* p)
{
    std::ostringstream os;
    os << p;
    return os.str();
}

// True when a file whose path contains fragment is mapped into this process.
inline bool isMapped(std::string const& fragment)
{
    std::ifstream maps("/proc/self/maps");
    std::string line;
    while (std::getline(maps, line))
        if (line.find(fragment) != std::string::npos)
            return true;
    return false;
}

// A temporary tree with an "mi" and an "fp" directory; removed when done.
class TempTree {
public:
    TempTree()
    {
        char tmpl[] = "/tmp/ictest-plugins-XXXXXX";
        char* dir = mkdtemp(tmpl);
        if (dir == nullptr)
            throw std::runtime_error("mkdtemp failed");
        root_ = dir;
        fs::create_directory(miDir());
        fs::create_directory(fpDir());
    }
    ~TempTree()
    {
        std::error_code ec;
        fs::remove_all(root_, ec);
    }
    TempTree(TempTree const&) = delete;
    TempTree& operator=(TempTree const&) = delete;

    std::string root() const { return root_; }
    std::string miDir() const { return root_ + "/mi"; }
    std::string fpDir() const { return root_ + "/fp"; }

    // Copies the built plug-in into dir as file name `as` ("<module>.so" when
    // empty). The copy appears at once under its final name, never half
    // written: a scan must not meet a partial library.
    std::string install(std::string const& dir, std::string const& module,
                        std::string as = std::string())
    {
        if (as.empty())
            as = module + ".so";
        std::string const target = dir + "/" + as;
        std::string const partial = dir + "/." + as + ".partial";
        fs::copy_file(moduleFile(module), partial, fs::copy_options::overwrite_existing);
        fs::rename(partial, target);
        return target;
    }
    std::string addMI(std::string const& module, std::string const& as = std::string())
    {
        return install(miDir(), module, as);
    }
    std::string addFP(std::string const& module, std::string const& as = std::string())
    {
        return install(fpDir(), module, as);
    }
    static void remove(std::string const& path) { fs::remove(path); }
    static void rename(std::string const& from, std::string const& to) { fs::rename(from, to); }

private:
    std::string root_;
};

// Sets a variable for the life of the guard and restores what was there.
class EnvGuard {
public:
    EnvGuard(char const* name, std::string const& value) : name_(name)
    {
        if (char const* old = std::getenv(name)) {
            had_ = true;
            old_ = old;
        }
        setenv(name, value.c_str(), 1);
    }
    ~EnvGuard()
    {
        if (had_)
            setenv(name_.c_str(), old_.c_str(), 1);
        else
            unsetenv(name_.c_str());
    }
    EnvGuard(EnvGuard const&) = delete;
    EnvGuard& operator=(EnvGuard const&) = delete;

private:
    std::string name_;
    std::string old_;
    bool had_ = false;
};

// Undoes every open, so that the next test starts with a first open.
inline void fullyUnload()
{
    for (int i = 0; i < 64 && (IC::InstCtrl::ICloadCount != 0 || !IC::InstCtrl::unloaddone); ++i)
        Unloadlib();
}

// Aborts the process when a test that could deadlock has not finished in
// time: a hung test would otherwise only show as a time-out of the runner.
class Watchdog {
public:
    explicit Watchdog(int seconds, std::string what) : what_(std::move(what))
    {
        thread_ = std::thread([this, seconds] {
            std::unique_lock<std::mutex> g(m_);
            if (!cv_.wait_for(g, std::chrono::seconds(seconds), [this] { return done_; })) {
                std::fprintf(stderr, "watchdog: %s did not finish\n", what_.c_str());
                std::abort();
            }
        });
    }
    ~Watchdog()
    {
        {
            std::lock_guard<std::mutex> g(m_);
            done_ = true;
        }
        cv_.notify_all();
        thread_.join();
    }

private:
    std::string what_;
    std::mutex m_;
    std::condition_variable cv_;
    bool done_ = false;
    std::thread thread_;
};

// ---- log look-ups (log channel only) ----

// Events of one logger, in order.
inline std::vector<HGLog::Record> logsOf(LogCapture const& cap, std::string const& logger)
{
    std::vector<HGLog::Record> out;
    for (auto const& r : cap.logs())
        if (r.logger == logger)
            out.push_back(r);
    return out;
}

// Events of the library's own loggers (not the platform's, not the probe's).
inline std::vector<HGLog::Record> libraryLogs(LogCapture const& cap)
{
    std::vector<HGLog::Record> out;
    for (auto const& r : cap.logs())
        if (r.logger.compare(0, 11, "Helmgard.IC") == 0)
            out.push_back(r);
    return out;
}

inline std::size_t countLog(LogCapture const& cap, std::string const& logger, int level,
                            std::string const& message)
{
    std::size_t n = 0;
    for (auto const& r : logsOf(cap, logger))
        if (r.level == level && r.message == message)
            ++n;
    return n;
}

// The first event of that logger and message; fails the test when missing.
inline HGLog::Record findLog(LogCapture const& cap, std::string const& logger,
                             std::string const& message)
{
    for (auto const& r : logsOf(cap, logger))
        if (r.message == message)
            return r;
    ADD_FAILURE() << "no log \"" << message << "\" on " << logger;
    return HGLog::Record{HGLog::Channel::Log, "", "", 0, "", 0, ""};
}

inline bool startsWith(std::string const& s, std::string const& prefix)
{
    return s.compare(0, prefix.size(), prefix) == 0;
}

// Messages of the library's loggers and of the probe, in the order they
// happened: plug-in calls line up with the loader's lines.
inline std::vector<std::string> timeline(LogCapture const& cap)
{
    std::vector<std::string> out;
    for (auto const& r : cap.logs())
        if (r.logger.compare(0, 11, "Helmgard.IC") == 0 || r.logger == "ictest.probe")
            out.push_back(r.message);
    return out;
}

// Position of the first entry equal to text; -1 when missing.
inline long indexOf(std::vector<std::string> const& v, std::string const& text)
{
    auto it = std::find(v.begin(), v.end(), text);
    return it == v.end() ? -1 : static_cast<long>(it - v.begin());
}

inline std::string errText(IC::Error const& e)
{
    return static_cast<std::string>(e);
}

// Base of the tests that load plug-ins: a fresh temporary tree, the
// environment pointing at it, a clean probe; the library fully unloaded
// before and after.
class PluginTest : public testing::Test {
protected:
    PluginTest()
        : miEnv_("IC_MI_DIR", tree_.miDir()), fpEnv_("IC_FP_DIR", tree_.fpDir())
    {
    }
    void SetUp() override
    {
        fullyUnload();
        ictestprobe::reset();
    }
    void TearDown() override
    {
        fullyUnload();
        EXPECT_EQ(IC::InstCtrl::ICloadCount, 0u);
        EXPECT_TRUE(IC::InstCtrl::unloaddone);
    }

    TempTree tree_;
    EnvGuard miEnv_;
    EnvGuard fpEnv_;
};

} // namespace ictest
