// ScriptedHttpServer: a TCP peer on 127.0.0.1 for the answers and failures a real server does not
// give on demand, and a stand-in for STS, the container endpoint and the instance metadata
// service. Each connection is stalled (accepted, never answered), reset, or read (headers and
// Content-Length body) and answered with what the handler makes of the request, then closed: one
// request per connection. Its thread (which runs the handler) lives as long as the object; the
// accessors may be called from any thread.
#pragma once

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <strings.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <exception>
#include <functional>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

namespace testsupport {

// One request as the server read it.
struct HttpRequestSeen {
    std::string raw;                   // header block and body, as received
    std::string method, target, body;  // target: path and query, as sent
    // The value of the first header `name` (any letter case), "" when absent.
    std::string Header(const std::string& name) const {
        const size_t headEnd = raw.find("\r\n\r\n");
        for (size_t at = raw.find("\r\n"); at < headEnd; at = raw.find("\r\n", at + 2)) {
            const std::string line = raw.substr(at + 2, raw.find("\r\n", at + 2) - at - 2);
            if (line.size() > name.size() && line[name.size()] == ':' &&
                strncasecmp(line.c_str(), name.c_str(), name.size()) == 0) {
                const size_t value = line.find_first_not_of(" \t", name.size() + 1);
                return value == std::string::npos ? "" : line.substr(value);
            }
        }
        return "";
    }
};

class ScriptedHttpServer {
  public:
    enum class Mode { kStall, kReset, kRespond };
    using Handler = std::function<std::string(const HttpRequestSeen&)>;
    explicit ScriptedHttpServer(Mode mode, std::string response = "")
        : mode_(mode), handler_([response](const HttpRequestSeen&) { return response; }) {
        Start();
    }
    explicit ScriptedHttpServer(Handler handler)
        : mode_(Mode::kRespond), handler_(std::move(handler)) {
        Start();
    }
    ~ScriptedHttpServer() {
        if (write(stop_[1], "x", 1) < 0) std::terminate();  // a pipe with room: cannot fail
        thread_.join();
        for (int fd : held_) close(fd);
        for (int fd : {listen_, stop_[0], stop_[1]}) close(fd);
    }
    ScriptedHttpServer(const ScriptedHttpServer&) = delete;
    ScriptedHttpServer& operator=(const ScriptedHttpServer&) = delete;

    int Port() const { return port_; }
    std::string Endpoint() const { return "http://127.0.0.1:" + std::to_string(port_); }
    int Connections() const { return connections_.load(); }
    std::vector<HttpRequestSeen> Requests() const {  // every request read, in order
        std::lock_guard<std::mutex> lock(mutex_);
        return requests_;
    }

  private:
    void Start() {
        listen_ = socket(AF_INET, SOCK_STREAM, 0);
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof address;
        if (bind(listen_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
            listen(listen_, 8) != 0 ||
            getsockname(listen_, reinterpret_cast<sockaddr*>(&address), &length) != 0 ||
            pipe(stop_) != 0)
            throw std::runtime_error("scripted server cannot listen");
        port_ = ntohs(address.sin_port);
        thread_ = std::thread([this] { Run(); });
    }

    void Run() {
        while (true) {
            pollfd fds[2] = {{listen_, POLLIN, 0}, {stop_[0], POLLIN, 0}};
            if (poll(fds, 2, -1) < 0 || fds[1].revents != 0) return;
            int fd = accept(listen_, nullptr, nullptr);
            if (fd < 0) continue;
            ++connections_;
            if (mode_ == Mode::kStall) {
                held_.push_back(fd);
                continue;
            }
            linger hard{1, 0};
            if (mode_ == Mode::kReset) setsockopt(fd, SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
            if (mode_ == Mode::kRespond) Answer(fd);
            close(fd);
        }
    }

    void Answer(int fd) {
        timeval limit{5, 0};
        setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
        HttpRequestSeen seen;
        std::string& request = seen.raw;
        char buffer[65536];
        size_t wanted = std::string::npos, headEnd = std::string::npos;
        while (wanted == std::string::npos || request.size() < wanted) {
            ssize_t n = recv(fd, buffer, sizeof buffer, 0);
            if (n <= 0) break;
            request.append(buffer, static_cast<size_t>(n));
            if (wanted == std::string::npos &&
                (headEnd = request.find("\r\n\r\n")) != std::string::npos) {
                const std::string length = seen.Header("Content-Length");
                wanted = headEnd + 4 + (length.empty() ? 0 : std::stoul(length));
            }
        }
        const size_t space = request.find(' ');
        seen.method = request.substr(0, space);
        if (space != std::string::npos)
            seen.target = request.substr(space + 1, request.find(' ', space + 1) - space - 1);
        if (headEnd != std::string::npos) seen.body = request.substr(headEnd + 4);
        {
            std::lock_guard<std::mutex> lock(mutex_);
            requests_.push_back(seen);
        }
        const std::string response = handler_(seen);
        send(fd, response.data(), response.size(), MSG_NOSIGNAL);
    }

    const Mode mode_;
    const Handler handler_;
    int listen_ = -1, port_ = 0;
    int stop_[2] = {-1, -1};
    std::vector<int> held_;  // stalled connections, closed at the end
    std::atomic<int> connections_{0};
    mutable std::mutex mutex_;
    std::vector<HttpRequestSeen> requests_;  // guarded by mutex_
    std::thread thread_;
};

// A whole HTTP/1.1 answer that closes the connection.
inline std::string HttpAnswer(const std::string& statusLine, const std::string& headers,
                              const std::string& body = "") {
    return "HTTP/1.1 " + statusLine + "\r\n" + headers +
           "Content-Length: " + std::to_string(body.size()) + "\r\nConnection: close\r\n\r\n" +
           body;
}

// An S3 error answer with its XML document.
inline std::string S3ErrorAnswer(const std::string& statusLine, const std::string& code) {
    return HttpAnswer(statusLine, "Content-Type: application/xml\r\n",
                      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Error><Code>" + code +
                          "</Code><Message>scripted</Message></Error>");
}

}  // namespace testsupport
