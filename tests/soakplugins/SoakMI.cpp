// A well-behaved management interface for the soak and re-entry tests, built
// as several copies. SOAK_INDEX keeps each copy's nodes apart from the
// others'; with SOAK_THREADED the copy reports one more node from a thread of
// its own and raises alerts on it until shutdown().
#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ManagementInterface.h>
#include <IC/Node.h>
#include <IC/Number.h>

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

Error ok()
{
    return Error(0, IC::Number(IC::Number::Generic), "");
}

class SoakMI : public IC::ManagementInterface {
public:
    ~SoakMI() override { stopThread(); }

    Error getMap(std::vector<Node*>& nodes) override
    {
        for (auto const& node : nodes_)
            nodes.push_back(node.get());
        return ok();
    }

    Error Initialize(unsigned int base, IC::Number, IC::Number) override
    {
        std::string const name = "soak mi " + std::to_string(kIndex);
        base_ = base;
        nodes_.push_back(std::make_unique<Node>(Node::ROOT, kIndex, base | 1, 0, name + " root", 1));
        nodes_.push_back(
            std::make_unique<Node>(Node::Chassis, 0, base | 2, base | 1, name + " chassis", 2));
        nodes_.push_back(std::make_unique<Node>(Node::TemperatureSensor, 0, base | 3, base | 2,
                                                name + " temperature", 3));
        return ok();
    }

    Error registerForAlerts(IC::AlertCallBack callback, void const* context) override
    {
        alert_ = callback;
        alertContext_ = context;
#if SOAK_THREADED
        if (!thread_.joinable())
            thread_ = std::thread([this] { loop(); });
#endif
        return ok();
    }

    void registerNodeCallBacks(IC::NodeArrivalCallBack arrival, void const* context,
                               IC::NodeLookupCallBack lookup) override
    {
        arrival_ = arrival;
        arrivalContext_ = context;
        lookup_ = lookup;
    }

    Error shutdown() override
    {
        stopThread();
        return ok();
    }

    void release() override
    {
        stopThread();
        delete this;
    }

private:
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

    // Reports a fan, then raises alerts on it (asserted and cleared in turn)
    // and looks up its own root, until told to stop. The fan's path is read
    // only after the library has accepted it on this thread.
    void loop()
    {
        auto fan = std::make_unique<Node>(Node::Fan, kIndex, base_ | 0x10, base_ | 2,
                                          "soak mi fan", 0x10);
        bool const accepted = arrival_ != nullptr && arrival_(fan.get(), arrivalContext_).getStatus() == 0;
        std::string const fanPath = accepted ? fan->getPath() : std::string();
        {
            std::lock_guard<std::mutex> g(m_);
            extra_ = std::move(fan);
        }
        for (unsigned int turn = 0;; ++turn) {
            {
                std::unique_lock<std::mutex> g(m_);
                if (wake_.wait_for(g, std::chrono::milliseconds(1), [this] { return stop_; }))
                    return;
            }
            if (!fanPath.empty() && alert_ != nullptr) {
                std::vector<IC::Alert> batch;
                batch.emplace_back(2, static_cast<IC::Alert::ClassType>(2),
                                   std::vector<std::string>{fanPath}, turn % 2 ? 1u : 2u,
                                   "soak mi fan speed");
                alert_(batch, alertContext_);
            }
            if (lookup_ != nullptr && !fanPath.empty()) {
                Node* found = nullptr;
                lookup_(fanPath, &found);
            }
        }
    }

    unsigned int base_ = 0;
    std::vector<std::unique_ptr<Node> > nodes_;
    std::unique_ptr<Node> extra_;
    IC::AlertCallBack alert_ = nullptr;
    void const* alertContext_ = nullptr;
    IC::NodeArrivalCallBack arrival_ = nullptr;
    void const* arrivalContext_ = nullptr;
    IC::NodeLookupCallBack lookup_ = nullptr;
    std::mutex m_;
    std::condition_variable wake_;
    bool stop_ = false;
    std::thread thread_;
};

Error good(0, IC::Number(IC::Number::Generic), "");

} // namespace

extern "C" __attribute__((visibility("default"))) unsigned char OpenMI(IC::ManagementInterface** mi,
                                                                        IC::Error** err)
{
    *mi = new SoakMI;
    *err = &good;
    return 0;
}
