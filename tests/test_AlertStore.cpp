// IC::AlertStore: the asserted alerts, one per node path.
#include <IC/AlertStore.h>

#include "TestSupport.h"

namespace {

using IC::Alert;
using Strings = std::vector<std::string>;

Alert alert(Strings paths, unsigned int status, std::string message = "m")
{
    return Alert(2, static_cast<Alert::ClassType>(7), std::move(paths), status, std::move(message));
}

// The stored alerts as signatures; the vector given is replaced.
Strings stored(IC::AlertStore& store)
{
    std::vector<Alert> out{alert({"x"}, 2, "stale")};
    ictest::expectError(store.getAsserted(out), 0);
    return ictest::sigs(out);
}

// Every status but 1 asserts, the latest per path wins, 1 clears only its
// paths; listed by unsigned path bytes, once per path; management batches
// are ignored. Each asserted path is logged as a warning.
TEST(AlertStore, AssertsClearsAndListsOncePerPath)
{
    IC::AlertStore store;
    std::string const A{"\x1f\x50"}, B{"\x90\x01"}, C{"\x10"};
    Alert const hot(5, static_cast<Alert::ClassType>(9), {A, B}, 0, "hot");
    ictest::LogCapture cap;
    ictest::expectError(store.newAlerts({hot, alert({C}, 4294967295u, "max"), alert({"\x10\xff"}, 2), alert({"\x10\xff"}, 3, "c")}, 0), 0);
    EXPECT_EQ(stored(store), (Strings{"2/7/4294967295/max/10,", "2/7/3/c/10ff,", ictest::sig(hot), ictest::sig(hot)}));
    ictest::expectEvent(cap, {"Helmgard.IC.InstrumentationControl.AlertStore", "AlertStore"},
                        "newAlerts: Abnormal Status 0path =1f50", 4000, "newAlerts");
    std::vector<Alert> out;
    store.getAsserted(out);
    EXPECT_EQ(out.back().getTimeStamp(), hot.getTimeStamp());
    store.newAlerts({alert({A, "\x10\xff"}, 1), alert({C}, 1), alert({C}, 2, "again"), alert({"\x2f\x53"}, 1)}, 0);
    EXPECT_EQ(stored(store), (Strings{"2/7/2/again/10,", ictest::sig(hot)}));
    cap.clear();
    ictest::expectError(store.newAlerts({alert({C}, 1), alert({A}, 0)}, 1), 0);
    EXPECT_EQ(stored(store).size(), 2u);
    EXPECT_TRUE(cap.records().empty()) << "management batches are ignored";
    store.clear();
    EXPECT_TRUE(stored(store).empty());
}

} // namespace
