// Helpers shared by the plug-in loading tests: temporary plug-in directories
// filled with the test plug-ins, the environment that points the library at
// them, log and probe look-ups, and checks that a library is really closed.
#pragma once

#include "Probe.h"

#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>
#include <IC/LoadControl.h>
#include <SD/PlatformUtilities.h>

#include <Recorders.h>
#include <TestSupport.h>

namespace ictest {

namespace fs = std::filesystem;

inline std::string const kLogIC = "Helmgard.IC.InstrumentationControl";
inline std::string const kLogMI = "Helmgard.IC.InstrumentationControl.MIControl";
inline std::string const kLogFP = "Helmgard.IC.InstrumentationControl.FPControl";
inline std::string const kLogLT = "Helmgard.IC.InstrumentationControl.LoaderThread";
inline std::string const kLogLC = "Helmgard.IC.LoadControl";

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

// A temporary tree with an "mi" and an "fp" directory.
class TempTree : public TempDir {
public:
    TempTree() : TempDir("ictest-plugins")
    {
        fs::create_directory(miDir());
        fs::create_directory(fpDir());
    }
    std::string miDir() const { return path("mi"); }
    std::string fpDir() const { return path("fp"); }

    // Copies the built plug-in into dir as file name `as` ("<module>.so" when
    // empty). The copy appears at once under its final name, never half
    // written: a scan must not meet a partial library.
    std::string install(std::string const& dir, std::string const& module,
                        std::string as = std::string()) const
    {
        if (as.empty())
            as = module + ".so";
        std::string const target = dir + "/" + as, partial = dir + "/." + as + ".partial";
        fs::copy_file(std::string(IC_TEST_MODULE_DIR) + "/" + module + ".so", partial,
                      fs::copy_options::overwrite_existing);
        fs::rename(partial, target);
        return target;
    }
    std::string addMI(std::string const& module, std::string const& as = std::string()) const
    {
        return install(miDir(), module, as);
    }
    std::string addFP(std::string const& module, std::string const& as = std::string()) const
    {
        return install(fpDir(), module, as);
    }
};

// The libraries of dir as discovery finds them, but those named in skip
// (which are closed again).
inline std::vector<IC::libstruct> discover(std::string const& dir, std::set<std::string> const& skip = {})
{
    std::vector<IC::libstruct> found, kept;
    std::set<std::string> names;
    IC::LoadControl().findLibs(dir, found, names);
    for (auto& r : found)
        if (skip.count(r.name) != 0)
            SD::PlatformUtilities::unloadLibrary(r.handle);
        else
            kept.push_back(r);
    return kept;
}

// Each record as "<name> <load number>".
inline std::vector<std::string> recs(std::vector<IC::libstruct> const& libs)
{
    std::vector<std::string> out;
    for (auto const& r : libs)
        out.push_back(r.name + " " + std::to_string(r.idbase >> 16));
    return out;
}

// Undoes every open, so that the next test starts with a first open.
inline void fullyUnload()
{
    for (int i = 0; i < 64 && (IC::InstCtrl::ICloadCount != 0 || !IC::InstCtrl::unloaddone); ++i)
        Unloadlib();
}

// ---- log look-ups (log channel only) ----

// The first event of that logger and message; fails the test when missing.
inline HGLog::Record findLog(LogCapture const& cap, std::string const& logger,
                             std::string const& message)
{
    for (auto const& r : cap.logs(logger))
        if (r.message == message)
            return r;
    ADD_FAILURE() << "no log \"" << message << "\" on " << logger;
    return HGLog::Record{HGLog::Channel::Log, "", "", 0, "", 0, ""};
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

// Each text appears in v, in this order.
inline void expectInOrder(std::vector<std::string> const& v, std::vector<std::string> const& texts)
{
    long last = -1;
    for (auto const& t : texts) {
        long const at = indexOf(v, t);
        EXPECT_GT(at, last) << "'" << t << "' missing or out of order";
        last = std::max(last, at);
    }
}

// ---- the probe ----

// Events a plug-in recorded about the loader's calls (not its image's).
inline std::vector<std::string> callsOf(std::string const& name)
{
    std::vector<std::string> out;
    for (auto const& e : ictestprobe::eventsWithPrefix(name + ":"))
        if (e.find(":image ") == std::string::npos)
            out.push_back(e);
    return out;
}

// The newest live record of that plug-in; fails the test when missing.
inline ictestprobe::MIRecord mi(std::string const& name)
{
    ictestprobe::MIRecord r;
    EXPECT_TRUE(ictestprobe::findMI(name, &r)) << name;
    return r;
}
inline ictestprobe::FPRecord fp(std::string const& name)
{
    ictestprobe::FPRecord r;
    EXPECT_TRUE(ictestprobe::findFP(name, &r)) << name;
    return r;
}

// Base of the tests that load plug-ins: a fresh temporary tree, the
// environment pointing at it, a clean probe and recorder; the library fully
// unloaded before and after.
class PluginTest : public testing::Test {
protected:
    void SetUp() override
    {
        fullyUnload();
        ictestprobe::reset();
        Recorder::get().reset();
    }
    void TearDown() override
    {
        fullyUnload();
        EXPECT_EQ(IC::InstCtrl::ICloadCount, 0u);
        EXPECT_TRUE(IC::InstCtrl::unloaddone);
    }

    TempTree tree_;
    EnvGuard miEnv_{"IC_MI_DIR", tree_.miDir()};
    EnvGuard fpEnv_{"IC_FP_DIR", tree_.fpDir()};
};

} // namespace ictest
