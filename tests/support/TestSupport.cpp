#include "tests/support/TestSupport.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

namespace testsupport {

bool WaitUntil(const std::function<bool()>& predicate, int timeoutMs) {
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    while (!predicate()) {
        if (std::chrono::steady_clock::now() > deadline) return predicate();
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return true;
}

namespace {
std::string pad(std::string unit, size_t bytes) {
    while (unit.size() < bytes) unit.push_back(static_cast<char>(0x5A));
    return unit;
}
const std::string kStart("\x00\x00\x00\x01", 4);
}  // namespace

std::string H264Idr(size_t bytes) {
    std::string au = kStart + std::string("\x67\x42\x00\x1e\x95\xa8\x28", 7) + kStart +
                     std::string("\x68\xce\x3c\x80", 4) + kStart + std::string("\x65\x88\x84", 3);
    return pad(au, bytes);
}

std::string H264NonIdr(size_t bytes) {
    return pad(kStart + std::string("\x41\x9a\x02", 3), bytes);
}

std::string H265Idr(size_t bytes) {
    std::string au = kStart + std::string("\x40\x01\x0c\x01", 4) + kStart +
                     std::string("\x42\x01\x01\x01", 4) + kStart + std::string("\x44\x01\xc1", 3) +
                     kStart + std::string("\x26\x01\xaf", 3);  // type 19
    return pad(au, bytes);
}

std::string H265NonIdr(size_t bytes) {
    return pad(kStart + std::string("\x02\x01\xd0", 3), bytes);
}

std::shared_ptr<ReceivedSample> MakeReceived(uint64_t timestamp, uint64_t rtpTime,
                                             std::string payload) {
    SampleAttributes a;
    a.timestamp = timestamp;
    a.rtpTime = rtpTime;
    return MakeReceivedSample(a, std::move(payload), nullptr);
}

std::shared_ptr<StreamData> MakeSample(uint64_t timestamp, uint64_t rtpTime, std::string payload) {
    return std::make_shared<StreamData>(MakeReceived(timestamp, rtpTime, std::move(payload)));
}

std::shared_ptr<StreamData> MakeVideo(uint64_t timestamp, bool idr) {
    return MakeSample(timestamp, timestamp * 90, idr ? H264Idr() : H264NonIdr());
}

ChildProcess::ChildProcess(const std::vector<std::string>& argv, const std::string& output) {
    pid_ = fork();
    if (pid_ == 0) {
        int fd = open(output.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        if (fd >= 0) {
            dup2(fd, 1);
            dup2(fd, 2);
        }
        std::vector<char*> args;
        for (const auto& a : argv) args.push_back(const_cast<char*>(a.c_str()));
        args.push_back(nullptr);
        execvp(args[0], args.data());
        _exit(127);
    }
    ended_ = pid_ < 0;
}

ChildProcess::~ChildProcess() {
    if (ended_) return;
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
}

void ChildProcess::Signal(int signo) {
    if (!ended_) kill(pid_, signo);
}

int ChildProcess::Wait(int timeoutMs) {
    int status = 0;
    if (!ended_ && WaitUntil([&] { return waitpid(pid_, &status, WNOHANG) == pid_; }, timeoutMs)) {
        ended_ = true;
        if (WIFEXITED(status)) exitStatus_ = WEXITSTATUS(status);
        if (WIFSIGNALED(status)) termSignal_ = WTERMSIG(status);
        coreDumped_ = WIFSIGNALED(status) && WCOREDUMP(status);
    }
    return exitStatus_;
}

ProcessResult RunProcess(const std::vector<std::string>& argv, int timeoutMs) {
    ProcessResult result;
    char templ[] = "/tmp/sfr-run-XXXXXX";
    int fd = mkstemp(templ);
    if (fd < 0) return result;
    close(fd);
    {
        ChildProcess child(argv, templ);
        child.Wait(timeoutMs);
        if (!child.Ended()) {
            child.Signal(SIGKILL);
            child.Wait(60000);
        }
        result.exitStatus = child.Wait(0);
        result.signal = child.TermSignal();
    }
    result.output = ReadFile(templ);
    unlink(templ);
    return result;
}

std::vector<std::string> Words(const std::string& text) {
    std::vector<std::string> words;
    std::istringstream in(text);
    for (std::string word; in >> word;) words.push_back(word);
    return words;
}

std::string BuildPath(const std::string& relative) {
    return std::string(SFR_BINARY_DIR) + "/" + relative;
}

int FreePort(int type) {
    int fd = socket(AF_INET, type, 0);
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address);
    socklen_t length = sizeof address;
    getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length);
    close(fd);
    return ntohs(address.sin_port);
}

std::string ReadFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

std::string WriteFile(const std::string& path, const std::string& text) {
    std::ofstream(path, std::ios::binary) << text;
    return path;
}

std::string ScratchDir(const std::string& name) {
    const std::string dir = BuildPath("scratch/" + name + "-" + std::to_string(getpid()));
    std::filesystem::remove_all(dir);
    std::filesystem::create_directories(dir);
    return dir;
}

std::function<std::string(const std::string&)> EnvOf(std::map<std::string, std::string> vars) {
    return [vars = std::move(vars)](const std::string& name) {
        auto it = vars.find(name);
        return it == vars.end() ? std::string() : it->second;
    };
}

ObjectToStore ObjectFor(const std::string& bucket, const std::string& key,
                        const std::string& body) {
    ObjectToStore object;
    object.bucket = bucket;
    object.key = key;
    object.data = reinterpret_cast<const uint8_t*>(body.data());
    object.size = body.size();
    return object;
}

std::string MediaClip(const std::string& fileName, const std::vector<std::string>& args) {
    std::string dir = BuildPath("media");
    mkdir(dir.c_str(), 0755);
    std::string path = dir + "/" + fileName;
    struct stat st {};
    if (stat(path.c_str(), &st) == 0 && st.st_size > 0) return path;
    // Write under a temporary name and rename, so parallel tests never read half a clip.
    std::string tmp = path + ".tmp" + std::to_string(getpid()) + std::string(".") +
                      fileName.substr(fileName.find_last_of('.') + 1);
    std::vector<std::string> cmd = {"ffmpeg", "-y", "-v", "error"};
    cmd.insert(cmd.end(), args.begin(), args.end());
    cmd.push_back(tmp);
    ProcessResult r = RunProcess(cmd, 120000);
    if (r.exitStatus != 0) {
        std::fprintf(stderr, "ffmpeg failed: %s\n", r.output.c_str());
        unlink(tmp.c_str());
        return "";
    }
    rename(tmp.c_str(), path.c_str());
    return path;
}

}  // namespace testsupport
