// Plug-in discovery (IC::LoadControl::findLibs) against real libraries in a
// temporary directory, and the ordering of discovered records.
#include <IC/FPControl.h>
#include <IC/LoadControl.h>
#include <IC/MIControl.h>
#include <SD/DirectoryReader.h>
#include <SD/PlatformUtilities.h>

#include "PluginTest.h"

#include <sys/stat.h>
#include <unistd.h>

namespace {

using ictest::kLogLC;
using ictest::ptrText;

std::string const kLooking = "findLibs: Looking for directory ";
std::string const kOpened = "findLibs: Opened Lib Opened with filehandle ";

class FindLibs : public testing::Test {
protected:
    void SetUp() override { ictestprobe::reset(); }
    void TearDown() override
    {
        for (auto& r : libs_)
            SD::PlatformUtilities::unloadLibrary(r.handle);
    }
    IC::Error find(std::string const& dir)
    {
        std::set<std::string> names{"kept"};
        IC::Error const e = IC::LoadControl().findLibs(dir, libs_, names);
        EXPECT_EQ(names, std::set<std::string>{"kept"}) << "names is not used";
        return e;
    }

    ictest::TempTree tree_;
    std::string const dir_ = tree_.miDir();
    std::vector<IC::libstruct> libs_;
};

TEST_F(FindLibs, AppendsARecordForEveryLibraryThatOpensInTheDirectorysOrder)
{
    tree_.install(dir_, "mi_alpha", "b.so");
    tree_.install(dir_, "mi_beta", "a.so");
    tree_.install(dir_, "fp_one", "c.so");
    tree_.write("mi/readme.txt", "not a plug-in");
    tree_.write("mi/lib.so.1", "x");
    IC::libstruct earlier;
    earlier.path = "/elsewhere/earlier.so";
    earlier.name = "earlier.so";
    earlier.idbase = 0x50000;
    libs_.push_back(earlier);

    ictest::LogCapture cap;
    ictest::expectError(find(dir_), 0);
    ASSERT_EQ(libs_.size(), 4u);
    EXPECT_EQ(libs_[0].name, "earlier.so");
    EXPECT_EQ(libs_[0].idbase, 0x50000u);
    EXPECT_EQ(libs_[0].handle, nullptr);
    // Discovery keeps the reader's order; it does not sort by itself.
    SD::DirectoryReader reader(dir_.c_str(), ".so");
    ASSERT_EQ(reader.getNumberOfFiles(), 3);
    std::vector<std::string> want{kLooking + dir_};
    for (int i = 0; i < 3; ++i) {
        std::string const path = reader.getFileName(i);
        IC::libstruct const& r = libs_[static_cast<std::size_t>(i) + 1];
        EXPECT_NE(r.handle, nullptr);
        EXPECT_EQ(r.path, path);
        EXPECT_EQ(r.name, std::string(1, static_cast<char>('a' + i)) + ".so");
        EXPECT_EQ(r.plugin, nullptr);
        EXPECT_EQ(r.idbase, 0u);
        want.push_back(kOpened + ptrText(r.handle) + " for file " + path);
    }
    // Opened, not only listed: the images are mapped and their static
    // initialisation ran.
    EXPECT_EQ(ictestprobe::liveImages(), 3);
    EXPECT_TRUE(ictest::isMapped(dir_ + "/a.so"));
    EXPECT_EQ(cap.messages(kLogLC), want);
    for (auto const& m : want)
        ictest::expectEvent(cap, {kLogLC, "LoadControl"}, m, 3000, "findLibs");
}

TEST_F(FindLibs, AFileThatDoesNotOpenIsLoggedWithANullHandleAndLeftOut)
{
    std::string const text = tree_.write("mi/broken.so", "this is not an ELF file");
    std::string const subdir = dir_ + "/directory.so";
    ASSERT_EQ(mkdir(subdir.c_str(), 0700), 0);
    std::string const dangling = dir_ + "/dangling.so", link = dir_ + "/link.so";
    ASSERT_EQ(symlink((dir_ + "/nowhere").c_str(), dangling.c_str()), 0);
    std::string const good = tree_.install(dir_, "mi_alpha", "good.so");
    ASSERT_EQ(symlink(good.c_str(), link.c_str()), 0);

    ictest::LogCapture cap;
    ictest::expectError(find(dir_), 0);
    for (auto const& p : {text, subdir, dangling})
        EXPECT_EQ(cap.count(kLogLC, 3000, kOpened + ptrText(nullptr) + " for file " + p), 1u) << p;
    // A link to a library is a library.
    ASSERT_EQ(libs_.size(), 2u);
    EXPECT_EQ(libs_[0].name, "good.so");
    EXPECT_EQ(libs_[1].name, "link.so");
    EXPECT_EQ(libs_[1].path, link);
    EXPECT_NE(libs_[1].handle, nullptr);
    // One line per file, nothing more: the failures are not errors of
    // discovery.
    EXPECT_EQ(cap.logs(kLogLC).size(), 6u);
}

TEST_F(FindLibs, AMissingDirectoryGivesNoRecordsAndSuccess)
{
    std::string const missing = tree_.path("no-such-directory");
    ictest::LogCapture cap;
    ictest::expectError(find(missing), 0);
    EXPECT_TRUE(libs_.empty());
    EXPECT_EQ(cap.messages(kLogLC), std::vector<std::string>{kLooking + missing});
}

TEST_F(FindLibs, EveryScanOpensTheLibraryAgainAndATrailingSeparatorChangesNothing)
{
    tree_.install(dir_, "mi_alpha");
    find(dir_);
    find(dir_ + "/");
    ASSERT_EQ(libs_.size(), 2u);
    EXPECT_NE(libs_[0].handle, libs_[1].handle);
    EXPECT_EQ(libs_[1].name, "mi_alpha.so");
    EXPECT_EQ(libs_[1].path, dir_ + "//mi_alpha.so");
    EXPECT_EQ(ictestprobe::liveImages(), 1);
    // One image, two references: it goes with the second close only.
    SD::PlatformUtilities::unloadLibrary(libs_[0].handle);
    EXPECT_TRUE(ictest::isMapped(dir_ + "/mi_alpha.so"));
    SD::PlatformUtilities::unloadLibrary(libs_[1].handle);
    libs_.clear();
    EXPECT_FALSE(ictest::isMapped(dir_ + "/mi_alpha.so"));
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

TEST(LibOrder, BothLoadersCompareBareNamesByteWise)
{
    for (auto lt : {&IC::MI_CONTROL::libLT, &IC::FP_CONTROL::libLT}) {
        // First differing byte decides ('.' is less than 'b'); a prefix comes
        // first; bytes are unsigned; only the name counts, not the path.
        std::pair<IC::libstruct, IC::libstruct> const ordered[] = {
            {rec("a.so"), rec("ab.so")},        {rec("ab"), rec("ab.so")},
            {rec(""), rec("a")},                {rec("z.so"), rec("\xc3\xa9.so")},
            {rec("\x7f"), rec("\x80")},         {rec("Z"), rec("a")},
            {rec("a.so", "/zzz/a.so"), rec("b.so", "/aaa/b.so")}};
        for (auto const& p : ordered) {
            EXPECT_TRUE(lt(p.first, p.second)) << p.first.name << " < " << p.second.name;
            EXPECT_FALSE(lt(p.second, p.first)) << p.second.name << " < " << p.first.name;
        }
        for (auto const& same : {rec("same.so"), rec(""), rec("a.so", "/one/a.so")})
            EXPECT_FALSE(lt(same, rec(same.name, "/two/" + same.name)));

        std::vector<IC::libstruct> v{rec("mi_b.so"), rec("\xe2\x82\xac.so"), rec("mi_a.so"),
                                     rec("MI.so"), rec("mi_a"), rec("mi_ab.so")};
        std::sort(v.begin(), v.end(), lt);
        std::vector<std::string> names;
        for (auto const& r : v)
            names.push_back(r.name);
        EXPECT_EQ(names, (std::vector<std::string>{"MI.so", "mi_a", "mi_a.so", "mi_ab.so",
                                                   "mi_b.so", "\xe2\x82\xac.so"}));
    }
}

} // namespace
