// Stand-ins for the library's callbacks and services, for tests that drive
// the loaders directly: they record what they are called with, and each one
// is a distinct function so that a test can tell which one a plug-in got.
#pragma once

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/ICforFP.h>
#include <IC/Node.h>
#include <IC/Number.h>

#include <gtest/gtest.h>

#include <mutex>
#include <string>
#include <vector>

namespace ictest {

struct AlertCall {
    std::vector<IC::Alert> alerts;
    void const* context;
};

// What recAlert was called with, and what it answers.
class Recorder {
public:
    static Recorder& get()
    {
        static Recorder r;
        return r;
    }
    void reset(IC::Error const& result = IC::Error(0, IC::Number(IC::Number::Generic), ""))
    {
        std::lock_guard<std::mutex> g(m_);
        calls_.clear();
        result_ = result;
    }
    IC::Error add(std::vector<IC::Alert> const& alerts, void const* context)
    {
        std::lock_guard<std::mutex> g(m_);
        calls_.push_back(AlertCall{alerts, context});
        return result_;
    }
    // The calls so far; those with one context when one is given.
    std::vector<AlertCall> calls(void const* context = nullptr) const
    {
        std::lock_guard<std::mutex> g(m_);
        std::vector<AlertCall> out;
        for (auto const& c : calls_)
            if (context == nullptr || c.context == context)
                out.push_back(c);
        return out;
    }

private:
    mutable std::mutex m_;
    std::vector<AlertCall> calls_;
    IC::Error result_{0, IC::Number(IC::Number::Generic), ""};
};

inline IC::Error recAlert(std::vector<IC::Alert> const& alerts, void const* context)
{
    return Recorder::get().add(alerts, context);
}
inline IC::Error answer(unsigned char status, unsigned int code, char const* text)
{
    return IC::Error(status, IC::Number(code), text);
}
inline IC::Error recArrival(IC::Node* const&, void const*) { return answer(0, 101, "arrival"); }
inline IC::Error recLookup(std::string const&, IC::Node**) { return answer(1, 102, "lookup"); }

// The services for FPs loaded directly: the test plug-ins these tests load
// call only the announcement; the alert entry tells the services apart.
inline IC::Error svAlert(std::vector<IC::Alert> const&) { return answer(0, 203, "alert"); }
inline IC::Error svMapNode(IC::Node* const&) { return answer(0, 205, "map node"); }

inline IC::ICforFP makeServices(std::vector<IC::ManagementInterface*> const& mis,
                                IC::InstrumentationControl* facade)
{
    IC::NodeAnnouncement const announce = &svMapNode;
    return IC::ICforFP(mis, nullptr, nullptr, &svAlert, nullptr, IC::Number(IC::Version2{1, 0}),
                       IC::Number(IC::Version2{2, 3}), announce, facade, nullptr, nullptr);
}

} // namespace ictest
