// ScriptedHttpServer: a TCP peer on 127.0.0.1 (port 0) for the answers and failures a real S3
// server does not give on demand. Each connection is stalled (accepted, never answered), reset,
// or read (headers and Content-Length body) and answered with the scripted response and
// closed, so every request is one connection.
//
// Runs its own thread from construction to destruction; the accessors may be called from any
// thread.
#pragma once

#include <atomic>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace testsupport {

class ScriptedHttpServer {
  public:
    enum class Mode { kStall, kReset, kRespond };
    explicit ScriptedHttpServer(Mode mode, std::string response = "");
    ~ScriptedHttpServer();
    ScriptedHttpServer(const ScriptedHttpServer&) = delete;
    ScriptedHttpServer& operator=(const ScriptedHttpServer&) = delete;

    int Port() const { return port_; }
    std::string Endpoint() const { return "http://127.0.0.1:" + std::to_string(port_); }
    int Connections() const { return connections_.load(); }
    std::string Request() const;  // the last request read, headers and body

  private:
    void Run();
    void Answer(int fd);

    const Mode mode_;
    const std::string response_;
    int listen_ = -1;
    int port_ = 0;
    int stop_[2] = {-1, -1};
    std::vector<int> held_;  // stalled connections, closed at the end
    std::atomic<int> connections_{0};
    mutable std::mutex mutex_;
    std::string request_;
    std::thread thread_;
};

// A whole HTTP/1.1 answer that closes the connection.
std::string HttpAnswer(const std::string& statusLine, const std::string& headers,
                       const std::string& body = "");
// An S3 error answer with its XML document.
std::string S3ErrorAnswer(const std::string& statusLine, const std::string& code);

}  // namespace testsupport
