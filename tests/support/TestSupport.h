// Helpers shared by the tests: samples, waits with deadlines, child processes, media clips, and
// the scaffolding of the tests that run the recorder binary.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "platform/framework/ReceivedSample.h"
#include "platform/framework/StreamData.h"
#include "platform/transfer/ObjectStore.h"

namespace testsupport {

// Waits until `predicate` holds, checking every few milliseconds; false at the deadline.
bool WaitUntil(const std::function<bool()>& predicate, int timeoutMs = 10000);

// Minimal H.264 / H.265 access units in Annex B (4-byte start codes): parameter sets then a
// slice header. `bytes` pads the slice to roughly that size.
std::string H264Idr(size_t bytes = 64);
std::string H264NonIdr(size_t bytes = 32);
std::string H265Idr(size_t bytes = 64);
std::string H265NonIdr(size_t bytes = 32);

// A ReceivedSample/StreamData with the given times and payload (owned by the sample).
std::shared_ptr<ReceivedSample> MakeReceived(uint64_t timestamp, uint64_t rtpTime,
                                             std::string payload);
std::shared_ptr<StreamData> MakeSample(uint64_t timestamp, uint64_t rtpTime = 0,
                                       std::string payload = "x");
std::shared_ptr<StreamData> MakeVideo(uint64_t timestamp, bool idr);

struct ProcessResult {
    int exitStatus = -1;  // exit code, or -1 when killed by a signal
    int signal = 0;       // terminating signal, 0 if exited
    std::string output;   // stdout and stderr together
};
// Runs argv[0] with the arguments (no shell), waits at most `timeoutMs`.
ProcessResult RunProcess(const std::vector<std::string>& argv, int timeoutMs = 60000);

// A child process (argv[0] with the arguments, no shell) that runs while the test goes on, its
// stdout and stderr into `output` (truncated). Killed (SIGKILL) and reaped at destruction if it
// still runs. Used from one thread.
class ChildProcess {
  public:
    explicit ChildProcess(const std::vector<std::string>& argv,
                          const std::string& output = "/dev/null");
    ~ChildProcess();
    void Signal(int signo);
    int Wait(int timeoutMs);  // the exit code; -1 when killed by a signal or still running
    bool Ended() const { return ended_; }
    int TermSignal() const { return termSignal_; }  // 0 if it exited or still runs
    bool CoreDumped() const { return coreDumped_; }
    int Pid() const { return pid_; }

  private:
    int pid_ = -1, exitStatus_ = -1, termSignal_ = 0;
    bool ended_ = false, coreDumped_ = false;
};

// `text` split at spaces, for compact argument lists: Words("-c copy -f mpegts").
std::vector<std::string> Words(const std::string& text);

// Path of a file in the build tree (SFR_BINARY_DIR/relative).
std::string BuildPath(const std::string& relative);

// Makes (once, cached in the build tree) a media clip with the ffmpeg CLI:
// `ffmpeg -y -v error <args> <path>`. Returns its path; empty on failure.
std::string MediaClip(const std::string& fileName, const std::vector<std::string>& args);

// A port on 127.0.0.1 for sockets of `type` (SOCK_STREAM, SOCK_DGRAM) that was free a moment
// ago: nothing listens on it afterwards.
int FreePort(int type);

// Reads a whole file; empty when it cannot be read.
std::string ReadFile(const std::string& path);
// Writes `text` to `path`, replacing what was there; returns `path`.
std::string WriteFile(const std::string& path, const std::string& text);
// A fresh, empty directory in the build tree for one test's files: `name` and the process id.
std::string ScratchDir(const std::string& name);

// An environment as code that takes one as a function sees it: the value, "" when unset.
std::function<std::string(const std::string&)> EnvOf(std::map<std::string, std::string> vars);

// An object of `body` under `bucket` and `key`; not copied, so `body` must outlive it.
ObjectToStore ObjectFor(const std::string& bucket, const std::string& key, const std::string& body);

// Argument lists joined: Words("-c copy") + Args{path}. Bring it in with `using`.
using Args = std::vector<std::string>;
Args operator+(Args a, const Args& b);

// How often `piece` occurs in `text` (overlaps included).
size_t CountOf(const std::string& text, const std::string& piece);

// `seconds` of 30 fps 320x240 test pattern (through `filter`, if any) with a 48 kHz AAC tone,
// the video encoded with `video` (by default H.264, an IDR every second, no B-frames).
std::string TestClip(const std::string& name, int seconds, const std::string& video = "",
                     const std::string& filter = "");

// The recorder binary recording `input` as stream "cam1" into bucket "rec" every second, its
// status lines and log in `dir` (status.jsonl, log.txt); `extra` overrides.
Args Recorder(const std::string& input, const std::string& dir, const Args& extra = {});
// A local store with the bucket "rec" under `dir`/store; its -endpoint.
std::string LocalStore(const std::string& dir);
// Files under `dir` named "..._<sequence><suffix>", in sequence order.
std::vector<std::string> StoredFiles(const std::string& dir, const std::string& suffix = ".ts");
// The files one after another in `out`; returns `out`.
std::string Concatenate(const std::vector<std::string>& files, const std::string& out);
// The MD5 of every decoded video frame of a file or playlist, in output order. A playlist
// without #EXT-X-ENDLIST is read from its first entry until reloads bring nothing new.
std::vector<std::string> FrameHashes(const std::string& input);

// A Prometheus text exposition's samples: "name{labels}" -> value.
std::map<std::string, double> Samples(const std::string& text);

}  // namespace testsupport
