#include "tests/support/ScriptedHttpServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <strings.h>
#include <sys/socket.h>
#include <unistd.h>

#include <stdexcept>

namespace testsupport {

namespace {

// The value of header `name` in a header block, "" when absent.
std::string HeaderIn(const std::string& head, const std::string& name) {
    size_t at = head.find("\r\n");
    while (at != std::string::npos && at + 2 < head.size()) {
        size_t start = at + 2, end = head.find("\r\n", start);
        if (end == std::string::npos) end = head.size();
        const std::string line = head.substr(start, end - start);
        size_t colon = line.find(':');
        if (colon == name.size() && strncasecmp(line.c_str(), name.c_str(), colon) == 0) {
            size_t value = line.find_first_not_of(" \t", colon + 1);
            return value == std::string::npos ? "" : line.substr(value);
        }
        at = end;
    }
    return "";
}

}  // namespace

std::string HttpRequestSeen::Header(const std::string& name) const {
    return HeaderIn(raw.substr(0, raw.find("\r\n\r\n")), name);
}

ScriptedHttpServer::ScriptedHttpServer(Mode mode, std::string response)
    : mode_(mode), handler_([response](const HttpRequestSeen&) { return response; }) {
    Start();
}

ScriptedHttpServer::ScriptedHttpServer(Handler handler)
    : mode_(Mode::kRespond), handler_(std::move(handler)) {
    Start();
}

void ScriptedHttpServer::Start() {
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

ScriptedHttpServer::~ScriptedHttpServer() {
    ssize_t woken = write(stop_[1], "x", 1);  // a pipe with room: cannot fail
    (void)woken;
    thread_.join();
    for (int fd : held_) close(fd);
    for (int fd : {listen_, stop_[0], stop_[1]}) close(fd);
}

std::string ScriptedHttpServer::Request() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return requests_.empty() ? std::string() : requests_.back().raw;
}

std::vector<HttpRequestSeen> ScriptedHttpServer::Requests() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return requests_;
}

void ScriptedHttpServer::Run() {
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
        if (mode_ == Mode::kReset) {
            linger hard{1, 0};
            setsockopt(fd, SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
        } else {
            Answer(fd);
        }
        close(fd);
    }
}

void ScriptedHttpServer::Answer(int fd) {
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
            const std::string length = HeaderIn(request.substr(0, headEnd), "Content-Length");
            wanted = headEnd + 4 + (length.empty() ? 0 : std::stoul(length));
        }
    }
    size_t space = request.find(' ');
    seen.method = request.substr(0, space);
    if (space != std::string::npos) {
        seen.target = request.substr(space + 1, request.find(' ', space + 1) - space - 1);
    }
    if (headEnd != std::string::npos) seen.body = request.substr(headEnd + 4);
    {
        std::lock_guard<std::mutex> lock(mutex_);
        requests_.push_back(seen);
    }
    const std::string response = handler_(seen);
    send(fd, response.data(), response.size(), MSG_NOSIGNAL);
}

std::string HttpAnswer(const std::string& statusLine, const std::string& headers,
                       const std::string& body) {
    return "HTTP/1.1 " + statusLine + "\r\n" + headers +
           "Content-Length: " + std::to_string(body.size()) + "\r\nConnection: close\r\n\r\n" +
           body;
}

std::string S3ErrorAnswer(const std::string& statusLine, const std::string& code) {
    return HttpAnswer(statusLine, "Content-Type: application/xml\r\n",
                      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Error><Code>" + code +
                          "</Code><Message>scripted</Message></Error>");
}

}  // namespace testsupport
