// The common value types and the plug-in services object.
#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ICforFP.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include "Recorders.h"
#include "TestSupport.h"

#include <type_traits>

namespace {

using IC::Node;
using IC::Number;

TEST(Number, FormValueEqualityAndText)
{
    Number const v(IC::Version2{1, 0}), k(Number::Generic), u(7u);
    EXPECT_EQ(v.getForm(), Number::Form::Version);
    EXPECT_EQ(k.getForm(), Number::Form::Kind);
    EXPECT_EQ(u.getForm(), Number::Form::Unsigned);
    EXPECT_EQ(u.getValue(), 7u);
    EXPECT_EQ(v.getVersion(), (IC::Version2{1, 0}));
    EXPECT_EQ(u.getVersion(), (IC::Version2{0, 0}));
    EXPECT_EQ(Number(IC::Version2{2, 255}).getVersion(), (IC::Version2{2, 255}));

    // Equal only when made the same way from equal values.
    EXPECT_EQ(Number(IC::Version2{1, 0}), v);
    EXPECT_NE(Number(IC::Version2{1, 1}), v);
    EXPECT_NE(Number(IC::Version2{0, 1}), Number(1u));
    EXPECT_NE(Number(0u), k);
    EXPECT_FALSE(Number(42u) != Number(42u));

    EXPECT_EQ(v.toString(), "1.0");
    EXPECT_EQ(Number(12u).toString(), "12");
    EXPECT_EQ(k.toString(), "kind 0");
    std::ostringstream os;
    os << Number(3u);
    EXPECT_EQ(os.str(), "3");
}

TEST(Error, BothConstructorsAndTextualForm)
{
    IC::Error const a("NodeStore Duplicated Node Pointer", 1);
    EXPECT_EQ(a.getStatus(), 1);
    EXPECT_EQ(a.getCode(), Number(Number::Generic));
    EXPECT_EQ(a.getText(), "NodeStore Duplicated Node Pointer");

    IC::Error const b(5, Number(1u), "Load Library");
    EXPECT_EQ(b.getCode(), Number(1u));
    std::string const text = b;
    EXPECT_EQ(text, "status=5 code=1 text=Load Library");
    std::ostringstream os;
    os << b;
    EXPECT_EQ(os.str(), text);
    IC::Error c = a;
    c = b;
    EXPECT_EQ(c.getStatus(), 5);
    EXPECT_EQ(IC::Error(nullptr, 1).getText(), "");
}

TEST(Node, SensorTypeIsA32BitEnumerationWithFixedValues)
{
    static_assert(std::is_same<std::underlying_type_t<Node::SensorType>, std::uint32_t>::value,
                  "unsigned 32-bit");
    std::pair<Node::SensorType, unsigned> const values[] = {
        {Node::Unknown, 0},      {Node::CPU, 4},   {Node::TemperatureSensor, 22},
        {Node::PowerSupply, 25}, {Node::CPUCore, 42}, {Node::ROOT, 59},
        {Node::LANEndPoint, 73}, {Node::invalid, 74}};
    for (auto const& v : values)
        EXPECT_EQ(static_cast<unsigned>(v.first), v.second);
}

// Counts what a plug-in's node sees through the base class.
class CountingNode : public Node {
public:
    CountingNode() : Node(Node::DIMM, 0, 1, 0, "dimm") {}
    unsigned int getNodeNumber() const override { return 1234; }
    IC::Error setPath(std::string const& path) override
    {
        ++pathsSet;
        return Node::setPath(path);
    }
    int pathsSet = 0;
};

// "type instance id linked-id number description path linked-path", the
// paths in hexadecimal.
std::string fields(Node const& n)
{
    return std::to_string(static_cast<Node::SensorType>(n)) + " " + std::to_string(n.getInstance()) + " " +
           std::to_string(n.getNodeId()) + " " + std::to_string(n.getLinkedId()) + " " +
           std::to_string(n.getNodeNumber()) + " " + n.getDescription() + " " + ictest::hex(n.getPath()) + " " +
           ictest::hex(n.getLinkedPath());
}

TEST(Node, IdentityPathsSettersAndOverrides)
{
    Node n(Node::Fan, 3, 0x20005, 0x20001, "fan 3");
    EXPECT_EQ(n.getSensor(), Node::Fan);
    EXPECT_EQ(fields(n), "20 3 131077 131073 0 fan 3  ");
    EXPECT_EQ(n.setPath(std::string("\x1f\x5c", 2)).getStatus() + n.setLinkedPath("abc").getStatus(), 0);
    n.setInstance(9);
    n.setLinkedId(1);
    n.setNodeId(2);
    n.setDescription("renamed");
    EXPECT_EQ(fields(n), "20 9 2 1 0 renamed 1f5c 616263");
    EXPECT_EQ(fields(Node(Node::CPU, 0, 1, 0, "", 77)), "4 0 1 0 77   ");

    CountingNode derived;
    Node& base = derived;
    EXPECT_EQ(base.getNodeNumber(), 1234u);
    base.setPath("p");
    EXPECT_EQ(derived.pathsSet, 1);
    EXPECT_EQ(base.getPath(), "p");
}

TEST(Node, PropertiesKeepOrderUpdateInPlaceAndCopy)
{
    Node n(Node::TemperatureSensor, 0, 1, 0, "CPU temp");
    Node::Property p;
    EXPECT_FALSE(n.getProperty("reading", &p));
    n.setProperty("reading", "41.5", "C");
    n.setProperty("upper_critical", "95", "C");
    n.setProperty("label", "Package id 0");
    n.setProperty("reading", "42", "C");
    auto const props = n.getProperties();
    ASSERT_EQ(props.size(), 3u);
    EXPECT_EQ(props[0].name + "=" + props[0].value + props[0].unit, "reading=42C");
    EXPECT_EQ(props[1].name, "upper_critical");
    EXPECT_EQ(props[2].name + props[2].unit, "label");
    ASSERT_TRUE(n.getProperty("upper_critical", &p));
    EXPECT_EQ(p.value, "95");
    EXPECT_TRUE(n.getProperty("label", nullptr));
    EXPECT_TRUE(n.removeProperty("upper_critical"));
    EXPECT_FALSE(n.removeProperty("upper_critical"));
    EXPECT_EQ(n.getProperties().size(), 2u);

    Node copy(n);
    n.setProperty("reading", "50", "C");
    ASSERT_TRUE(copy.getProperty("reading", &p));
    EXPECT_EQ(p.value, "42");
    copy = n;
    ASSERT_TRUE(copy.getProperty("reading", &p));
    EXPECT_EQ(p.value, "50");
}

TEST(Node, PropertiesMayBeUpdatedWhileOthersRead)
{
    Node n(Node::Fan, 0, 1, 0, "fan");
    std::thread writer([&n] {
        for (int i = 0; i < 2000; ++i)
            n.setProperty("reading", std::to_string(i), "RPM");
    });
    for (int i = 0; i < 2000; ++i) {
        auto const props = n.getProperties();
        EXPECT_LE(props.size(), 1u);
        for (auto const& p : props)
            EXPECT_EQ(p.unit, "RPM");
    }
    writer.join();
    Node::Property p;
    ASSERT_TRUE(n.getProperty("reading", &p));
    EXPECT_EQ(p.value, "1999");
}

TEST(Alert, FieldsTimeStampAndRendering)
{
    static_assert(sizeof(IC::Alert::ClassType) == 1, "8-bit class");
    SD::DateTime const before;
    IC::Alert const a(3, IC::Alert::NodeRemoval, {std::string("\x1f\x5c", 2), "\x01"}, 2,
                      "fan failed");
    SD::DateTime const after;
    EXPECT_EQ(ictest::sig(a), "3/4/2/fan failed/1f5c,01,");
    EXPECT_EQ(a.getNodePaths(), a.nodePaths());
    EXPECT_LE(before, a.getTimeStamp());
    EXPECT_LE(a.getTimeStamp(), after);

    std::string const text = a;
    for (std::string const& part : std::vector<std::string>{
             "paths={1f5c,01}", "message=fan failed", "class=4", a.getTimeStamp().toIso8601()})
        EXPECT_NE(text.find(part), std::string::npos) << text << " lacks " << part;

    IC::Alert copy = a, other(0, static_cast<IC::Alert::ClassType>(200), {}, 1, "");
    other = a;
    for (IC::Alert const* c : {&copy, &other})
        EXPECT_TRUE(ictest::sig(*c) == ictest::sig(a) && c->getTimeStamp() == a.getTimeStamp());
}

TEST(ICforFP, KeepsCopiesOfEveryValue)
{
    std::vector<IC::ManagementInterface*> mis{reinterpret_cast<IC::ManagementInterface*>(0x10),
                                              reinterpret_cast<IC::ManagementInterface*>(0x20)};
    auto const given = mis;
    auto* const facade = reinterpret_cast<IC::InstrumentationControl*>(0x30);
    IC::NodeAnnouncement announce = &ictest::svMapNode;
    IC::ICforFP const services(mis, &ictest::svRegPath, &ictest::svDeRegPath, &ictest::svAlert,
                               &ictest::svAssert, Number(IC::Version2{1, 0}),
                               Number(IC::Version2{2, 3}), announce, facade,
                               &ictest::svRegSensor, &ictest::svDeRegSensor);
    mis.clear();
    announce = nullptr;
    ictest::expectServices(services, given, facade);
    IC::ICforFP const copy = services;
    ictest::expectServices(copy, given, facade);
    EXPECT_EQ(copy.getRegFPsensorAlerts()(nullptr, Node::CPU, nullptr).getText(), "reg sensor");
}

} // namespace
