// Re-entry stress: while functional plug-ins raise alerts from their own
// threads, the client's alert callback calls every public operation of the
// facade (registrations and deregistrations of every form, itself included,
// node queries, path conversion), and the main thread does the same. A
// watchdog ends the process if this does not finish: a deadlock shows as a
// failure, not as a hung run.
#include "SoakLog.h"

#include <IC/InstCtrl.h>
#include <IC/InstrumentationControl.h>
#include <IC/Node.h>

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;
using IC::Alert;
using IC::Error;
using IC::Node;

#if defined(__SANITIZE_THREAD__)
constexpr int kWatchdogSeconds = 600;
#else
constexpr int kWatchdogSeconds = 120;
#endif
// Callback runs to wait for, and the longest time to wait for them.
constexpr unsigned long kCallbackRuns = 3000;
constexpr int kRunSeconds = 60;
// Three nodes per management interface and one per functional plug-in, ten
// of each.
constexpr std::size_t kMinNodes = 40;

Error ok()
{
    return Error(0, IC::Number(IC::Number::Generic), "");
}

// Ends the process with a message unless disarmed in time.
class Watchdog {
public:
    Watchdog(int seconds, char const* what)
        : thread_([this, seconds, what] {
              std::unique_lock<std::mutex> g(m_);
              if (!cv_.wait_for(g, std::chrono::seconds(seconds), [this] { return done_; })) {
                  std::fprintf(stderr, "watchdog: %s did not finish within %d s (deadlock?)\n", what,
                               seconds);
                  std::fflush(stderr);
                  std::abort();
              }
          })
    {
    }
    ~Watchdog()
    {
        {
            std::lock_guard<std::mutex> g(m_);
            done_ = true;
        }
        cv_.notify_all();
        thread_.join();
    }
    Watchdog(Watchdog const&) = delete;
    Watchdog& operator=(Watchdog const&) = delete;

private:
    std::mutex m_;
    std::condition_variable cv_;
    bool done_ = false;
    std::thread thread_;
};

// What the callbacks found wrong; the first few messages are kept.
struct Findings {
    std::atomic<unsigned long> runs{0};
    std::atomic<unsigned long> faults{0};
    std::atomic<unsigned long> checkedNodes{0};
    std::mutex m;
    std::vector<std::string> messages;

    void fault(std::string const& text)
    {
        ++faults;
        std::lock_guard<std::mutex> g(m);
        if (messages.size() < 10)
            messages.push_back(text);
    }
};

Findings findings;
IC::InstrumentationControl* facade = nullptr;
int selfContext = 0;

Error otherCallback(std::vector<Alert> const&, void const*)
{
    return ok();
}

void simpleCallback(unsigned int, SD::DateTime, std::string, void const*) {}

#define CHECK_STATUS(expr)                                                                   \
    do {                                                                                     \
        Error const e_ = (expr);                                                             \
        if (e_.getStatus() != 0)                                                             \
            findings.fault(std::string(#expr) + " gave status " + std::to_string(e_.getStatus())); \
    } while (0)

// Every public operation of the facade, checked where the answer is known.
// context is unique to the calling thread, so that registrations made here
// are this call's own. minNodes is how many nodes must be registered (the
// callbacks also run while the library unloads, when nodes may be leaving).
void exercise(std::vector<std::string> const& paths, void const* context, std::size_t minNodes)
{
    IC::InstrumentationControl& ic = *facade;

    if (ic.getModuleVersion().toString().empty() || ic.getInterfaceVersion().toString().empty())
        findings.fault("empty version");

    // Registrations of every form, then their removal.
    CHECK_STATUS(ic.registerForAlerts(otherCallback, Node::Fan, context));
    CHECK_STATUS(ic.deRegisterForAlerts(otherCallback, Node::Fan, context));
    CHECK_STATUS(ic.registerForSimpleAlerts(simpleCallback, Node::PowerSupply, context));
    CHECK_STATUS(ic.deRegisterForSimpleAlerts(simpleCallback, Node::PowerSupply, context));
    auto const cls = static_cast<Alert::ClassType>(2);
    CHECK_STATUS(IC::InstCtrl::registerForAlerts(otherCallback, cls, context));
    CHECK_STATUS(IC::InstCtrl::deRegisterForAlerts(otherCallback, cls, context));
    if (!paths.empty()) {
        CHECK_STATUS(IC::InstCtrl::registerForAlerts(otherCallback, paths, context));
        CHECK_STATUS(IC::InstCtrl::deRegisterForAlerts(otherCallback, paths, context));
    }

    // Queries.
    std::vector<Alert> asserted;
    CHECK_STATUS(ic.getAssertedAlerts(asserted));
    std::vector<Node*> all;
    CHECK_STATUS(ic.getAllNodes(all));
    if (all.size() < minNodes)
        findings.fault("getAllNodes gave " + std::to_string(all.size()) + " nodes");
    std::vector<Node*> some;
    CHECK_STATUS(ic.getMap(some));
    some.clear();
    CHECK_STATUS(ic.getMap(some, Node::PowerSupply));

    for (std::string const& path : paths) {
        Node* node = nullptr;
        CHECK_STATUS(ic.getNode(path, &node));
        if (node == nullptr)
            continue;
        ++findings.checkedNodes;
        if (ic.getNodeUniqueId(node) != path)
            findings.fault("getNodeUniqueId differs from the alert's path");
        Node* byId = nullptr;
        CHECK_STATUS(ic.getNode(node->getNodeId(), &byId));
        if (byId != node)
            findings.fault("getNode by id found another node");
        if (ic.getNodeHierarchy(node).empty() || ic.getNodeHierarchy(node, Node::ROOT).empty())
            findings.fault("empty hierarchy");
        std::string const printable = ic.pathToPrintablePath(path);
        if (printable.size() != 2 * path.size() || ic.printablePathToPath(printable) != path)
            findings.fault("path conversion does not round-trip");
    }
}

// The client's callback: runs on the plug-ins' threads.
Error reenter(std::vector<Alert> const& alerts, void const* context)
{
    ++findings.runs;
    thread_local char tag;
    std::vector<std::string> paths;
    for (Alert const& a : alerts)
        for (std::string const& p : a.nodePaths())
            paths.push_back(p);
    exercise(paths, &tag, 0);
    // Deregistering and registering itself again; other threads do the same
    // at the same time, so either may find the other's work done.
    facade->deRegisterForAlerts(reenter, Node::PowerSupply, context);
    CHECK_STATUS(facade->registerForAlerts(reenter, Node::PowerSupply, context));
    return ok();
}

TEST(FacadeReentry, CallbackCallingEveryOperationWhileAlertsFlowFinishes)
{
    setenv("IC_MI_DIR", SOAK_MI_DIR, 1);
    setenv("IC_FP_DIR", SOAK_FP_DIR, 1);
    Watchdog watchdog(kWatchdogSeconds, "the facade re-entry stress");
    soak::ErrorLog errors;

    for (int round = 0; round < 3; ++round) {
        SCOPED_TRACE("round " + std::to_string(round));
        IC::Error* error = nullptr;
        ASSERT_EQ(Open(&facade, &error), 0);
        ASSERT_NE(facade, nullptr);
        ASSERT_EQ(facade->registerForAlerts(reenter, Node::PowerSupply, &selfContext).getStatus(), 0);

        // The main thread keeps calling too, while the callbacks run.
        std::vector<Node*> nodes;
        ASSERT_EQ(facade->getMap(nodes, Node::PowerSupply).getStatus(), 0);
        ASSERT_FALSE(nodes.empty());
        std::vector<std::string> paths;
        for (Node* n : nodes)
            paths.push_back(facade->getNodeUniqueId(n));
        unsigned long const target = findings.runs.load() + kCallbackRuns;
        auto const deadline = Clock::now() + std::chrono::seconds(kRunSeconds);
        char mainTag = 0;
        while (findings.runs.load() < target && Clock::now() < deadline)
            exercise(paths, &mainTag, kMinNodes);
        EXPECT_GE(findings.runs.load(), target) << "too few callbacks ran in " << kRunSeconds << " s";

        // Unloading while the callbacks are still busy.
        Unloadlib();
        facade = nullptr;
    }

    EXPECT_GT(findings.checkedNodes.load(), 0u);
    EXPECT_EQ(findings.faults.load(), 0u);
    for (std::string const& m : findings.messages)
        ADD_FAILURE() << m;
    EXPECT_EQ(errors.count(), 0u) << "the library logged errors";
    for (std::string const& e : errors.first())
        ADD_FAILURE() << e;
}

} // namespace
