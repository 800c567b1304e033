// The common value types.
#include <IC/Alert.h>
#include <IC/Node.h>

#include "TestSupport.h"

namespace {

using IC::Node;
using IC::Number;
using Strings = std::vector<std::string>;

// Equal only when made the same way from equal values; printed by form.
TEST(CommonTypes, NumbersErrorsAndAlertsCompareAndPrint)
{
    Number const v(IC::Version2{2, 255}), k(Number::Generic), u(7u);
    EXPECT_TRUE(v.getVersion() == (IC::Version2{2, 255}) && u.getVersion() == (IC::Version2{0, 0}));
    EXPECT_TRUE(Number(IC::Version2{2, 255}) == v && Number(IC::Version2{0, 1}) != Number(1u) && Number(0u) != k);
    IC::Error const a("text", 1), b(5, Number(1u), "Load Library");
    EXPECT_TRUE(a.getStatus() == 1 && a.getCode() == k && a.getText() == "text" && IC::Error(nullptr, 1).getText().empty());
    SD::DateTime const before;
    IC::Alert const alert(3, IC::Alert::NodeRemoval, {"\x1f\x5c", "\x01"}, 2, "fan failed");
    EXPECT_TRUE(before <= alert.getTimeStamp() && alert.getTimeStamp() <= SD::DateTime());
    IC::Alert copy(0, static_cast<IC::Alert::ClassType>(200), {}, 1, "");
    copy = alert;
    std::string const text =
        "time=" + alert.getTimeStamp().toIso8601() + " severity=3 class=4 status=2 paths={1f5c,01} message=fan failed";
    EXPECT_EQ((Strings{v.toString(), k.toString(), ::testing::PrintToString(u), std::string(b),
                       ::testing::PrintToString(b), std::string(copy), ::testing::PrintToString(alert)}),
              (Strings{"2.255", "kind 0", "7", "status=5 code=1 text=Load Library", "status=5 code=1 text=Load Library",
                       text, text}));
}

// "type instance id linked-id number description path linked-path properties"
std::string fields(Node const& n)
{
    std::string s = std::to_string(static_cast<Node::SensorType>(n)) + " " + std::to_string(n.getInstance()) + " " +
        std::to_string(n.getNodeId()) + " " + std::to_string(n.getLinkedId()) + " " + std::to_string(n.getNodeNumber()) +
        " " + n.getDescription() + " " + ictest::hex(n.getPath()) + " " + ictest::hex(n.getLinkedPath());
    for (auto const& p : n.getProperties())
        s += " " + p.name + "=" + p.value + p.unit;
    return s;
}

TEST(CommonTypes, NodesKeepTheirIdentityAndOrderedPropertiesAndCopyBoth)
{
    Node n(Node::Fan, 3, 0x20005, 0x20001, "fan 3", 12);
    n.setPath("\x1f\x5c");
    n.setLinkedPath("abc");
    n.setProperty("reading", "41.5", "C");
    n.setProperty("label", "Package id 0");
    n.setProperty("reading", "42", "C");
    Node::Property p;
    EXPECT_TRUE(n.getProperty("reading", &p) && p.value + p.unit == "42C" && n.getProperty("label", nullptr));
    EXPECT_FALSE(n.getProperty("upper_critical", &p) || n.removeProperty("upper_critical"));
    Node copy(n), assigned(Node::CPU, 0, 1, 0, "");
    assigned = n;
    n.setInstance(9);
    n.setLinkedId(1);
    n.setNodeId(2);
    n.setDescription("renamed");
    EXPECT_TRUE(n.removeProperty("reading"));
    std::string const before = "20 3 131077 131073 12 fan 3 1f5c 616263 reading=42C label=Package id 0";
    EXPECT_EQ((Strings{fields(copy), fields(assigned), fields(n)}),
              (Strings{before, before, "20 9 2 1 12 renamed 1f5c 616263 label=Package id 0"}));
    // A poller updates properties while clients read them: the thread
    // checker's run sees a missing lock here.
    ictest::JoinedThread reader([&copy] {
        for (int i = 0; i < 500; ++i)
            copy.getProperties();
    });
    for (int i = 0; i < 500; ++i)
        copy.setProperty("reading", std::to_string(i), "C");
}

} // namespace
