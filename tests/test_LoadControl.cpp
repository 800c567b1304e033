// Plug-in discovery (IC::LoadControl::findLibs) against real libraries in a
// temporary directory, and the ordering of discovered records.
#include <IC/FPControl.h>
#include <IC/LoadControl.h>
#include <IC/MIControl.h>
#include <SD/PlatformUtilities.h>

#include "PluginTest.h"

#include <sys/stat.h>
#include <unistd.h>

namespace {

std::string const kLooking = "findLibs: Looking for directory ";
std::string const kOpened = "findLibs: Opened Lib Opened with filehandle ";

// Records follow those already there, in the directory's name order; what
// does not open is logged with a null handle and left out. Every scan opens
// the libraries again, and a separator after the directory changes only the
// paths.
TEST(FindLibs, OpensEveryLibraryOfTheDirectoryInNameOrder)
{
    ictestprobe::reset();
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
    EXPECT_EQ(names, std::set<std::string>{"kept"}) << "names is not used";
    ASSERT_EQ(libs.size(), 7u);
    EXPECT_EQ(libs[0].name, "earlier.so");
    for (std::size_t i = 1; i < libs.size(); ++i) {
        std::string const name = std::string(1, "ace"[(i - 1) % 3]) + ".so";
        EXPECT_EQ(libs[i].name, name);
        EXPECT_EQ(libs[i].path, dir + (i > 3 ? "//" : "/") + name);
        EXPECT_TRUE(libs[i].handle != nullptr && libs[i].plugin == nullptr && libs[i].idbase == 0u);
    }
    auto const opened = [&](std::string const& file, std::size_t i) {
        return kOpened + ictest::ptrText(i == 0 ? nullptr : libs[i].handle) + " for file " + dir + file;
    };
    std::vector<std::string> const want{kLooking + dir,      opened("/a.so", 1),  opened("/b.so", 0),
                                        opened("/c.so", 2),  opened("/d.so", 0),  opened("/e.so", 3),
                                        kLooking + dir + "/", opened("//a.so", 4), opened("//b.so", 0),
                                        opened("//c.so", 5), opened("//d.so", 0), opened("//e.so", 6)};
    EXPECT_EQ(cap.messages(ictest::kLogLC), want);
    for (auto const& m : {want[0], want[1]})
        ictest::expectEvent(cap, {ictest::kLogLC, "LoadControl"}, m, 3000, "findLibs");
    // Opened, not only listed; c.so and its link share one image.
    EXPECT_EQ(ictestprobe::liveImages(), 2);
    for (auto& r : libs)
        SD::PlatformUtilities::unloadLibrary(r.handle);
    EXPECT_EQ(ictestprobe::liveImages(), 0);
    cap.clear();
    libs.clear();
    ictest::expectError(IC::LoadControl().findLibs(tree.path("none"), libs, names), 0);
    EXPECT_TRUE(libs.empty());
    EXPECT_EQ(cap.messages(ictest::kLogLC), std::vector<std::string>{kLooking + tree.path("none")});
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
        std::vector<IC::libstruct> v{rec("mi_b.so", "/a/mi_b.so"), rec("\xe2\x82\xac.so", "/e"), rec("mi_a.so", "/z"),
                                     rec("MI.so", "/m"), rec("mi_a", "/n"), rec("mi_ab.so", "/o"), rec("\x7f", "/p")};
        std::sort(v.begin(), v.end(), lt);
        std::string names;
        for (auto const& r : v)
            names += r.name + " ";
        EXPECT_EQ(names, "MI.so mi_a mi_a.so mi_ab.so mi_b.so \x7f \xe2\x82\xac.so ");
        EXPECT_FALSE(lt(rec("same.so", "/one"), rec("same.so", "/two")));
    }
}

} // namespace
