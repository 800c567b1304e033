// What the test plug-in (TestPlugin.cpp) and the programs that load it share.
// A program that includes this header (once) exports the harness: the
// plug-in finds it with dlsym, records in it what the loader gave it, leaves
// its nodes to it (the node store keeps plain pointers that outlive a
// plug-in) and logs each call it receives on logger "ictest.plugin" as
// "<name>:<call>". Without the harness (icctl, the health tests) the plug-in
// works alone and removes its nodes when released.
#pragma once

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ICforFP.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>

#include <atomic>
#include <optional>
#include <string>
#include <vector>

namespace ictest {

enum Mode {
    MODE_GOOD, MODE_SLOW, MODE_NO_ENTRY, MODE_CODE, MODE_NULL_ERROR, MODE_ERROR_STATUS, MODE_NULL_OBJECT,
    MODE_INIT_FAILS, MODE_REG_FAILS, MODE_GETMAP_FAILS, MODE_GETMAP_THROWS, MODE_THROW_INIT,
    MODE_THROW_INT, // throws an int from its entry point
    MODE_ANNOUNCE,    // announces its nodes through MapNewFPNode
    MODE_ACTIVE,      // announces, registers for its own supply, asserts an alert on it
    MODE_RELAY,       // re-raises what interfaces raise on CPUs and fans, through the harness
    MODE_UPDATE_FAILS
};

// One plug-in object's record.
struct Seen {
    std::string name;
    void* object = nullptr;
    unsigned int base = 0;
    IC::NodeArrivalCallBack arrival = nullptr;
    void const* arrivalContext = nullptr;
    IC::NodeLookupCallBack lookup = nullptr;
    IC::AlertCallBack alert = nullptr;
    void const* alertContext = nullptr;
    std::optional<IC::ICforFP> services;
    std::vector<IC::Node*> nodes; // as Initialize made them
    std::vector<IC::ManagementInterface*> added, removed;
    std::atomic<bool> released{false};
    std::atomic<unsigned long> received{0}; // alerts its own registrations took
};

} // namespace ictest

#ifndef TP_NAME
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>
#include <IC/LoadControl.h>
#include <SD/PlatformUtilities.h>

#include <TestSupport.h>

#include <deque>

namespace ictest {

namespace fs = std::filesystem;

inline std::string const kLogIC = "Helmgard.IC.InstrumentationControl";
inline std::string const kLogMI = kLogIC + ".MIControl";
inline std::string const kLogFP = kLogIC + ".FPControl";
inline std::string const kLogLT = kLogIC + ".LoaderThread";
inline std::string const kLogPlugin = "ictest.plugin";

struct Harness {
    std::mutex m;
    std::deque<Seen> seen;
    std::vector<std::unique_ptr<IC::Node>> kept;
    static Harness& get()
    {
        static Harness* h = new Harness; // plug-ins may report from their static destructors
        return *h;
    }
};

// The newest record of that name; fails the test when there is none.
inline Seen& seen(std::string const& name)
{
    Harness& h = Harness::get();
    std::lock_guard<std::mutex> g(h.m);
    for (auto it = h.seen.rbegin(); it != h.seen.rend(); ++it)
        if (it->name == name)
            return *it;
    ADD_FAILURE() << "no plug-in " << name;
    static Seen none;
    return none;
}
// Forgets records and nodes: only when no library is open.
inline void forgetPlugins()
{
    std::lock_guard<std::mutex> g(Harness::get().m);
    Harness::get().seen.clear();
    Harness::get().kept.clear();
}

// What the plug-ins logged about their calls, in order; those of one name
// when given.
inline std::vector<std::string> calls(LogCapture const& cap, std::string const& name = std::string())
{
    std::vector<std::string> out;
    for (auto const& m : cap.messages(kLogPlugin))
        if (m.compare(0, name.size() + 1, name + ":") == 0 || name.empty())
            out.push_back(m);
    return out;
}

// How many of the calls are call.
inline std::size_t count(std::vector<std::string> const& calls, std::string const& call)
{
    return static_cast<std::size_t>(std::count(calls.begin(), calls.end(), call));
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

// A temporary tree with an "mi" and an "fp" directory, into which the
// built plug-ins are copied.
class TempTree : public TempDir {
public:
    TempTree() : TempDir("ictest-plugins")
    {
        fs::create_directory(miDir());
        fs::create_directory(fpDir());
    }
    std::string miDir() const { return path("mi"); }
    std::string fpDir() const { return path("fp"); }
    // The copy appears at once under its final name: a scan never meets a
    // partial library.
    std::string install(std::string const& dir, std::string const& module, std::string as = std::string()) const
    {
        std::string const target = dir + "/" + (as.empty() ? module + ".so" : as), partial = target + ".partial";
        fs::copy_file(std::string(IC_TEST_MODULE_DIR) + "/" + module + ".so", partial);
        fs::rename(partial, target);
        return target;
    }
    std::string addMI(std::string const& m, std::string const& as = std::string()) const { return install(miDir(), m, as); }
    std::string addFP(std::string const& m, std::string const& as = std::string()) const { return install(fpDir(), m, as); }
};

// The libraries of dir as discovery finds them, but those named in skip.
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

inline void fullyUnload()
{
    for (int i = 0; i < 64 && (IC::InstCtrl::ICloadCount != 0 || !IC::InstCtrl::unloaddone); ++i)
        Unloadlib();
}

// A fresh plug-in tree that the environment points at; the library fully
// unloaded before and after, and nothing of the tree left mapped.
class PluginTest : public testing::Test {
protected:
    void SetUp() override { fullyUnload(); }
    void TearDown() override
    {
        fullyUnload();
        EXPECT_FALSE(isMapped(tree_.root())) << "a plug-in library stayed open";
    }
    TempTree tree_;
    EnvGuard miEnv_{"IC_MI_DIR", tree_.miDir()};
    EnvGuard fpEnv_{"IC_FP_DIR", tree_.fpDir()};
};

} // namespace ictest

#define ICTEST_EXPORT extern "C" __attribute__((visibility("default")))

ICTEST_EXPORT ictest::Seen* ictest_seen(char const* name, void* object)
{
    ictest::Harness& h = ictest::Harness::get();
    std::lock_guard<std::mutex> g(h.m);
    h.seen.emplace_back();
    h.seen.back().name = name;
    h.seen.back().object = object;
    return &h.seen.back();
}

ICTEST_EXPORT void ictest_keep(IC::Node* node)
{
    std::lock_guard<std::mutex> g(ictest::Harness::get().m);
    ictest::Harness::get().kept.emplace_back(node);
}

// The relay's callback lives here, not in the plug-in: a dispatch still
// under way when the plug-in's library goes must not jump into unmapped
// code. Alerts already relayed are not relayed again.
ICTEST_EXPORT IC::Error ictest_relay(std::vector<IC::Alert> const& alerts, void const* context)
{
    auto& s = *static_cast<ictest::Seen*>(const_cast<void*>(context));
    std::vector<IC::Alert> out;
    for (auto const& a : alerts)
        if (a.getMessage().rfind("relayed ", 0) != 0)
            out.emplace_back(a.getSeverity(), a.getClass(), a.getNodePaths(), a.getStatus(), "relayed " + a.getMessage());
    s.received += out.size();
    if (out.empty() || s.released)
        return IC::Error(0, IC::Number(IC::Number::Generic), "");
    return s.services->getAlertCallBackFP()(out);
}
#endif
