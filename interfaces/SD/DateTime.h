// SD::DateTime: a point in time (UTC) with microsecond resolution.
#pragma once

#include <IC/CommonExport.h>

#include <cstdint>
#include <string>

namespace SD {

class ICCOMMON_API DateTime {
public:
    // Now.
    DateTime();
    // A given instant, in microseconds since the Unix epoch.
    static DateTime fromEpochMicroseconds(std::int64_t us);

    std::int64_t getEpochSeconds() const { return us_ / 1000000 - (us_ % 1000000 < 0 ? 1 : 0); }
    std::int64_t getEpochMicroseconds() const { return us_; }
    // "2026-11-21T05:50:12.345678Z"
    std::string toIso8601() const;

    bool operator==(DateTime const& o) const { return us_ == o.us_; }
    bool operator!=(DateTime const& o) const { return us_ != o.us_; }
    bool operator<(DateTime const& o) const { return us_ < o.us_; }
    bool operator<=(DateTime const& o) const { return us_ <= o.us_; }
    bool operator>(DateTime const& o) const { return us_ > o.us_; }
    bool operator>=(DateTime const& o) const { return us_ >= o.us_; }

private:
    struct FromValue {};
    DateTime(FromValue, std::int64_t us) : us_(us) {}
    std::int64_t us_;
};

} // namespace SD
