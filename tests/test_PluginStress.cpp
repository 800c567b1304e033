// Everything at once, for the thread and address checkers: a loader thread
// reloading every second while plug-in files come and go, management
// interfaces raising alerts and reporting nodes from their own threads, and
// clients querying and (de)registering. Ends with the last unload, after
// which every plug-in must be released and every library closed.
#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>
#include <IC/LoaderThread.h>

#include "PluginTest.h"

#include <random>

namespace {

namespace IST = IC::InstCtrl;

std::atomic<long> clientAlerts{0};

IC::Error client(std::vector<IC::Alert> const& alerts, void const*)
{
    clientAlerts += static_cast<long>(alerts.size());
    return IC::Error(0, IC::Number(IC::Number::Generic), "");
}

void simple(unsigned int, SD::DateTime, std::string, void const*) {}

class PluginStress : public ictest::PluginTest {
protected:
    void TearDown() override
    {
        ictest::Watchdog dog(60, "stress teardown");
        PluginTest::TearDown();
    }
};

TEST_F(PluginStress, ReloadsAlertsQueriesAndRegistrationsTogether)
{
    ictest::Watchdog dog(120, "plug-in stress");
    clientAlerts = 0;
    // Plug-ins that stay for the whole run, and some that come and go.
    tree_.addMI("mi_thread", "t0.so");
    tree_.addMI("mi_alpha");
    tree_.addFP("fp_relay");
    tree_.addFP("fp_one");
    ictestprobe::ThreadPlan plan;
    plan.alerts = plan.nodes = plan.removals = true;
    plan.periodMs = 5;
    ictestprobe::setThreadPlan(plan);

    IC::InstrumentationControl* ic = nullptr;
    IC::Error* err = nullptr;
    ASSERT_EQ(Open(&ic, &err), 0);
    int clientCtx = 0;
    ASSERT_EQ(ic->registerForAlerts(&client, IC::Node::Fan, &clientCtx).getStatus(), 0);
    auto* loader = new IC::LoaderThread(0, 1, &IST::TimedReload);
    IST::lt = loader;
    ASSERT_TRUE(loader->start());

    std::atomic<bool> stop{false};
    std::atomic<long> queries{0}, mismatches{0};
    std::vector<ictest::JoinedThread> workers;
    // Plug-in files come and go. Copies appear under new names only, so a
    // loaded image is never overwritten in place.
    workers.emplace_back([&] {
        std::mt19937 rng(12345);
        std::vector<std::string> const modules[] = {{"mi_alpha", "mi_beta", "mi_gamma", "mi_thread"},
                                                    {"fp_one", "fp_two"}};
        std::vector<std::string> files[2];
        for (int serial = 0; !stop; ++serial) {
            unsigned const kind = rng() % 2, op = rng() % 3;
            std::string const dir = kind == 0 ? tree_.miDir() : tree_.fpDir();
            auto& mine = files[kind];
            if ((op == 0 && mine.size() < 4) || mine.empty()) {
                mine.push_back(tree_.install(dir, modules[kind][rng() % modules[kind].size()],
                                             "c" + std::to_string(serial) + ".so"));
            } else if (op == 1) {
                std::size_t const i = rng() % mine.size();
                ictest::fs::remove(mine[i]);
                mine.erase(mine.begin() + static_cast<long>(i));
            } else {
                std::size_t const i = rng() % mine.size();
                std::string const to = dir + "/r" + std::to_string(serial) + ".so";
                ictest::fs::rename(mine[i], to);
                mine[i] = to;
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(150));
        }
    });
    // Clients reading nodes.
    for (int q = 0; q < 2; ++q)
        workers.emplace_back([&] {
            std::vector<IC::Node*> nodes;
            std::vector<IC::Alert> asserted;
            while (!stop) {
                ic->getMap(nodes);
                for (IC::Node* n : nodes) {
                    std::string const path = ic->getNodeUniqueId(n);
                    IC::Node* found = nullptr;
                    mismatches += ic->getNode(path, &found).getStatus() == 0 && found == nullptr;
                    mismatches += ic->printablePathToPath(ic->pathToPrintablePath(path)) != path;
                    mismatches += ic->getNodeHierarchy(n).empty();
                    ic->getNode(n->getNodeId(), &found);
                }
                ic->getMap(nodes, IC::Node::Fan);
                for (auto const& r : ictestprobe::mis()) {
                    IC::Node* found = nullptr;
                    if (ic->getNode(r.base | 3, &found).getStatus() == 0)
                        ic->getNodeHierarchy(found, IC::Node::Chassis);
                }
                ic->getAssertedAlerts(asserted);
                ++queries;
                std::this_thread::sleep_for(std::chrono::milliseconds(2));
            }
        });
    // Clients registering and deregistering.
    workers.emplace_back([&] {
        int ctx[4] = {0, 0, 0, 0};
        IC::Node::SensorType const sensors[] = {IC::Node::Fan, IC::Node::CPU, IC::Node::PowerSupply};
        for (unsigned turn = 0; !stop; ++turn) {
            void const* c = &ctx[turn % 4];
            auto const s = sensors[turn % 3];
            ic->registerForAlerts(&client, s, c);
            ic->registerForSimpleAlerts(&simple, s, c);
            std::this_thread::sleep_for(std::chrono::milliseconds(3));
            ic->deRegisterForAlerts(&client, s, c);
            ic->deRegisterForSimpleAlerts(&simple, s, c);
        }
    });
    std::this_thread::sleep_for(std::chrono::seconds(8));
    stop = true;
    workers.clear();

    EXPECT_EQ(mismatches.load(), 0);
    EXPECT_GT(queries.load(), 0);
    // Alerts went all the way from interface threads through the relay.
    EXPECT_GT(clientAlerts.load(), 0);
    // The loader thread did reload: more plug-ins were created than the
    // first open made.
    EXPECT_GT(ictestprobe::mis().size() + ictestprobe::fps().size(), 4u);

    Unloadlib();
    EXPECT_EQ(IST::ICloadCount, 0u);
    EXPECT_EQ(IST::lt, nullptr);
    EXPECT_TRUE(IST::mymis.empty() && IST::myfps.empty());
    for (auto const& r : ictestprobe::mis())
        EXPECT_TRUE(r.released && !r.threadRunning) << r.name << " " << r.object;
    for (auto const& r : ictestprobe::fps())
        EXPECT_TRUE(r.released) << r.name << " " << r.object;
    EXPECT_EQ(ictestprobe::liveImages(), 0);
    EXPECT_FALSE(ictest::isMapped(tree_.root()));
}

} // namespace
