#include <SD/DateTime.h>

#include <chrono>
#include <cstdio>
#include <ctime>

namespace SD {

DateTime::DateTime()
    : us_(std::chrono::duration_cast<std::chrono::microseconds>(
              std::chrono::system_clock::now().time_since_epoch())
              .count())
{
}

DateTime DateTime::fromEpochMicroseconds(std::int64_t us)
{
    return DateTime(FromValue{}, us);
}

std::string DateTime::toIso8601() const
{
    std::int64_t const secs = getEpochSeconds();
    auto const micros = static_cast<long>(us_ - secs * 1000000);
    std::time_t const t = static_cast<std::time_t>(secs);
    std::tm tm{};
    gmtime_r(&t, &tm);
    char buf[96];
    std::snprintf(buf, sizeof buf, "%04d-%02d-%02dT%02d:%02d:%02d.%06ldZ", tm.tm_year + 1900,
                  tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, micros);
    return buf;
}

} // namespace SD
