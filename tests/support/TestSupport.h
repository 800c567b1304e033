// Helpers every test program may use: log assertions, result and alert
// checks, scratch directories, environment guards and time limits.
#pragma once

#include "LogCapture.h"

#include <IC/Alert.h>
#include <IC/Error.h>
#include <IC/Number.h>

#include <gtest/gtest.h>

// The standard headers the test programs commonly need come with this one.
#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace ictest {

// Where a module's events come from: its logger and the source name it logs.
struct Source {
    std::string logger;
    std::string file;
};

// Exactly one event with this message on each channel, both with these fields
// and from the same line.
inline void expectEvent(LogCapture const& cap, Source const& src, std::string const& message,
                        int level, std::string const& function)
{
    std::vector<HGLog::Record> on[2];
    for (auto const& r : cap.records())
        if (r.message == message)
            on[r.channel == HGLog::Channel::Trace ? 1 : 0].push_back(r);
    ASSERT_EQ(on[0].size(), 1u) << "log channel: '" << message << "'";
    ASSERT_EQ(on[1].size(), 1u) << "trace channel: '" << message << "'";
    for (auto const& r : {on[0][0], on[1][0]}) {
        EXPECT_EQ(r.level, level) << message;
        EXPECT_EQ(r.function, function) << message;
        EXPECT_EQ(r.logger, src.logger) << message;
        EXPECT_EQ(r.file, src.file) << message;
    }
    EXPECT_EQ(on[0][0].line, on[1][0].line) << message;
    EXPECT_GT(on[0][0].line, 0) << message;
}

// The result's status, code and text.
inline void expectError(IC::Error const& e, unsigned char status,
                        IC::Number const& code = IC::Number(IC::Number::Generic),
                        std::string const& text = std::string())
{
    EXPECT_EQ(e.getStatus(), status);
    EXPECT_EQ(e.getCode(), code);
    EXPECT_EQ(e.getText(), text);
}

inline std::string errText(IC::Error const& e) { return static_cast<std::string>(e); }

// Lower-case hexadecimal, written here independently of the library.
inline std::string hex(std::string const& s)
{
    static char const digits[] = "0123456789abcdef";
    std::string out;
    for (unsigned char c : s)
        out += std::string{digits[c >> 4], digits[c & 15]};
    return out;
}

// An alert without its time stamp: "severity/class/status/message/paths",
// the paths in hexadecimal, each followed by a comma.
inline std::string sig(IC::Alert const& a)
{
    std::string s = std::to_string(a.getSeverity()) + "/" + std::to_string(a.getClass()) + "/" +
                    std::to_string(a.getStatus()) + "/" + a.getMessage() + "/";
    for (auto const& p : a.nodePaths())
        s += hex(p) + ",";
    return s;
}
inline std::vector<std::string> sigs(std::vector<IC::Alert> const& alerts)
{
    std::vector<std::string> out;
    for (auto const& a : alerts)
        out.push_back(sig(a));
    return out;
}

// How the library writes a pointer into a log line.
inline std::string ptrText(void const* p)
{
    std::ostringstream os;
    os << p;
    return os.str();
}

// A fresh directory under /tmp, removed with everything in it.
class TempDir {
public:
    explicit TempDir(std::string const& prefix = "ictest")
    {
        std::string tmpl = "/tmp/" + prefix + "-XXXXXX";
        if (mkdtemp(tmpl.data()) == nullptr)
            throw std::runtime_error("mkdtemp failed");
        root_ = tmpl;
    }
    ~TempDir()
    {
        std::error_code ec;
        std::filesystem::remove_all(root_, ec);
    }
    TempDir(TempDir const&) = delete;
    TempDir& operator=(TempDir const&) = delete;

    std::string root() const { return root_; }
    std::string path(std::string const& name) const { return root_ + "/" + name; }
    std::string write(std::string const& name, std::string const& content = std::string()) const
    {
        std::ofstream(path(name), std::ios::binary) << content;
        return path(name);
    }

private:
    std::string root_;
};

// Restores an environment variable when it goes; sets it first when given a
// value.
class EnvGuard {
public:
    explicit EnvGuard(char const* name) : name_(name)
    {
        if (char const* v = std::getenv(name))
            saved_ = v;
    }
    EnvGuard(char const* name, std::string const& value) : EnvGuard(name) { setenv(name, value.c_str(), 1); }
    ~EnvGuard() { saved_ ? setenv(name_.c_str(), saved_->c_str(), 1) : unsetenv(name_.c_str()); }
    EnvGuard(EnvGuard const&) = delete;
    EnvGuard& operator=(EnvGuard const&) = delete;

private:
    std::string name_;
    std::optional<std::string> saved_;
};

// A thread that is joined when it goes.
struct JoinedThread : std::thread {
    using std::thread::thread;
    JoinedThread(JoinedThread&&) = default;
    ~JoinedThread()
    {
        if (joinable())
            join();
    }
};

// True when another thread can take the lock m (an SD::Mutex) right now.
template <class Lock>
bool lockableFromAnotherThread(Lock& m)
{
    bool taken = false;
    JoinedThread([&] {
        if ((taken = m.try_lock()))
            m.unlock();
    }).join();
    return taken;
}

// A file's bytes; the standard output of a shell command; a text's lines.
inline std::string slurp(std::filesystem::path const& file)
{
    std::ifstream in(file, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
}
inline std::string run(std::string const& command)
{
    std::string out;
    if (FILE* p = ::popen(command.c_str(), "r")) {
        char buf[4096];
        for (std::size_t n; (n = std::fread(buf, 1, sizeof buf, p)) > 0;)
            out.append(buf, n);
        ::pclose(p);
    }
    return out;
}
inline std::vector<std::string> lines(std::string const& text)
{
    std::vector<std::string> out;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);)
        out.push_back(line);
    return out;
}

// Polls until pred holds; false when ms passed first.
template <class Pred>
bool eventually(Pred pred, int ms = 5000)
{
    auto const end = std::chrono::steady_clock::now() + std::chrono::milliseconds(ms);
    for (; !pred(); std::this_thread::sleep_for(std::chrono::milliseconds(2)))
        if (std::chrono::steady_clock::now() > end)
            return false;
    return true;
}

// Aborts the process when a test that could deadlock has not finished in
// time: a hung test would otherwise only show as a time-out of the runner.
class Watchdog {
public:
    Watchdog(int seconds, std::string what) : what_(std::move(what))
    {
        thread_ = std::thread([this, seconds] {
            std::unique_lock<std::mutex> g(m_);
            if (!cv_.wait_for(g, std::chrono::seconds(seconds), [this] { return done_; })) {
                std::fprintf(stderr, "watchdog: %s did not finish\n", what_.c_str());
                std::abort();
            }
        });
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

private:
    std::string what_;
    std::mutex m_;
    std::condition_variable cv_;
    bool done_ = false;
    std::thread thread_;
};

} // namespace ictest
