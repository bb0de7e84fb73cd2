#include "tests/support/TestSupport.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <regex>
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
    return unit.size() < bytes ? unit + std::string(bytes - unit.size(), 'Z') : unit;
}
const std::string kStart("\x00\x00\x00\x01", 4);
}  // namespace

std::string H264Idr(size_t bytes) {
    return pad(kStart + std::string("\x67\x42\x00\x1e\x95\xa8\x28", 7) + kStart +
                   std::string("\x68\xce\x3c\x80", 4) + kStart + std::string("\x65\x88\x84", 3),
               bytes);
}

std::string H264NonIdr(size_t bytes) {
    return pad(kStart + std::string("\x41\x9a\x02", 3), bytes);
}

std::string H265Idr(size_t bytes) {
    return pad(kStart + std::string("\x40\x01\x0c\x01", 4) + kStart +
                   std::string("\x42\x01\x01\x01", 4) + kStart + std::string("\x44\x01\xc1", 3) +
                   kStart + std::string("\x26\x01\xaf", 3),  // type 19
               bytes);
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
        child.Signal(SIGKILL);  // when it still runs
        result.exitStatus = child.Wait(60000);
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
    std::stringstream ss;
    ss << std::ifstream(path, std::ios::binary).rdbuf();
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

Args operator+(Args a, const Args& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

size_t CountOf(const std::string& text, const std::string& piece) {
    size_t n = 0;
    for (size_t at = text.find(piece); at != std::string::npos; at = text.find(piece, at + 1)) ++n;
    return n;
}

std::string TestClip(const std::string& name, int seconds, const std::string& video,
                     const std::string& filter) {
    const std::string length = "duration=" + std::to_string(seconds);
    return MediaClip(name, Words("-f lavfi -i testsrc2=size=320x240:rate=30:" + length + filter +
                                 " -f lavfi -i sine=frequency=440:sample_rate=48000:" + length +
                                 " -pix_fmt yuv420p -c:a aac -b:a 64k " +
                                 (video.empty() ? "-c:v libx264 -preset ultrafast -g 30 "
                                                  "-keyint_min 30 -sc_threshold 0 -bf 0"
                                                : video)));
}

Args Recorder(const std::string& input, const std::string& dir, const Args& extra) {
    return Args{BuildPath("stream-file-recorder"), "-input", input} +
           Words(
               "-streamingid cam1 -uploadinterval 1 -bufferfullsize 100 -authretrytime 3000 "
               "-kct h264 -bucketname rec") +
           Args{"-status", dir + "/status.jsonl", "-logfile", dir + "/log.txt"} + extra;
}

std::string LocalStore(const std::string& dir) {
    std::filesystem::create_directories(dir + "/store/rec");
    return "file://" + dir + "/store";
}

std::vector<std::string> StoredFiles(const std::string& dir, const std::string& suffix) {
    std::vector<std::pair<long, std::string>> found;
    const std::regex name(".*_([0-9]+)" + std::regex_replace(suffix, std::regex("\\."), "\\."));
    for (const auto& entry : std::filesystem::recursive_directory_iterator(dir)) {
        std::smatch m;
        const std::string path = entry.path().string();
        if (entry.is_regular_file() && std::regex_match(path, m, name))
            found.emplace_back(std::stol(m[1]), path);
    }
    std::sort(found.begin(), found.end());
    std::vector<std::string> paths;
    for (auto& f : found) paths.push_back(f.second);
    return paths;
}

std::string Concatenate(const std::vector<std::string>& files, const std::string& out) {
    std::ofstream o(out, std::ios::binary);
    for (const auto& file : files) o << ReadFile(file);
    return out;
}

std::vector<std::string> FrameHashes(const std::string& input) {
    const bool m3u8 = input.size() > 5 && input.substr(input.size() - 5) == ".m3u8";
    auto r =
        RunProcess(Words("ffmpeg -v error") +
                       (m3u8 ? Words("-live_start_index 0 -m3u8_hold_counters 2") : Args{}) +
                       Args{"-i", input} + Words("-map 0:v -fps_mode passthrough -f framemd5 -"),
                   120000);
    std::istringstream in(r.output);
    std::vector<std::string> hashes;
    for (std::string line; std::getline(in, line);)
        if (!line.empty() && line[0] != '#') hashes.push_back(line.substr(line.rfind(' ') + 1));
    return hashes;
}

std::map<std::string, double> Samples(const std::string& text) {
    std::map<std::string, double> samples;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        if (line.empty() || line[0] == '#') continue;
        const auto space = line.rfind(' ');
        samples[line.substr(0, space)] = std::atof(line.c_str() + space + 1);
    }
    return samples;
}

}  // namespace testsupport
