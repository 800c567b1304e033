// Stand-ins for the library's callbacks and services, for tests that drive
// the loaders directly: they record what they are called with, and each one
// is a distinct function so that a test can tell which one a plug-in got.
#pragma once

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ICforFP.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <mutex>
#include <string>
#include <utility>
#include <vector>

namespace ictest {

struct AlertCall {
    std::vector<IC::Alert> alerts;
    void const* context;
};

class Recorder {
public:
    static Recorder& get()
    {
        static Recorder r;
        return r;
    }
    void reset()
    {
        std::lock_guard<std::mutex> g(m_);
        calls_.clear();
        result_ = IC::Error(0, IC::Number(IC::Number::Generic), "");
    }
    void setAlertResult(IC::Error const& e)
    {
        std::lock_guard<std::mutex> g(m_);
        result_ = e;
    }
    IC::Error add(std::vector<IC::Alert> const& alerts, void const* context)
    {
        std::lock_guard<std::mutex> g(m_);
        calls_.push_back(AlertCall{alerts, context});
        return result_;
    }
    std::vector<AlertCall> calls() const
    {
        std::lock_guard<std::mutex> g(m_);
        return calls_;
    }

private:
    Recorder() : result_(0, IC::Number(IC::Number::Generic), "") {}
    mutable std::mutex m_;
    std::vector<AlertCall> calls_;
    IC::Error result_;
};

inline IC::Error recAlert(std::vector<IC::Alert> const& alerts, void const* context)
{
    return Recorder::get().add(alerts, context);
}
inline IC::Error recArrival(IC::Node* const&, void const*)
{
    return IC::Error(0, IC::Number(101u), "arrival");
}
inline IC::Error recLookup(std::string const&, IC::Node**)
{
    return IC::Error(1, IC::Number(102u), "lookup");
}

// The eleven services, each distinct.
inline IC::Error svRegPath(IC::AlertCallBack, std::vector<std::string> const&, void const*)
{
    return IC::Error(0, IC::Number(201u), "reg path");
}
inline IC::Error svDeRegPath(IC::AlertCallBack, std::vector<std::string> const&, void const*)
{
    return IC::Error(0, IC::Number(202u), "dereg path");
}
inline IC::Error svAlert(std::vector<IC::Alert> const&)
{
    return IC::Error(0, IC::Number(203u), "alert");
}
inline IC::Error svAssert(std::vector<IC::Alert> const&)
{
    return IC::Error(0, IC::Number(204u), "assert");
}
inline IC::Error svMapNode(IC::Node* const&)
{
    return IC::Error(0, IC::Number(205u), "map node");
}
inline IC::Error svRegSensor(IC::AlertCallBack, IC::Node::SensorType, void const*)
{
    return IC::Error(0, IC::Number(206u), "reg sensor");
}
inline IC::Error svDeRegSensor(IC::AlertCallBack, IC::Node::SensorType, void const*)
{
    return IC::Error(0, IC::Number(207u), "dereg sensor");
}

inline IC::ICforFP makeServices(std::vector<IC::ManagementInterface*> const& mis,
                                IC::InstrumentationControl* facade)
{
    IC::NodeAnnouncement const announce = &svMapNode;
    return IC::ICforFP(mis, &svRegPath, &svDeRegPath, &svAlert, &svAssert,
                       IC::Number(IC::Version2{1, 0}), IC::Number(IC::Version2{2, 3}), announce,
                       facade, &svRegSensor, &svDeRegSensor);
}

} // namespace ictest
