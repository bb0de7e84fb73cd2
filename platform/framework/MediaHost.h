// MediaHost: the host that records a real stream: it reads `-input` with libavformat and drives
// the module as the media system's host would.
//
// Prepare (message thread, during Initialize) opens the input once, so that an input that
// cannot be opened, or has no H.264/H.265 video, ends the start with a plain log line.
// Run (message thread, after startProcess):
//   1. delivers the connection reply, then the credentials once when it has them;
//   2. starts the receive thread, which reads the input, keeps the clock sound (SampleClock),
//      paces a file input by `-readrate` (Pacer), waits for room in the module's queues
//      before it hands a file's packets over (waitForSampleRoom), and calls notifyVideoData /
//      notifyAudioData / notifyMetaData with one ReceivedSample per packet; a live input
//      that fails or stays silent is reopened with a growing pause (1 s doubling up to 30 s)
//      and never ends by itself;
//   3. waits for that thread to end: the file's end, `-duration` seconds of input, the first
//      SIGINT/SIGTERM, or Stop();
//   4. asks the module to store what it holds (drainProcess with `-draintimeout`) and
//      returns; Execute then delivers the disconnection request. A second SIGINT/SIGTERM ends the
//      process at once (SignalHandling).
// Token requests (upload thread) are answered with setProperties by a TokenResponder, paced
// after the first, so that refused credentials do not turn into a storm; an object stored (a
// successful sequence entry) resets the pacing. Credentials come from HostCredentials, which
// also hands over renewed ones before the current ones expire, on its own thread, until Run
// returns; a credential process still running then is ended. When the module reports the
// error state the host stops reading as on SIGINT: the run drains and ends.
//
// The attribute block of each sample: rtpTime / attribute2 the presentation / decode time in
// the track's media clock (90 kHz for video and meta, the sample rate for audio), timestamp the
// decode time in ms on the shared clock (never below 0), attribute1 the capture time in µs
// since the epoch (the input's real start plus the decode time), attribute4 the track index in
// the input, attribute5 the clock rate, attribute6 true, attribute7 the packet's number within
// its track from 0.
#pragma once

#include <atomic>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/framework/BaseProcess.h"
#include "platform/framework/HostCredentials.h"
#include "platform/framework/MediaInput.h"
#include "platform/framework/SampleClock.h"
#include "platform/framework/StopSignal.h"
#include "platform/framework/TokenResponder.h"

class Pacer;

class MediaHost : public IModuleHost {
  public:
    // Pauses before reopening a live input: the first, and the most it grows to.
    static constexpr std::chrono::seconds kFirstReopenPause{1};
    // Packets handed over together at most: fits the smallest module queue (20).
    static constexpr size_t kMaxBatch = 16;
    static constexpr std::chrono::seconds kLongestReopenPause{30};
    // A file input waits for room in the module's queues in slices this long, so that Stop
    // ends the wait within one slice (the module's workers end it at once when they stop).
    static constexpr std::chrono::milliseconds kRoomWaitSlice{100};

    // `handleSignals`: install the SIGINT/SIGTERM handlers while Run runs (the process's host
    // does; in-process tests do not).
    MediaHost(FrameworkOptions options, bool handleSignals);
    ~MediaHost() override;

    bool Prepare(BaseProcess& process) override;
    void Run(BaseProcess& process) override;
    void OnTokenRequest(const GetAWSSecureTokenRequest& request) override;
    void OnLastSequenceNumNotify(const LastSequenceNumNotify& message) override;
    void OnProcessStatus(VqProcessState state, unsigned int code) override;
    // Input reopenings and clock re-basings so far.
    void AddReadings(ProcessReadings& readings) const override;

    // Ends the run as the first SIGINT does (any thread, also before Run).
    void Stop();

  private:
    void receive(BaseProcess& process);
    // Fetches the credentials (asking the sources again when `refresh`) and hands them over.
    void deliverCredentials(BaseProcess& process, const char* occasion, bool refresh);
    // Hands credentials to the module; logs why when there are none.
    static void handOver(BaseProcess& process, const credentials::Result& credentials,
                         const char* occasion);
    // Receive thread, for each read that gave no packet: true (with endReason_ set) when reading
    // ends; false when a live input was opened again.
    bool readingEnds(MediaInput::Status status, const std::string& error);

    // A paced input hands over the packets that are due together, right before the pacer
    // waits: each worker then wakes once per burst rather than once per packet. A burst is
    // bounded by the pacer's slack and by kMaxBatch, so it fits the module's queues. An
    // unpaced file goes in bursts of kMaxBatch. A file waits for room in the module's queues
    // (and, through the module, for the recorder's backlog of unstored stream) before each
    // burst and so never loses a sample; a stop during that wait discards the
    // burst as if it had not been read. A live input is handed over packet by packet.
    using Batch = std::vector<std::pair<MediaInput::Packet, SampleClock::Times>>;
    // Receive thread: delivers the packet or moves it into the burst; false when a stop ended
    // the pacer's wait.
    bool handOn(BaseProcess& process, Pacer& pacer, Batch& batch, MediaInput::Packet& packet,
                const SampleClock::Times& times);
    // Receive thread: delivers the burst (after waiting for room, for a file) and empties it.
    void flush(BaseProcess& process, Batch& batch);
    // A file input: waits until the module can take the whole batch; false when stopped first.
    bool waitForRoom(BaseProcess& process, const Batch& batch);
    void deliver(BaseProcess& process, const MediaInput::Packet& packet,
                 const SampleClock::Times& times);
    // Reopens the live input after `why`; false when stopped meanwhile.
    bool reopen(std::string why);

    const FrameworkOptions options_;
    const bool live_;
    const bool handleSignals_;
    const std::string shownInput_;    // the input without user information, for log lines
    BaseProcess* process_ = nullptr;  // set by Prepare, before any other thread runs
    StopSignal stop_;
    std::unique_ptr<MediaInput> input_;  // receive thread (message thread before it starts)
    SampleClock clock_;                  // receive thread
    int64_t realStartMicros_ = 0;        // capture time of the shared clock's 0, µs since epoch
    uint64_t packetNumbers_[SampleClock::kTrackCount] = {0, 0, 0};
    uint64_t delivered_ = 0;  // samples handed to the module
    std::chrono::seconds reopenPause_ = kFirstReopenPause;
    std::atomic<uint64_t> reopenings_{0};  // the input opened again; relaxed, a count
    std::string endReason_;  // why reading ended; written by the receive thread before it ends
    std::thread receiver_;
    // Renews credentials before they expire on a thread of its own, from the connection reply
    // until Run ends.
    std::unique_ptr<HostCredentials> credentials_;
    std::atomic<bool> moduleFailed_{false};  // the module reported the error state
    TokenResponder tokens_;  // answers on a thread of its own; stopped by Run and the destructor
};
