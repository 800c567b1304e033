// Tests of IC::AlertStore (the asserted alerts, one per node path) and of
// its path renderer.
#include <IC/AlertStore.h>

#include <HGLog/HGLogger.h>
#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/Number.h>

#include <LogCapture.h>

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

using IC::Alert;
using IC::AlertStore;
using Paths = std::vector<std::string>;

std::string const kLogger = "Helmgard.IC.InstrumentationControl.AlertStore";
constexpr unsigned int kFP = 0; // batch of a functional plug-in
constexpr unsigned int kMI = 1; // batch of a management interface

Alert::ClassType cls(unsigned int n) { return static_cast<Alert::ClassType>(n); }

Alert alert(Paths paths, unsigned int status, std::string message = "m", unsigned char sev = 2,
            unsigned int c = 7)
{
    return Alert(sev, cls(c), std::move(paths), status, std::move(message));
}

std::string hex(std::string const& s)
{
    static char const digits[] = "0123456789abcdef";
    std::string out;
    for (unsigned char c : s) {
        out.push_back(digits[c >> 4]);
        out.push_back(digits[c & 15]);
    }
    return out;
}

void expectSuccess(IC::Error const& e)
{
    EXPECT_EQ(e.getStatus(), 0);
    EXPECT_EQ(e.getText(), "");
    EXPECT_EQ(e.getCode(), IC::Number(IC::Number::Generic));
}

void expectSameAlert(Alert const& got, Alert const& want)
{
    EXPECT_EQ(got.getMessage(), want.getMessage());
    EXPECT_EQ(got.getSeverity(), want.getSeverity());
    EXPECT_EQ(got.getClass(), want.getClass());
    EXPECT_EQ(got.getStatus(), want.getStatus());
    EXPECT_EQ(got.getNodePaths(), want.getNodePaths());
    EXPECT_EQ(got.getTimeStamp(), want.getTimeStamp());
}

std::vector<Alert> asserted(AlertStore& store)
{
    std::vector<Alert> out;
    expectSuccess(store.getAsserted(out));
    return out;
}

std::vector<std::string> messagesOf(std::vector<Alert> const& v)
{
    std::vector<std::string> out;
    for (auto const& a : v)
        out.push_back(a.getMessage());
    return out;
}

class AlertStoreTest : public ::testing::Test {
protected:
    AlertStore store;
    std::string const A = std::string("\x1f\x50", 2);
    std::string const B = std::string("\x2f\x51", 2);
    std::string const C = std::string("\x2f\x52", 2);
};

} // namespace

// ---------------------------------------------------------------------------
// Asserting and clearing
// ---------------------------------------------------------------------------

TEST_F(AlertStoreTest, AbnormalAlertIsStoredAsGiven)
{
    Alert const a = alert({A}, 2, "hot", 5, 9);
    expectSuccess(store.newAlerts({a}, kFP));
    auto const out = asserted(store);
    ASSERT_EQ(out.size(), 1u);
    expectSameAlert(out[0], a);
}

TEST_F(AlertStoreTest, StatusZeroAndOddStatusesCountAsAsserted)
{
    store.newAlerts({alert({A}, 0, "zero"), alert({B}, 3, "three"),
                     alert({C}, 4294967295u, "max")},
                    kFP);
    EXPECT_EQ(messagesOf(asserted(store)), (std::vector<std::string>{"zero", "three", "max"}));
}

TEST_F(AlertStoreTest, ManagementInterfaceBatchLeavesStoreAlone)
{
    store.newAlerts({alert({A}, 2, "kept")}, kFP);
    ictest::LogCapture cap;
    expectSuccess(store.newAlerts({alert({A}, 1), alert({B}, 0), alert({C}, 2)}, kMI));
    EXPECT_EQ(messagesOf(asserted(store)), std::vector<std::string>{"kept"});
    EXPECT_TRUE(cap.records().empty()) << "an ignored batch logs nothing";
}

TEST_F(AlertStoreTest, NormalStatusClearsOnePathOfATwoPathAlert)
{
    Alert const first = alert({A, B}, 2, "first");
    store.newAlerts({first}, kFP);
    ASSERT_EQ(asserted(store).size(), 2u);
    store.newAlerts({alert({A}, 1, "cleared")}, kFP);
    auto const out = asserted(store);
    ASSERT_EQ(out.size(), 1u);
    // The remaining entry still carries both paths of the original alert.
    expectSameAlert(out[0], first);
}

TEST_F(AlertStoreTest, NormalStatusForUnknownPathChangesNothing)
{
    store.newAlerts({alert({A}, 2, "a")}, kFP);
    ictest::LogCapture cap;
    store.newAlerts({alert({B}, 1)}, kFP);
    EXPECT_EQ(messagesOf(asserted(store)), std::vector<std::string>{"a"});
    EXPECT_TRUE(cap.records().empty()) << "a clearing alert logs nothing";
}

TEST_F(AlertStoreTest, NewestAlertPerPathWins)
{
    store.newAlerts({alert({A}, 2, "older")}, kFP);
    store.newAlerts({alert({A}, 3, "newer")}, kFP);
    auto out = asserted(store);
    ASSERT_EQ(out.size(), 1u);
    EXPECT_EQ(out[0].getMessage(), "newer");
    EXPECT_EQ(out[0].getStatus(), 3u);

    // Within one batch, too, the later alert of a path replaces the earlier.
    store.newAlerts({alert({B}, 2, "b1"), alert({B}, 2, "b2")}, kFP);
    EXPECT_EQ(messagesOf(asserted(store)), (std::vector<std::string>{"newer", "b2"}));
}

TEST_F(AlertStoreTest, BatchIsAppliedInOrder)
{
    store.newAlerts({alert({A}, 2, "a"), alert({A}, 1)}, kFP);
    EXPECT_TRUE(asserted(store).empty());
    store.newAlerts({alert({B}, 1), alert({B}, 2, "b")}, kFP);
    EXPECT_EQ(messagesOf(asserted(store)), std::vector<std::string>{"b"});
}

TEST_F(AlertStoreTest, AlertWithoutPathsChangesNothing)
{
    store.newAlerts({alert({A}, 2, "a")}, kFP);
    ictest::LogCapture cap;
    store.newAlerts({alert({}, 2), alert({}, 1)}, kFP);
    EXPECT_EQ(messagesOf(asserted(store)), std::vector<std::string>{"a"});
    EXPECT_TRUE(cap.records().empty());
}

TEST_F(AlertStoreTest, ClearDropsEverything)
{
    store.newAlerts({alert({A, B}, 2), alert({C}, 0)}, kFP);
    store.clear();
    EXPECT_TRUE(asserted(store).empty());
    store.newAlerts({alert({A}, 2, "after")}, kFP);
    EXPECT_EQ(messagesOf(asserted(store)), std::vector<std::string>{"after"});
}

// ---------------------------------------------------------------------------
// Listing
// ---------------------------------------------------------------------------

TEST_F(AlertStoreTest, EmptyStoreEmptiesTheCallersVector)
{
    std::vector<Alert> out{alert({A}, 2), alert({B}, 2)};
    expectSuccess(store.getAsserted(out));
    EXPECT_TRUE(out.empty());
}

TEST_F(AlertStoreTest, ListingReplacesWhatTheVectorHeld)
{
    store.newAlerts({alert({A}, 2, "stored")}, kFP);
    std::vector<Alert> out{alert({B}, 2, "stale"), alert({C}, 2, "stale")};
    store.getAsserted(out);
    EXPECT_EQ(messagesOf(out), std::vector<std::string>{"stored"});
}

TEST_F(AlertStoreTest, ListingFollowsByteOrderOfPathsNotArrival)
{
    std::string const high("\x90\x01", 2); // above 0x7f: unsigned byte order
    std::string const low("\x10\xff", 2);
    std::string const prefix("\x10", 1);   // a prefix sorts first
    store.newAlerts({alert({high}, 2, "high")}, kFP);
    store.newAlerts({alert({low}, 2, "low")}, kFP);
    store.newAlerts({alert({prefix}, 2, "prefix")}, kFP);
    EXPECT_EQ(messagesOf(asserted(store)),
              (std::vector<std::string>{"prefix", "low", "high"}));
}

TEST_F(AlertStoreTest, AlertUnderTwoPathsIsListedTwiceWithBothPaths)
{
    Alert const both = alert({C, A}, 2, "both");
    store.newAlerts({both, alert({B}, 2, "b")}, kFP);
    auto const out = asserted(store);
    ASSERT_EQ(out.size(), 3u);
    // Keys A < B < C; the entries of A and C hold the same alert.
    expectSameAlert(out[0], both);
    EXPECT_EQ(out[1].getMessage(), "b");
    expectSameAlert(out[2], both);
}

// ---------------------------------------------------------------------------
// Logging
// ---------------------------------------------------------------------------

TEST_F(AlertStoreTest, EachAssertedPathLogsOneWarningOnBothChannels)
{
    ictest::LogCapture cap;
    store.newAlerts({alert({A, B}, 0)}, kFP);
    auto const all = cap.records();
    ASSERT_EQ(all.size(), 4u);
    std::vector<std::string> const want = {"newAlerts: Abnormal Status 0path =" + hex(A),
                                           "newAlerts: Abnormal Status 0path =" + hex(B)};
    EXPECT_EQ(cap.messages(), want);
    for (auto const& msg : want) {
        int log = 0, trace = 0, line = -1;
        for (auto const& r : all) {
            if (r.message != msg)
                continue;
            (r.channel == HGLog::Channel::Log ? log : trace)++;
            EXPECT_EQ(r.level, 4000);
            EXPECT_EQ(r.logger, kLogger);
            EXPECT_EQ(r.file, "AlertStore");
            EXPECT_EQ(r.function, "newAlerts");
            if (line < 0)
                line = r.line;
            EXPECT_EQ(r.line, line);
        }
        EXPECT_EQ(log, 1) << msg;
        EXPECT_EQ(trace, 1) << msg;
    }
}

TEST_F(AlertStoreTest, StatusIsLoggedAsUnsignedNumber)
{
    ictest::LogCapture cap;
    store.newAlerts({alert({C}, 4294967295u), alert({A}, 65)}, kFP);
    EXPECT_EQ(cap.messages(),
              (std::vector<std::string>{"newAlerts: Abnormal Status 4294967295path =" + hex(C),
                                        "newAlerts: Abnormal Status 65path =" + hex(A)}));
}

TEST(AlertStoreHexstring, TwoLowerCaseDigitsPerByte)
{
    EXPECT_EQ(IC::ALERT_STORE::hexstring(""), "");
    EXPECT_EQ(IC::ALERT_STORE::hexstring(std::string("\x00", 1)), "00");
    EXPECT_EQ(IC::ALERT_STORE::hexstring(std::string("\x1f\x5c\xab\x0f\xff\x80", 6)),
              "1f5cab0fff80");
    EXPECT_EQ(IC::ALERT_STORE::hexstring("AZ"), "415a");
}
