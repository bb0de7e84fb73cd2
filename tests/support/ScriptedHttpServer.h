// ScriptedHttpServer: a TCP peer on 127.0.0.1 (port 0) for the answers and failures a real
// server does not give on demand, and a stand-in for the services the credential sources ask
// (STS, the container endpoint, the instance metadata service). Each connection is stalled
// (accepted, never answered), reset, or read (headers and Content-Length body) and answered
// with the scripted response, or with what a handler makes of the request, and closed, so
// every request is one connection.
//
// Runs its own thread from construction to destruction; a handler runs on it. The accessors
// may be called from any thread.
#pragma once

#include <atomic>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace testsupport {

// One request as the server read it.
struct HttpRequestSeen {
    std::string raw;     // header block and body, as received
    std::string method;  // "PUT", "GET", ...
    std::string target;  // path and query, as sent
    std::string body;
    // The value of the first header `name` (any letter case), "" when absent.
    std::string Header(const std::string& name) const;
};

class ScriptedHttpServer {
  public:
    enum class Mode { kStall, kReset, kRespond };
    using Handler = std::function<std::string(const HttpRequestSeen&)>;
    explicit ScriptedHttpServer(Mode mode, std::string response = "");
    // Answers each request with what `handler` returns.
    explicit ScriptedHttpServer(Handler handler);
    ~ScriptedHttpServer();
    ScriptedHttpServer(const ScriptedHttpServer&) = delete;
    ScriptedHttpServer& operator=(const ScriptedHttpServer&) = delete;

    int Port() const { return port_; }
    std::string Endpoint() const { return "http://127.0.0.1:" + std::to_string(port_); }
    int Connections() const { return connections_.load(); }
    std::string Request() const;                    // the last request read, headers and body
    std::vector<HttpRequestSeen> Requests() const;  // every request read, in order

  private:
    void Start();
    void Run();
    void Answer(int fd);

    const Mode mode_;
    const Handler handler_;
    int listen_ = -1;
    int port_ = 0;
    int stop_[2] = {-1, -1};
    std::vector<int> held_;  // stalled connections, closed at the end
    std::atomic<int> connections_{0};
    mutable std::mutex mutex_;
    std::vector<HttpRequestSeen> requests_;  // guarded by mutex_
    std::thread thread_;
};

// A whole HTTP/1.1 answer that closes the connection.
std::string HttpAnswer(const std::string& statusLine, const std::string& headers,
                       const std::string& body = "");
// An S3 error answer with its XML document.
std::string S3ErrorAnswer(const std::string& statusLine, const std::string& code);

}  // namespace testsupport
