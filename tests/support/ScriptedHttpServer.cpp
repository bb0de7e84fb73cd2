#include "tests/support/ScriptedHttpServer.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <stdexcept>

namespace testsupport {

ScriptedHttpServer::ScriptedHttpServer(Mode mode, std::string response)
    : mode_(mode), response_(std::move(response)) {
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
    return request_;
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
    std::string request;
    char buffer[65536];
    size_t wanted = std::string::npos;
    while (wanted == std::string::npos || request.size() < wanted) {
        ssize_t n = recv(fd, buffer, sizeof buffer, 0);
        if (n <= 0) break;
        request.append(buffer, static_cast<size_t>(n));
        size_t end = request.find("\r\n\r\n");
        if (wanted == std::string::npos && end != std::string::npos) {
            size_t at = request.find("Content-Length: ");
            wanted = end + 4 + (at == std::string::npos ? 0 : std::stoul(request.substr(at + 16)));
        }
    }
    {
        std::lock_guard<std::mutex> lock(mutex_);
        request_ = request;
    }
    send(fd, response_.data(), response_.size(), MSG_NOSIGNAL);
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
