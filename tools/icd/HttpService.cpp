#include "HttpService.h"

#include "Escape.h"
#include "Forest.h"
#include "Log.h"
#include "Metrics.h"
#include "Output.h"
#include "Page.h"
#include "WorkerPool.h"

#include <IC/InstCtrl.h>
#include <SD/Mutex.h>

#include <httplib.h>

#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cctype>
#include <functional>
#include <stdexcept>

namespace icd {
namespace {

constexpr std::size_t kMaxHeaders = 64;
constexpr std::size_t kMaxPayload = 8 * 1024;
constexpr std::size_t kMaxPathText = 512;
constexpr int kTimeoutSeconds = 5; // to read a request, to write a response

void jsonError(httplib::Response& res, int status, std::string const& message)
{
    res.status = status;
    res.set_content(ictools::jsonLine(ictools::Json{{"error", message}, {"status", status}}) + "\n",
                    "application/json");
}

char const* reason(int status)
{
    switch (status) {
    case 400: return "bad request";
    case 401: return "authentication required";
    case 404: return "not found";
    case 405: return "only GET and HEAD are served";
    case 413: return "request too large";
    case 414: return "request target too long";
    case 431: return "too many request headers";
    case 503: return "too many event stream subscribers";
    default: return "request refused";
    }
}

// httplib listens with a backlog of 5: a burst of clients (a hundred event
// streams reconnecting after a restart) would wait for SYN retries of 1 s
// and more. Listening again on the bound socket widens the queue; through a
// duplicate, so that only httplib ever uses its own descriptor.
template <class Base>
class Listener : public Base {
public:
    using Base::Base;
    void widenBacklog()
    {
        int const own = fcntl(this->svr_sock_, F_DUPFD_CLOEXEC, 0);
        if (own >= 0) {
            ::listen(own, SOMAXCONN);
            ::close(own);
        }
    }
};

} // namespace

void splitListen(std::string const& text, std::string* host, int* port)
{
    auto const colon = text.rfind(':');
    if (colon == std::string::npos || colon == 0 || colon + 1 == text.size())
        throw std::invalid_argument("'" + text + "' is not ADDR:PORT");
    std::string h = text.substr(0, colon);
    if (h.size() >= 2 && h.front() == '[' && h.back() == ']')
        h = h.substr(1, h.size() - 2);
    std::string const p = text.substr(colon + 1);
    if (p.size() > 5 || p.find_first_not_of("0123456789") != std::string::npos ||
        std::stoi(p) > 65535)
        throw std::invalid_argument("'" + text + "': the port is not 0..65535");
    *host = h;
    *port = std::stoi(p);
}

bool isLoopback(std::string const& host)
{
    return host == "localhost" || host == "::1" || host.rfind("127.", 0) == 0;
}

HttpService::HttpService(IC::InstrumentationControl& ic, AlertFeed& feed, EventRing& ring,
                         ServiceOptions options)
    : ic_(ic), feed_(feed), ring_(ring), options_(std::move(options))
{
}

HttpService::~HttpService()
{
    stop();
}

std::vector<std::string> HttpService::start()
{
    std::vector<std::string> urls;
    for (std::string const& listen : options_.listen) {
        std::string host;
        int port = 0;
        splitListen(listen, &host, &port);
        std::unique_ptr<httplib::Server> server;
        std::function<void()> widen;
        if (options_.web.tls()) {
            auto tls = std::make_unique<Listener<httplib::SSLServer>>(
                options_.web.certFile().c_str(), options_.web.keyFile().c_str());
            widen = [s = tls.get()] { s->widenBacklog(); };
            server = std::move(tls);
        } else {
            auto plain = std::make_unique<Listener<httplib::Server>>();
            widen = [s = plain.get()] { s->widenBacklog(); };
            server = std::move(plain);
        }
        if (!server->is_valid())
            throw std::runtime_error("cannot use the TLS certificate or key of the web configuration");
        std::size_t const workers = options_.maxConnections;
        server->new_task_queue = [workers] { return new WorkerPool(workers, workers); };
        server->set_payload_max_length(kMaxPayload);
        server->set_tcp_nodelay(true); // a response is one write; waiting for an ACK costs 40 ms
        server->set_keep_alive_max_count(100);
        server->set_keep_alive_timeout(5);
        server->set_read_timeout(kTimeoutSeconds);
        server->set_write_timeout(kTimeoutSeconds);
        if (host.find(':') != std::string::npos)
            server->set_address_family(AF_INET6);
        addRoutes(*server);
        int const bound = port == 0 ? server->bind_to_any_port(host) : port;
        if (bound < 0 || (port != 0 && !server->bind_to_port(host, port)))
            throw std::runtime_error("cannot listen on " + listen);
        widen();
        std::string const shown = host.find(':') != std::string::npos ? "[" + host + "]" : host;
        urls.push_back((options_.web.tls() ? "https://" : "http://") + shown + ":" +
                       std::to_string(bound) + "/");
        servers_.push_back(std::move(server));
    }
    streams_ = std::make_unique<EventStreams>(ring_, options_.keepAlive,
                                              std::chrono::seconds(kTimeoutSeconds));
    for (auto& s : servers_)
        threads_.emplace_back([server = s.get()] { server->listen_after_bind(); });
    return urls;
}

void HttpService::stop()
{
    ring_.close(); // ends every event stream's wait
    if (streams_)
        streams_->stop();
    for (auto& s : servers_)
        s->stop();
    for (std::thread& t : threads_)
        t.join();
    threads_.clear();
    servers_.clear();
    streams_.reset();
}

bool HttpService::admit(httplib::Request const& req, httplib::Response& res) const
{
    if (req.method != "GET" && req.method != "HEAD") {
        res.set_header("Allow", "GET, HEAD");
        jsonError(res, 405, reason(405));
        return false;
    }
    if (req.headers.size() > kMaxHeaders) {
        jsonError(res, 431, reason(431));
        return false;
    }
    if (options_.web.authRequired() &&
        !options_.web.authorized(req.get_header_value("Authorization"))) {
        res.set_header("WWW-Authenticate", "Basic realm=\"icd\", charset=\"UTF-8\"");
        jsonError(res, 401, reason(401));
        return false;
    }
    return true;
}

void HttpService::addRoutes(httplib::Server& server)
{
    server.set_pre_routing_handler([this](httplib::Request const& req, httplib::Response& res) {
        return admit(req, res) ? httplib::Server::HandlerResponse::Unhandled
                               : httplib::Server::HandlerResponse::Handled;
    });
    // Every refusal, from a route or from the parser, gets a JSON body.
    server.set_error_handler([](httplib::Request const&, httplib::Response& res) {
        if (res.body.empty())
            jsonError(res, res.status, reason(res.status));
    });
    server.set_logger([](httplib::Request const& req, httplib::Response const& res) {
        if (res.status >= 400)
            ICD_LOG(4000, req.remote_addr, " ", ictools::escapeText(req.method), " ",
                    ictools::escapeText(req.path.substr(0, kMaxPathText)), ": ", res.status);
    });
    server.set_exception_handler(
        [](httplib::Request const&, httplib::Response& res, std::exception_ptr ep) {
            try {
                std::rethrow_exception(ep);
            } catch (std::exception const& e) {
                ICD_LOG(6000, "request failed: ", e.what());
            } catch (...) {
                ICD_LOG(6000, "request failed");
            }
            jsonError(res, 500, "internal error");
        });
    server.Get("/", [](httplib::Request const&, httplib::Response& res) {
        res.set_content(kPage, "text/html; charset=utf-8");
    });
    server.Get("/metrics", [this](httplib::Request const&, httplib::Response& res) { metrics(res); });
    server.Get("/api/v1/nodes", [this](httplib::Request const&, httplib::Response& res) { tree(res); });
    server.Get(R"(/api/v1/nodes/(.*))",
               [this](httplib::Request const& req, httplib::Response& res) { node(req, res); });
    server.Get("/api/v1/alerts", [this](httplib::Request const&, httplib::Response& res) { alerts(res); });
    server.Get("/api/v1/events",
               [this](httplib::Request const& req, httplib::Response& res) { events(req, res); });
}

void HttpService::metrics(httplib::Response& res)
{
    std::string body;
    {
        SD::MutexGuard guard(IC::InstCtrl::loadlock); // no plug-in leaves while its nodes are read
        body = renderMetrics(ic_, feed_);
    }
    res.set_content(body, "text/plain; version=0.0.4; charset=utf-8");
}

void HttpService::tree(httplib::Response& res)
{
    std::string body;
    {
        SD::MutexGuard guard(IC::InstCtrl::loadlock);
        std::vector<IC::Node*> nodes;
        ic_.getAllNodes(nodes);
        ictools::Forest const forest(nodes);
        forest.writeJson(ic_, [&body](std::string const& piece) { body += piece; });
    }
    res.set_content(body, "application/json");
}

void HttpService::node(httplib::Request const& req, httplib::Response& res)
{
    std::string const text = req.matches[1];
    if (text.empty() || text.size() > kMaxPathText || text.size() % 2 != 0 ||
        text.find_first_not_of("0123456789abcdefABCDEF") != std::string::npos) {
        jsonError(res, 400, "malformed node path (give the hexadecimal path /api/v1/nodes shows)");
        return;
    }
    std::string body;
    {
        SD::MutexGuard guard(IC::InstCtrl::loadlock);
        std::string path;
        try {
            path = ic_.printablePathToPath(text);
        } catch (std::invalid_argument const& e) {
            jsonError(res, 400, std::string("malformed node path: ") + e.what());
            return;
        }
        IC::Node* node = nullptr;
        if (ic_.getNode(path, &node).getStatus() != 0 || !node) {
            jsonError(res, 404, "no node at path " + ic_.pathToPrintablePath(path));
            return;
        }
        std::vector<IC::Node*> nodes;
        ic_.getAllNodes(nodes);
        ictools::Forest const forest(nodes);
        std::vector<IC::Alert> asserted;
        ic_.getAssertedAlerts(asserted);
        body = ictools::jsonLine(ictools::showJson(ic_, *node, forest.children(node), asserted));
    }
    res.set_content(body + "\n", "application/json");
}

void HttpService::alerts(httplib::Response& res)
{
    std::string body;
    {
        SD::MutexGuard guard(IC::InstCtrl::loadlock);
        std::vector<IC::Alert> asserted;
        ic_.getAssertedAlerts(asserted);
        body = ictools::jsonLine(ictools::alertListJson(ic_, asserted));
    }
    res.set_content(body + "\n", "application/json");
}

void HttpService::events(httplib::Request const& req, httplib::Response& res)
{
    std::uint64_t after = ring_.lastId();
    if (req.has_header("Last-Event-ID")) {
        std::string const last = req.get_header_value("Last-Event-ID");
        if (last.empty() || last.size() > 19 ||
            last.find_first_not_of("0123456789") != std::string::npos) {
            jsonError(res, 400, "Last-Event-ID is not an event id");
            return;
        }
        after = std::stoull(last);
        if (after > ring_.lastId())
            after = 0; // an id of an earlier run: everything still held
    }
    if (subscribers_.fetch_add(1) >= options_.maxSubscribers) {
        subscribers_.fetch_sub(1);
        jsonError(res, 503, reason(503));
        return;
    }
    res.set_header("Cache-Control", "no-cache");
    res.set_header("X-Accel-Buffering", "no");
    // A plain connection's socket goes to the one writer; TLS has to write
    // through the connection's own session, so it keeps its thread, as does
    // every stream when the writer could not start.
    int const fd = req.ssl || !streams_->running() ? -1
                           : connectionSocket(req.local_addr, req.local_port, req.remote_addr,
                                              req.remote_port);
    auto next = std::make_shared<std::uint64_t>(after);
    res.set_chunked_content_provider(
        "text/event-stream",
        [this, next, fd](std::size_t offset, httplib::DataSink& sink) {
            if (offset == 0) {
                // At once, so that the client knows the stream is open.
                static char const opened[] = ": connected\nretry: 2000\n\n";
                return sink.write(opened, sizeof opened - 1);
            }
            if (fd >= 0) {
                if (streams_->serve(fd, *next) == EventStreams::Outcome::Gone)
                    return false;
                sink.done();
                return true;
            }
            std::vector<Event> events;
            std::uint64_t missed = 0;
            if (!ring_.readAfter(*next, options_.keepAlive, events, &missed)) {
                sink.done();
                return true;
            }
            std::string out;
            appendEventText(out, events, missed);
            if (out.empty())
                out = ": keep-alive\n\n";
            if (!events.empty())
                *next = events.back().id;
            else if (missed != 0)
                *next += missed;
            return sink.write(out.data(), out.size());
        },
        [this](bool) { subscribers_.fetch_sub(1); });
}

} // namespace icd
