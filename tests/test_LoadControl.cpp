// Plug-in discovery (IC::LoadControl::findLibs) against real libraries in a
// temporary directory, and the ordering of discovered records.
#include <IC/FPControl.h>
#include <IC/LoadControl.h>
#include <IC/MIControl.h>
#include <SD/DirectoryReader.h>
#include <SD/PlatformUtilities.h>

#include "PluginTest.h"

#include <gtest/gtest.h>

#include <fstream>
#include <set>
#include <string>
#include <vector>

#include <sys/stat.h>
#include <unistd.h>

namespace {

using ictest::countLog;
using ictest::kLogLC;
using ictest::ptrText;

std::string const kLooking = "findLibs: Looking for directory ";
std::string const kOpened = "findLibs: Opened Lib Opened with filehandle ";

void closeAll(std::vector<IC::libstruct>& libs)
{
    for (auto& r : libs)
        SD::PlatformUtilities::unloadLibrary(r.handle);
    libs.clear();
}

class FindLibs : public testing::Test {
protected:
    void SetUp() override { ictestprobe::reset(); }
    void TearDown() override { closeAll(libs_); }

    std::string dir() const { return tree_.miDir(); }

    ictest::TempTree tree_;
    std::vector<IC::libstruct> libs_;
};

TEST_F(FindLibs, RecordsEveryLibraryThatOpensInTheDirectorysOrder)
{
    tree_.install(dir(), "mi_alpha", "b.so");
    tree_.install(dir(), "mi_beta", "a.so");
    tree_.install(dir(), "fp_one", "c.so");
    { std::ofstream(dir() + "/readme.txt") << "not a plug-in"; }

    std::set<std::string> names{"kept"};
    ictest::LogCapture cap;
    IC::Error const e = IC::LoadControl().findLibs(dir(), libs_, names);

    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getCode(), IC::Number(IC::Number::Generic));
    EXPECT_EQ(e.getText(), "");
    EXPECT_EQ(names, (std::set<std::string>{"kept"}));

    // Discovery keeps the reader's order; it does not sort by itself.
    SD::DirectoryReader reader(dir().c_str(), ".so");
    ASSERT_EQ(reader.getNumberOfFiles(), 3);
    ASSERT_EQ(libs_.size(), 3u);
    for (int i = 0; i < 3; ++i) {
        std::string const path = reader.getFileName(i);
        IC::libstruct const& r = libs_[static_cast<std::size_t>(i)];
        EXPECT_NE(r.handle, nullptr);
        EXPECT_EQ(r.path, path);
        EXPECT_EQ(r.name, path.substr(dir().size() + 1));
        EXPECT_EQ(r.plugin, nullptr);
        EXPECT_EQ(r.idbase, 0u);
        EXPECT_EQ(countLog(cap, kLogLC, 3000, kOpened + ptrText(r.handle) + " for file " + path), 1u)
            << path;
    }
    EXPECT_EQ(libs_[0].name, "a.so");
    EXPECT_EQ(libs_[1].name, "b.so");
    EXPECT_EQ(libs_[2].name, "c.so");

    // Opened, not only listed: the images are mapped and their static
    // initialisation ran.
    EXPECT_EQ(ictestprobe::liveImages(), 3);
    EXPECT_TRUE(ictest::isMapped(dir() + "/a.so"));

    auto const logs = ictest::logsOf(cap, kLogLC);
    ASSERT_EQ(logs.size(), 4u);
    EXPECT_EQ(logs[0].message, kLooking + dir());
    EXPECT_EQ(logs[0].level, 3000);
    for (auto const& r : logs) {
        EXPECT_EQ(r.function, "findLibs");
        EXPECT_EQ(r.file, "LoadControl");
    }
    // Each event went to both channels.
    std::size_t trace = 0;
    for (auto const& r : cap.records())
        if (r.channel == HGLog::Channel::Trace && r.logger == kLogLC)
            ++trace;
    EXPECT_EQ(trace, 4u);
}

TEST_F(FindLibs, AppendsWithoutTouchingWhatTheListHeld)
{
    tree_.install(dir(), "mi_alpha");
    IC::libstruct earlier;
    earlier.path = "/elsewhere/earlier.so";
    earlier.name = "earlier.so";
    earlier.idbase = 0x50000;
    std::vector<IC::libstruct> libs{earlier};
    std::set<std::string> names;
    EXPECT_EQ(IC::LoadControl().findLibs(dir(), libs, names).getStatus(), 0);
    ASSERT_EQ(libs.size(), 2u);
    EXPECT_EQ(libs[0].name, "earlier.so");
    EXPECT_EQ(libs[0].idbase, 0x50000u);
    EXPECT_EQ(libs[0].handle, nullptr);
    EXPECT_EQ(libs[1].name, "mi_alpha.so");
    libs_.push_back(libs[1]);
}

TEST_F(FindLibs, AFileThatDoesNotOpenIsLoggedWithANullHandleAndLeftOut)
{
    std::string const text = dir() + "/broken.so";
    { std::ofstream(text) << "this is not an ELF file"; }
    std::string const subdir = dir() + "/directory.so";
    ASSERT_EQ(mkdir(subdir.c_str(), 0700), 0);
    std::string const dangling = dir() + "/dangling.so";
    ASSERT_EQ(symlink((dir() + "/nowhere").c_str(), dangling.c_str()), 0);
    std::string const good = tree_.install(dir(), "mi_alpha", "good.so");
    std::string const link = dir() + "/link.so";
    ASSERT_EQ(symlink(good.c_str(), link.c_str()), 0);

    std::set<std::string> names;
    ictest::LogCapture cap;
    EXPECT_EQ(IC::LoadControl().findLibs(dir(), libs_, names).getStatus(), 0);

    std::string const null = ptrText(nullptr);
    for (auto const& p : {text, subdir, dangling})
        EXPECT_EQ(countLog(cap, kLogLC, 3000, kOpened + null + " for file " + p), 1u) << p;
    // A link to a library is a library.
    ASSERT_EQ(libs_.size(), 2u);
    EXPECT_EQ(libs_[0].name, "good.so");
    EXPECT_EQ(libs_[1].name, "link.so");
    EXPECT_EQ(libs_[1].path, link);
    for (auto const& r : libs_)
        EXPECT_NE(r.handle, nullptr);
    // One line per file, nothing more: the failures are not errors of
    // discovery.
    EXPECT_EQ(ictest::logsOf(cap, kLogLC).size(), 6u);
}

TEST_F(FindLibs, AMissingDirectoryGivesNoRecordsAndSuccess)
{
    std::string const missing = tree_.root() + "/no-such-directory";
    std::set<std::string> names;
    ictest::LogCapture cap;
    IC::Error const e = IC::LoadControl().findLibs(missing, libs_, names);
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getText(), "");
    EXPECT_TRUE(libs_.empty());
    auto const logs = ictest::logsOf(cap, kLogLC);
    ASSERT_EQ(logs.size(), 1u);
    EXPECT_EQ(logs[0].message, kLooking + missing);
}

TEST_F(FindLibs, ADirectoryWithoutLibrariesGivesNoRecords)
{
    { std::ofstream(dir() + "/notes.txt") << "x"; }
    { std::ofstream(dir() + "/lib.so.1") << "x"; }
    std::set<std::string> names;
    EXPECT_EQ(IC::LoadControl().findLibs(dir(), libs_, names).getStatus(), 0);
    EXPECT_TRUE(libs_.empty());
}

TEST_F(FindLibs, ADirectoryGivenWithATrailingSeparatorStillYieldsBareNames)
{
    tree_.install(dir(), "mi_alpha", "x.so");
    std::set<std::string> names;
    EXPECT_EQ(IC::LoadControl().findLibs(dir() + "/", libs_, names).getStatus(), 0);
    ASSERT_EQ(libs_.size(), 1u);
    EXPECT_EQ(libs_[0].name, "x.so");
    EXPECT_EQ(libs_[0].path.substr(libs_[0].path.size() - 5), "/x.so");
}

TEST_F(FindLibs, EveryScanOpensTheLibraryAgain)
{
    tree_.install(dir(), "mi_alpha");
    std::set<std::string> names;
    IC::LoadControl lc;
    lc.findLibs(dir(), libs_, names);
    lc.findLibs(dir(), libs_, names);
    ASSERT_EQ(libs_.size(), 2u);
    EXPECT_NE(libs_[0].handle, libs_[1].handle);
    EXPECT_EQ(libs_[0].name, libs_[1].name);
    EXPECT_EQ(ictestprobe::liveImages(), 1);

    // One image, two references: it goes with the second close only.
    SD::PlatformUtilities::unloadLibrary(libs_[0].handle);
    EXPECT_TRUE(ictest::isMapped(dir() + "/mi_alpha.so"));
    SD::PlatformUtilities::unloadLibrary(libs_[1].handle);
    libs_.clear();
    EXPECT_FALSE(ictest::isMapped(dir() + "/mi_alpha.so"));
    EXPECT_EQ(ictestprobe::liveImages(), 0);
}

// ---- ordering ----

IC::libstruct rec(std::string const& name, std::string const& path = std::string())
{
    IC::libstruct r;
    r.name = name;
    r.path = path.empty() ? "/d/" + name : path;
    return r;
}

using Less = bool (*)(IC::libstruct, IC::libstruct);

class LibOrder : public testing::TestWithParam<Less> {};

TEST_P(LibOrder, ComparesBareNamesByteWise)
{
    Less const lt = GetParam();
    // First differing byte decides: '.' (0x2E) is less than 'b' (0x62).
    EXPECT_TRUE(lt(rec("a.so"), rec("ab.so")));
    EXPECT_FALSE(lt(rec("ab.so"), rec("a.so")));
    // A byte-wise prefix comes first.
    EXPECT_TRUE(lt(rec("ab"), rec("ab.so")));
    EXPECT_FALSE(lt(rec("ab.so"), rec("ab")));
    // Irreflexive.
    EXPECT_FALSE(lt(rec("same.so"), rec("same.so")));
    EXPECT_FALSE(lt(rec(""), rec("")));
    EXPECT_TRUE(lt(rec(""), rec("a")));
    // Unsigned bytes: above 0x7F sorts after every ASCII name.
    EXPECT_TRUE(lt(rec("z.so"), rec("\xc3\xa9.so")));
    EXPECT_FALSE(lt(rec("\xc3\xa9.so"), rec("z.so")));
    EXPECT_TRUE(lt(rec("\x7f"), rec("\x80")));
    EXPECT_TRUE(lt(rec("Z"), rec("a")));
    // Only the name counts, not the path.
    EXPECT_TRUE(lt(rec("a.so", "/zzz/a.so"), rec("b.so", "/aaa/b.so")));
    EXPECT_FALSE(lt(rec("b.so", "/aaa/b.so"), rec("a.so", "/zzz/a.so")));
    EXPECT_FALSE(lt(rec("a.so", "/one/a.so"), rec("a.so", "/two/a.so")));
}

TEST_P(LibOrder, SortsALoadListByName)
{
    std::vector<IC::libstruct> v{rec("mi_b.so"), rec("\xe2\x82\xac.so"), rec("mi_a.so"),
                                 rec("MI.so"), rec("mi_a"), rec("mi_ab.so")};
    std::sort(v.begin(), v.end(), GetParam());
    std::vector<std::string> names;
    for (auto const& r : v)
        names.push_back(r.name);
    EXPECT_EQ(names, (std::vector<std::string>{"MI.so", "mi_a", "mi_a.so", "mi_ab.so", "mi_b.so",
                                               "\xe2\x82\xac.so"}));
}

INSTANTIATE_TEST_SUITE_P(BothLoaders, LibOrder,
                         testing::Values(&IC::MI_CONTROL::libLT, &IC::FP_CONTROL::libLT));

} // namespace
