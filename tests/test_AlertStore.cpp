// Tests of IC::AlertStore (the asserted alerts, one per node path) and of
// its path renderer.
#include <IC/AlertStore.h>

#include "TestSupport.h"

namespace {

using IC::Alert;
using Paths = std::vector<std::string>;
using Messages = std::vector<std::string>;

ictest::Source const kAS{"Helmgard.IC.InstrumentationControl.AlertStore", "AlertStore"};
constexpr unsigned int kFP = 0; // batch of a functional plug-in
constexpr unsigned int kMI = 1; // batch of a management interface

Alert alert(Paths paths, unsigned int status, std::string message = "m", unsigned char sev = 2,
            unsigned int c = 7)
{
    return Alert(sev, static_cast<Alert::ClassType>(c), std::move(paths), status, std::move(message));
}

void expectSameAlert(Alert const& got, Alert const& want)
{
    EXPECT_EQ(static_cast<std::string>(got), static_cast<std::string>(want));
    EXPECT_EQ(got.getTimeStamp(), want.getTimeStamp());
}

class AlertStoreTest : public testing::Test {
protected:
    std::vector<Alert> asserted()
    {
        std::vector<Alert> out;
        ictest::expectError(store.getAsserted(out), 0);
        return out;
    }
    Messages messages()
    {
        Messages out;
        for (auto const& a : asserted())
            out.push_back(a.getMessage());
        return out;
    }

    IC::AlertStore store;
    std::string const A = std::string("\x1f\x50", 2);
    std::string const B = std::string("\x2f\x51", 2);
    std::string const C = std::string("\x2f\x52", 2);
};

TEST_F(AlertStoreTest, AbnormalStatusesAreStoredAsGivenAndTheNewestPerPathWins)
{
    Alert const a = alert({A}, 2, "hot", 5, 9);
    ictest::expectError(store.newAlerts({a}, kFP), 0);
    auto const out = asserted();
    ASSERT_EQ(out.size(), 1u);
    expectSameAlert(out[0], a);
    // Every status but 1 asserts; a later alert of a path replaces the
    // earlier, within one batch too.
    store.newAlerts({alert({A}, 0, "zero"), alert({B}, 4294967295u, "max"),
                     alert({C}, 2, "c1"), alert({C}, 3, "c2")},
                    kFP);
    EXPECT_EQ(messages(), (Messages{"zero", "max", "c2"}));
    EXPECT_EQ(asserted()[2].getStatus(), 3u);
}

TEST_F(AlertStoreTest, NormalStatusClearsOnlyItsPathsInBatchOrder)
{
    Alert const both = alert({A, B}, 2, "both");
    store.newAlerts({both}, kFP);
    ictest::LogCapture cap;
    store.newAlerts({alert({A}, 1, "cleared"), alert({C}, 1, "unknown path")}, kFP);
    EXPECT_TRUE(cap.records().empty()) << "clearing logs nothing";
    auto const out = asserted();
    ASSERT_EQ(out.size(), 1u);
    expectSameAlert(out[0], both); // still carrying both paths

    store.newAlerts({alert({A}, 2, "a"), alert({A}, 1)}, kFP);
    store.newAlerts({alert({C}, 1), alert({C}, 2, "c")}, kFP);
    EXPECT_EQ(messages(), (Messages{"both", "c"}));
    store.newAlerts({alert({}, 2), alert({}, 1)}, kFP);
    EXPECT_EQ(messages(), (Messages{"both", "c"})) << "an alert without paths changes nothing";
    EXPECT_EQ(cap.logs(kAS.logger).size(), 2u);
}

TEST_F(AlertStoreTest, ManagementBatchesLeaveItAloneAndClearEmptiesIt)
{
    store.newAlerts({alert({A}, 2, "kept")}, kFP);
    ictest::LogCapture cap;
    ictest::expectError(store.newAlerts({alert({A}, 1), alert({B}, 0), alert({C}, 2)}, kMI), 0);
    EXPECT_EQ(messages(), Messages{"kept"});
    EXPECT_TRUE(cap.records().empty()) << "an ignored batch logs nothing";
    store.newAlerts({alert({B, C}, 2)}, kFP);
    store.clear();
    EXPECT_TRUE(asserted().empty());
    store.newAlerts({alert({A}, 2, "after")}, kFP);
    EXPECT_EQ(messages(), Messages{"after"});
}

TEST_F(AlertStoreTest, ListingReplacesTheVectorInUnsignedByteOrderOfPaths)
{
    std::vector<Alert> out{alert({A}, 2), alert({B}, 2)};
    ictest::expectError(store.getAsserted(out), 0);
    EXPECT_TRUE(out.empty());

    std::string const high("\x90\x01", 2); // above 0x7f: unsigned byte order
    std::string const low("\x10\xff", 2);
    std::string const prefix("\x10", 1); // a prefix sorts first
    Alert const both = alert({high, A}, 2, "both");
    store.newAlerts({both}, kFP);
    store.newAlerts({alert({low}, 2, "low")}, kFP);
    store.newAlerts({alert({prefix}, 2, "prefix")}, kFP);
    out = {alert({C}, 2, "stale")};
    store.getAsserted(out);
    ASSERT_EQ(out.size(), 4u);
    EXPECT_EQ(out[0].getMessage(), "prefix");
    EXPECT_EQ(out[1].getMessage(), "low");
    // An alert under two paths is listed under each, with both its paths.
    expectSameAlert(out[2], both);
    expectSameAlert(out[3], both);
}

TEST_F(AlertStoreTest, EachAssertedPathLogsOneWarningOnBothChannels)
{
    ictest::LogCapture cap;
    store.newAlerts({alert({A, B}, 0), alert({C}, 4294967295u), alert({A}, 1)}, kFP);
    Messages const want = {"newAlerts: Abnormal Status 0path =" + ictest::hex(A),
                           "newAlerts: Abnormal Status 0path =" + ictest::hex(B),
                           "newAlerts: Abnormal Status 4294967295path =" + ictest::hex(C)};
    EXPECT_EQ(cap.messages(), want);
    for (auto const& m : want)
        ictest::expectEvent(cap, kAS, m, 4000, "newAlerts");
    EXPECT_EQ(cap.records().size(), 6u);
}

TEST(AlertStoreHexstring, TwoLowerCaseDigitsPerByte)
{
    EXPECT_EQ(IC::ALERT_STORE::hexstring(""), "");
    EXPECT_EQ(IC::ALERT_STORE::hexstring(std::string("\x00", 1)), "00");
    EXPECT_EQ(IC::ALERT_STORE::hexstring(std::string("\x1f\x5c\xab\x0f\xff\x80", 6)), "1f5cab0fff80");
    EXPECT_EQ(IC::ALERT_STORE::hexstring("AZ"), "415a");
}

} // namespace
