// The common value types and the plug-in services object.
#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ICforFP.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <gtest/gtest.h>

#include <sstream>
#include <thread>
#include <type_traits>

namespace {

TEST(Number, RemembersHowItWasMade)
{
    IC::Number const v(IC::Version2{1, 0});
    IC::Number const k(IC::Number::Generic);
    IC::Number const u(7u);
    EXPECT_EQ(v.getForm(), IC::Number::Form::Version);
    EXPECT_EQ(k.getForm(), IC::Number::Form::Kind);
    EXPECT_EQ(u.getForm(), IC::Number::Form::Unsigned);
    EXPECT_EQ(u.getValue(), 7u);
    EXPECT_EQ(v.getVersion(), (IC::Version2{1, 0}));
    EXPECT_EQ(u.getVersion(), (IC::Version2{0, 0}));
    EXPECT_EQ(IC::Number(IC::Version2{2, 255}).getVersion(), (IC::Version2{2, 255}));
}

TEST(Number, EqualityNeedsSameFormAndValue)
{
    EXPECT_EQ(IC::Number(IC::Version2{1, 0}), IC::Number(IC::Version2{1, 0}));
    EXPECT_NE(IC::Number(IC::Version2{1, 0}), IC::Number(IC::Version2{1, 1}));
    EXPECT_NE(IC::Number(IC::Version2{0, 1}), IC::Number(1u));
    EXPECT_NE(IC::Number(0u), IC::Number(IC::Number::Generic));
    EXPECT_EQ(IC::Number(42u), IC::Number(42u));
    EXPECT_FALSE(IC::Number(42u) != IC::Number(42u));
}

TEST(Number, PrintsEachForm)
{
    EXPECT_EQ(IC::Number(IC::Version2{1, 0}).toString(), "1.0");
    EXPECT_EQ(IC::Number(12u).toString(), "12");
    EXPECT_EQ(IC::Number(IC::Number::Generic).toString(), "kind 0");
    std::ostringstream os;
    os << IC::Number(3u);
    EXPECT_EQ(os.str(), "3");
}

TEST(Error, BothConstructorsAndTextualForm)
{
    IC::Error const a("NodeStore Duplicated Node Pointer", 1);
    EXPECT_EQ(a.getStatus(), 1);
    EXPECT_EQ(a.getCode(), IC::Number(IC::Number::Generic));
    EXPECT_EQ(a.getText(), "NodeStore Duplicated Node Pointer");

    IC::Error const b(5, IC::Number(1u), "Load Library");
    EXPECT_EQ(b.getStatus(), 5);
    EXPECT_EQ(b.getCode(), IC::Number(1u));
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

TEST(Node, SensorTypeIsA32BitEnumerationWithNumericCasts)
{
    static_assert(sizeof(IC::Node::SensorType) == 4, "32-bit");
    static_assert(std::is_same<std::underlying_type_t<IC::Node::SensorType>, std::uint32_t>::value,
                  "unsigned 32-bit");
    EXPECT_EQ(static_cast<unsigned>(IC::Node::Unknown), 0u);
    EXPECT_EQ(static_cast<unsigned>(IC::Node::CPU), 4u);
    EXPECT_EQ(static_cast<unsigned>(IC::Node::PowerSupply), 25u);
    EXPECT_EQ(static_cast<unsigned>(IC::Node::CPUCore), 42u);
    EXPECT_EQ(static_cast<unsigned>(IC::Node::ROOT), 59u);
    EXPECT_EQ(static_cast<unsigned>(IC::Node::LANEndPoint), 73u);
    EXPECT_EQ(static_cast<unsigned>(IC::Node::invalid), 74u);
    EXPECT_EQ(static_cast<IC::Node::SensorType>(22u), IC::Node::TemperatureSensor);
}

TEST(Node, IdentityPathsAndSetters)
{
    IC::Node n(IC::Node::Fan, 3, 0x20005, 0x20001, "fan 3");
    EXPECT_EQ(n.getSensor(), IC::Node::Fan);
    EXPECT_EQ(static_cast<IC::Node::SensorType>(n), IC::Node::Fan);
    EXPECT_EQ(n.getInstance(), 3u);
    EXPECT_EQ(n.getNodeId(), 0x20005u);
    EXPECT_EQ(n.getLinkedId(), 0x20001u);
    EXPECT_EQ(n.getDescription(), "fan 3");
    EXPECT_EQ(n.getNodeNumber(), 0u);
    EXPECT_EQ(n.getPath(), "");
    EXPECT_EQ(n.getLinkedPath(), "");

    EXPECT_EQ(n.setPath(std::string("\x1f\x5c", 2)).getStatus(), 0);
    EXPECT_EQ(n.setLinkedPath("abc").getStatus(), 0);
    EXPECT_EQ(n.getPath(), std::string("\x1f\x5c", 2));
    EXPECT_EQ(n.getLinkedPath(), "abc");
    n.setPath("x");
    EXPECT_EQ(n.getPath(), "x");

    n.setInstance(9);
    n.setLinkedId(1);
    n.setNodeId(2);
    n.setDescription("renamed");
    EXPECT_EQ(n.getInstance(), 9u);
    EXPECT_EQ(n.getLinkedId(), 1u);
    EXPECT_EQ(n.getNodeId(), 2u);
    EXPECT_EQ(n.getDescription(), "renamed");
    EXPECT_EQ(IC::Node(IC::Node::CPU, 0, 1, 0, "", 77).getNodeNumber(), 77u);
}

class CountingNode : public IC::Node {
public:
    CountingNode() : IC::Node(IC::Node::DIMM, 0, 1, 0, "dimm") {}
    unsigned int getNodeNumber() const override { return 1234; }
    IC::Error setPath(std::string const& path) override
    {
        ++pathsSet;
        return IC::Node::setPath(path);
    }
    int pathsSet = 0;
};

TEST(Node, PlugInsOverrideThroughTheBase)
{
    CountingNode derived;
    IC::Node& base = derived;
    EXPECT_EQ(base.getNodeNumber(), 1234u);
    base.setPath("p");
    EXPECT_EQ(derived.pathsSet, 1);
    EXPECT_EQ(base.getPath(), "p");
}

TEST(Node, PropertiesKeepOrderAndUpdateInPlace)
{
    IC::Node n(IC::Node::TemperatureSensor, 0, 1, 0, "CPU temp");
    IC::Node::Property p;
    EXPECT_FALSE(n.getProperty("reading", &p));
    n.setProperty("reading", "41.5", "C");
    n.setProperty("upper_critical", "95", "C");
    n.setProperty("label", "Package id 0");
    n.setProperty("reading", "42", "C");
    auto const props = n.getProperties();
    ASSERT_EQ(props.size(), 3u);
    EXPECT_EQ(props[0].name, "reading");
    EXPECT_EQ(props[0].value, "42");
    EXPECT_EQ(props[0].unit, "C");
    EXPECT_EQ(props[1].name, "upper_critical");
    EXPECT_EQ(props[2].unit, "");
    ASSERT_TRUE(n.getProperty("upper_critical", &p));
    EXPECT_EQ(p.value, "95");
    EXPECT_TRUE(n.getProperty("label", nullptr));
    EXPECT_TRUE(n.removeProperty("upper_critical"));
    EXPECT_FALSE(n.removeProperty("upper_critical"));
    EXPECT_EQ(n.getProperties().size(), 2u);

    IC::Node copy(n);
    n.setProperty("reading", "50", "C");
    ASSERT_TRUE(copy.getProperty("reading", &p));
    EXPECT_EQ(p.value, "42");
    copy = n;
    ASSERT_TRUE(copy.getProperty("reading", &p));
    EXPECT_EQ(p.value, "50");
}

TEST(Node, PropertiesMayBeUpdatedWhileOthersRead)
{
    IC::Node n(IC::Node::Fan, 0, 1, 0, "fan");
    std::thread writer([&n] {
        for (int i = 0; i < 2000; ++i)
            n.setProperty("reading", std::to_string(i), "RPM");
    });
    std::size_t seen = 0;
    for (int i = 0; i < 2000; ++i) {
        for (auto const& p : n.getProperties()) {
            EXPECT_EQ(p.unit, "RPM");
            ++seen;
        }
    }
    writer.join();
    IC::Node::Property p;
    ASSERT_TRUE(n.getProperty("reading", &p));
    EXPECT_EQ(p.value, "1999");
    EXPECT_LE(seen, 2000u);
}

TEST(Alert, FieldsTimeStampAndRendering)
{
    static_assert(sizeof(IC::Alert::ClassType) == 1, "8-bit class");
    SD::DateTime const before;
    IC::Alert const a(3, IC::Alert::NodeRemoval, {std::string("\x1f\x5c", 2), "\x01"}, 2, "fan failed");
    SD::DateTime const after;
    EXPECT_EQ(a.getSeverity(), 3);
    EXPECT_EQ(a.getClass(), 4);
    EXPECT_EQ(a.getStatus(), 2u);
    EXPECT_EQ(a.getMessage(), "fan failed");
    ASSERT_EQ(a.getNodePaths().size(), 2u);
    EXPECT_EQ(a.nodePaths()[0], std::string("\x1f\x5c", 2));
    EXPECT_LE(before, a.getTimeStamp());
    EXPECT_LE(a.getTimeStamp(), after);

    std::string const text = a;
    EXPECT_NE(text.find("paths={1f5c,01}"), std::string::npos) << text;
    EXPECT_NE(text.find("message=fan failed"), std::string::npos) << text;
    EXPECT_NE(text.find("class=4"), std::string::npos) << text;
    EXPECT_NE(text.find(a.getTimeStamp().toIso8601()), std::string::npos) << text;

    IC::Alert copy = a;
    EXPECT_EQ(copy.getTimeStamp(), a.getTimeStamp());
    EXPECT_EQ(copy.getNodePaths(), a.getNodePaths());
    IC::Alert other(0, static_cast<IC::Alert::ClassType>(200), {}, 1, "");
    other = a;
    EXPECT_EQ(other.getMessage(), "fan failed");
}

IC::Error pathReg(IC::AlertCallBack, std::vector<std::string> const&, void const*)
{
    return IC::Error("reg", 0);
}
IC::Error pathDeReg(IC::AlertCallBack, std::vector<std::string> const&, void const*)
{
    return IC::Error("dereg", 0);
}
IC::Error raise(std::vector<IC::Alert> const&) { return IC::Error("raise", 0); }
IC::Error assertOnly(std::vector<IC::Alert> const&) { return IC::Error("assert", 0); }
IC::Error announce(IC::Node* const&) { return IC::Error("announce", 0); }
IC::Error sensorReg(IC::AlertCallBack, IC::Node::SensorType, void const*)
{
    return IC::Error("sreg", 0);
}
IC::Error sensorDeReg(IC::AlertCallBack, IC::Node::SensorType, void const*)
{
    return IC::Error("sdereg", 0);
}

TEST(ICforFP, KeepsCopiesOfEveryValue)
{
    std::vector<IC::ManagementInterface*> mis{reinterpret_cast<IC::ManagementInterface*>(0x10),
                                              reinterpret_cast<IC::ManagementInterface*>(0x20)};
    auto* const facade = reinterpret_cast<IC::InstrumentationControl*>(0x30);
    IC::NodeAnnouncement announceRef = announce;
    IC::ICforFP const services(mis, pathReg, pathDeReg, raise, assertOnly,
                               IC::Number(IC::Version2{1, 0}), IC::Number(IC::Version2{1, 1}),
                               announceRef, facade, sensorReg, sensorDeReg);
    mis.clear();
    announceRef = nullptr;
    ASSERT_EQ(services.getMIs().size(), 2u);
    EXPECT_EQ(services.getMIs()[1], reinterpret_cast<IC::ManagementInterface*>(0x20));
    EXPECT_EQ(services.getRegFPAlerts(), &pathReg);
    EXPECT_EQ(services.getDeRegFPAlerts(), &pathDeReg);
    EXPECT_EQ(services.getAlertCallBackFP(), &raise);
    EXPECT_EQ(services.getAssertCallBackFP(), &assertOnly);
    EXPECT_EQ(services.getInterfaceVersion(), IC::Number(IC::Version2{1, 0}));
    EXPECT_EQ(services.getModuleVersion(), IC::Number(IC::Version2{1, 1}));
    EXPECT_EQ(services.getMapNewFPNode(), &announce);
    EXPECT_EQ(services.getInstrumentationControl(), facade);
    EXPECT_EQ(services.getRegFPsensorAlerts(), &sensorReg);
    EXPECT_EQ(services.getDeRegFPsensorAlerts(), &sensorDeReg);

    IC::ICforFP const copy = services;
    EXPECT_EQ(copy.getMIs(), services.getMIs());
    EXPECT_EQ(copy.getRegFPsensorAlerts()(nullptr, IC::Node::CPU, nullptr).getText(), "sreg");
}

} // namespace
