// icd's HTTP side: one server per listen address, read-only routes, the
// limits that keep a hostile or stuck client from hurting anyone else.
#pragma once

#include "AlertFeed.h"
#include "EventRing.h"
#include "EventStreams.h"
#include "WebConfig.h"

#include <IC/InstrumentationControl.h>

#include <atomic>
#include <chrono>
#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace httplib {
class Server;
struct Request;
struct Response;
} // namespace httplib

namespace icd {

struct ServiceOptions {
    std::vector<std::string> listen{"127.0.0.1:9847"}; // ADDR:PORT each
    std::size_t maxConnections = 64; // served at once per address; more wait
    std::size_t maxSubscribers = 32; // event streams at once, over all addresses
    std::chrono::milliseconds keepAlive{15000}; // comment on an idle stream
    WebConfig web;
};

class HttpService {
public:
    HttpService(IC::InstrumentationControl& ic, AlertFeed& feed, EventRing& ring,
                ServiceOptions options);
    ~HttpService();
    HttpService(HttpService const&) = delete;
    HttpService& operator=(HttpService const&) = delete;

    // Binds every address and starts serving; returns the URLs. Throws
    // std::runtime_error when an address cannot be bound.
    std::vector<std::string> start();
    // Stops accepting, ends the event streams and joins the servers.
    void stop();

private:
    void addRoutes(httplib::Server& server);
    bool admit(httplib::Request const& req, httplib::Response& res) const;
    void metrics(httplib::Response& res);
    void tree(httplib::Response& res);
    void node(httplib::Request const& req, httplib::Response& res);
    void alerts(httplib::Response& res);
    void events(httplib::Request const& req, httplib::Response& res);

    IC::InstrumentationControl& ic_;
    AlertFeed& feed_;
    EventRing& ring_;
    ServiceOptions const options_;
    std::atomic<std::size_t> subscribers_{0};
    std::unique_ptr<EventStreams> streams_; // plain-HTTP subscribers; TLS ones keep their thread
    std::vector<std::unique_ptr<httplib::Server>> servers_;
    std::vector<std::thread> threads_;
};

// Splits "ADDR:PORT" ("[::1]:9847" for IPv6); throws std::invalid_argument.
void splitListen(std::string const& text, std::string* host, int* port);
// 127.0.0.0/8, ::1 and localhost.
bool isLoopback(std::string const& host);

} // namespace icd
