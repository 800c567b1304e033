// Plug-in discovery (IC::LoadControl::findLibs) against real libraries, and
// the order of discovered records.
#include <IC/FPControl.h>
#include <IC/LoadControl.h>
#include <IC/MIControl.h>

#include "PluginHarness.h"

#include <sys/stat.h>
#include <unistd.h>

namespace {

// Records follow those already there, in the directory's name order; what
// does not open is left out. Every scan opens the libraries again, and a
// separator after the directory changes only the paths.
TEST(FindLibs, OpensEveryLibraryOfTheDirectoryInNameOrder)
{
    ictest::TempTree tree;
    std::string const dir = tree.miDir();
    tree.install(dir, "mi_alpha", "c.so");
    tree.install(dir, "mi_beta", "a.so");
    tree.write("mi/b.so", "this is not an ELF file");
    tree.write("mi/readme.txt", "not a plug-in");
    ASSERT_EQ(mkdir((dir + "/d.so").c_str(), 0700) + symlink((dir + "/c.so").c_str(), (dir + "/e.so").c_str()), 0);
    std::vector<IC::libstruct> libs(1);
    libs[0].name = "earlier.so";
    std::set<std::string> names{"kept"};
    ictest::LogCapture cap;
    ictest::expectError(IC::LoadControl().findLibs(dir, libs, names), 0);
    ictest::expectError(IC::LoadControl().findLibs(dir + "/", libs, names), 0);
    EXPECT_EQ(names, std::set<std::string>{"kept"});
    ASSERT_EQ(libs.size(), 7u);
    for (std::size_t i = 1; i < libs.size(); ++i) {
        std::string const name = std::string(1, "ace"[(i - 1) % 3]) + ".so";
        EXPECT_EQ(libs[i].path, dir + (i > 3 ? "//" : "/") + name);
        EXPECT_TRUE(libs[i].name == name && libs[i].handle && !libs[i].plugin && libs[i].idbase == 0u);
    }
    ictest::expectEvent(cap, {ictest::kLogLC, "LoadControl"}, "findLibs: Looking for directory " + dir, 3000,
                        "findLibs");
    EXPECT_EQ(cap.logs(ictest::kLogLC).size(), 12u) << "one line per directory and per file";
    EXPECT_TRUE(ictest::isMapped(dir));
    for (auto& r : libs)
        SD::PlatformUtilities::unloadLibrary(r.handle);
    EXPECT_FALSE(ictest::isMapped(dir));
    libs.clear();
    ictest::expectError(IC::LoadControl().findLibs(tree.path("none"), libs, names), 0);
    EXPECT_TRUE(libs.empty());
}

IC::libstruct rec(std::string const& name, std::string const& path)
{
    IC::libstruct r;
    r.name = name;
    r.path = path;
    return r;
}

// Only the bare name counts, compared byte by byte as unsigned characters,
// a prefix first.
TEST(LibOrder, BothLoadersCompareBareNamesByteWise)
{
    for (auto lt : {&IC::MI_CONTROL::libLT, &IC::FP_CONTROL::libLT}) {
        std::vector<IC::libstruct> v{rec("mi_b.so", "/a"), rec("\xe2\x82\xac.so", "/e"), rec("mi_a.so", "/z"),
                                     rec("MI.so", "/m"), rec("mi_a", "/n"), rec("\x7f", "/p")};
        std::sort(v.begin(), v.end(), lt);
        std::string names;
        for (auto const& r : v)
            names += r.name + " ";
        EXPECT_EQ(names, "MI.so mi_a mi_a.so mi_b.so \x7f \xe2\x82\xac.so ");
        EXPECT_FALSE(lt(rec("same.so", "/one"), rec("same.so", "/two")));
    }
}

} // namespace
