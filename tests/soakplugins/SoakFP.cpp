// A well-behaved functional plug-in for the soak and re-entry tests, built as
// several copies. SOAK_INDEX keeps each copy's node apart from the others'.
// Each announces one node of its own and registers, through its ICforFP, for
// the alerts on it; with SOAK_THREADED it raises alerts on that node from a
// thread of its own until release().
//
// Only this plug-in raises alerts on its node, and release() stops its thread
// before it deregisters: no alert can still be on its way to this library
// once it is closed.
#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/FunctionalPlugIn.h>
#include <IC/ICforFP.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#ifndef SOAK_INDEX
#error "SOAK_INDEX must be set"
#endif

namespace {

using IC::Error;
using IC::Node;

constexpr unsigned int kIndex = SOAK_INDEX;

// Alerts this copy's registrations received, over every object it made.
std::atomic<unsigned long> receivedTotal{0};

Error ok()
{
    return Error(0, IC::Number(IC::Number::Generic), "");
}

class SoakFP : public IC::FunctionalPlugIn {
public:
    ~SoakFP() override { stopThread(); }

    Error getMap(std::vector<Node*>& nodes) override
    {
        nodes.push_back(node_.get());
        return ok();
    }

    Error Initialize(unsigned int base, IC::ICforFP const& services) override
    {
        node_ = std::make_unique<Node>(Node::PowerSupply, 100 + kIndex, base | 1, 0,
                                       "soak fp " + std::to_string(kIndex) + " supply", 1);
        Error announced = services.getMapNewFPNode()(node_.get());
        if (announced.getStatus() != 0)
            return announced;
        path_ = node_->getPath();
        raise_ = services.getAlertCallBackFP();
        deRegister_ = services.getDeRegFPAlerts();
        Error registered = services.getRegFPAlerts()(&SoakFP::received,
                                                     std::vector<std::string>{path_}, this);
        if (registered.getStatus() != 0)
            return registered;
        // Recorded without delivery: what getAssertedAlerts shows from the start.
        std::vector<IC::Alert> initial;
        initial.emplace_back(3, static_cast<IC::Alert::ClassType>(2),
                             std::vector<std::string>{path_}, 2u, "soak fp supply degraded");
        services.getAssertCallBackFP()(initial);
#if SOAK_THREADED
        thread_ = std::thread([this] { loop(); });
#endif
        return ok();
    }

    Error updatedMis(std::vector<IC::ManagementInterface*> const&,
                     std::vector<IC::ManagementInterface*> const&) override
    {
        return ok();
    }

    void release() override
    {
        stopThread();
        if (deRegister_ != nullptr)
            deRegister_(&SoakFP::received, std::vector<std::string>{path_}, this);
        delete this;
    }

private:
    static Error received(std::vector<IC::Alert> const& alerts, void const* context)
    {
        if (context == nullptr)
            return Error(1, IC::Number(IC::Number::Generic), "no context");
        receivedTotal += alerts.size();
        return ok();
    }

    void stopThread()
    {
        {
            std::lock_guard<std::mutex> g(m_);
            stop_ = true;
        }
        wake_.notify_all();
        if (thread_.joinable())
            thread_.join();
    }

    // Raises an alert on the plug-in's node, asserted and cleared in turn.
    void loop()
    {
        for (unsigned int turn = 0;; ++turn) {
            std::vector<IC::Alert> batch;
            batch.emplace_back(3, static_cast<IC::Alert::ClassType>(2),
                               std::vector<std::string>{path_}, turn % 2 ? 1u : 2u,
                               "soak fp supply");
            raise_(batch);
            std::unique_lock<std::mutex> g(m_);
            if (wake_.wait_for(g, std::chrono::milliseconds(1), [this] { return stop_; }))
                return;
        }
    }

    std::unique_ptr<Node> node_;
    std::string path_;
    IC::AlertSink raise_ = nullptr;
    IC::PathAlertRegistration deRegister_ = nullptr;
    std::mutex m_;
    std::condition_variable wake_;
    bool stop_ = false;
    std::thread thread_;
};

Error good(0, IC::Number(IC::Number::Generic), "");

} // namespace

// For the tests: how many alerts reached this copy's registrations.
extern "C" __attribute__((visibility("default"))) unsigned long soak_fp_received()
{
    return receivedTotal.load();
}

extern "C" __attribute__((visibility("default"))) unsigned char OpenFP(IC::FunctionalPlugIn** fp,
                                                                        IC::Error** err)
{
    *fp = new SoakFP;
    *err = &good;
    return 0;
}
