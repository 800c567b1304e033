// Tests of IC::AlertStore (the asserted alerts, one per node path) and of
// its path renderer.
#include <IC/AlertStore.h>

#include "TestSupport.h"

namespace {

using IC::Alert;
using Strings = std::vector<std::string>;

constexpr unsigned int kFP = 0; // batch of a functional plug-in
constexpr unsigned int kMI = 1; // batch of a management interface

Alert alert(Strings paths, unsigned int status, std::string message = "m")
{
    return Alert(2, static_cast<Alert::ClassType>(7), std::move(paths), status, std::move(message));
}

// The messages of the stored alerts; the vector given is replaced.
Strings messages(IC::AlertStore& store)
{
    std::vector<Alert> out{alert({"x"}, 2, "stale")};
    ictest::expectError(store.getAsserted(out), 0);
    Strings m;
    for (auto const& a : out)
        m.push_back(a.getMessage());
    return m;
}

TEST(AlertStore, EveryStatusButOneAssertsTheLatestPerPathWinsAndOneClearsOnlyItsPaths)
{
    IC::AlertStore store;
    std::string const A{"\x1f\x50"}, B{"\x2f\x51"}, C{"\x2f\x52"};
    Alert const hot(5, static_cast<Alert::ClassType>(9), {A}, 0, "hot");
    ictest::expectError(store.newAlerts({hot, alert({B}, 4294967295u, "max"), alert({C}, 2), alert({C}, 3, "c")}, kFP),
                        0);
    std::vector<Alert> out;
    store.getAsserted(out);
    ASSERT_EQ(ictest::sigs(out), (Strings{ictest::sig(hot), "2/7/4294967295/max/2f51,", "2/7/3/c/2f52,"}));
    EXPECT_EQ(out[0].getTimeStamp(), hot.getTimeStamp());
    store.newAlerts({alert({A, B}, 1), alert({C}, 1), alert({C}, 2, "again"), alert({"\x2f\x53"}, 1)}, kFP);
    EXPECT_EQ(messages(store), Strings{"again"});
    ictest::LogCapture cap;
    ictest::expectError(store.newAlerts({alert({C}, 1), alert({A}, 0)}, kMI), 0);
    EXPECT_TRUE(messages(store) == Strings{"again"} && cap.records().empty()) << "management batches are ignored";
    store.clear();
    EXPECT_TRUE(messages(store).empty());
}

TEST(AlertStore, ListedByUnsignedPathBytesOncePerPathEachAssertedPathLoggedAsAWarning)
{
    IC::AlertStore store;
    Alert const both = alert({"\x90\x01", "\x1f\x50"}, 0, "both");
    ictest::LogCapture cap;
    store.newAlerts({both, alert({"\x10\xff"}, 2, "low"), alert({"\x10"}, 4294967295u, "prefix")}, kFP);
    std::vector<Alert> out;
    store.getAsserted(out);
    ASSERT_EQ(messages(store), (Strings{"prefix", "low", "both", "both"}));
    EXPECT_EQ(ictest::sig(out[2]) + ictest::sig(out[3]), ictest::sig(both) + ictest::sig(both));
    std::string const head = "newAlerts: Abnormal Status ";
    EXPECT_EQ(cap.messages(),
              (Strings{head + "0path =9001", head + "0path =1f50", head + "2path =10ff", head + "4294967295path =10"}));
    ictest::expectEvent(cap, {"Helmgard.IC.InstrumentationControl.AlertStore", "AlertStore"}, head + "0path =1f50",
                        4000, "newAlerts");
    EXPECT_EQ(IC::ALERT_STORE::hexstring(std::string("\x00\x1f\xab\xff", 4)) + IC::ALERT_STORE::hexstring(""),
              "001fabff");
}

} // namespace
