// StreamBuffer: holds the stream's video (as GOPs), audio and meta and cuts them into stream
// files of one upload interval each on a filing thread of its own.
//
// Intake: the three media workers call ReceiveVideo / ReceiveAudio / ReceiveMeta (and the meta
// worker ReceiveMetaBeforeStart) concurrently, one thread per medium. Video is held from the
// first IDR on, one GOP per IDR; the first IDR fixes the recording origin and trims older audio
// and meta. Samples stay held by shared pointer; no payload byte is ever copied, and stream files
// hold StreamData copies that share the payload.
//
// Filing: Start runs createStreamFile on a thread that ticks about every 500 ms (steady clock).
// Each tick decides whether the newest video and audio have reached the file boundary
// (recording origin + filed time + interval), or whether filing has fallen behind wall time
// (the ITimeManager tick count) by interval x bufferFullSize; if so it cuts a file before the
// last IDR at or before the boundary and pushes it into the IFileBuffer, catching up with
// several files when the media are further ahead. A backed-up file buffer ("BufferOver") or held
// samples spanning ten intervals (warning 29) clear the holding lists instead.
//
// Control: Start and Stop from the connecting/disconnecting thread; Stop also from the upload
// thread (module error). Stop may run concurrently with another Stop, before Start and again
// after an earlier Stop: the lifecycle mutex serialises them, so a later Stop waits for the
// earlier join and then finds nothing to join. Stop must not be called on the filing thread
// itself (that is, not from the observer's callbacks).
//
// Locks: one std::mutex per holding list (GOP, audio, meta). Intake nests only GOP -> audio and
// GOP -> meta, at the first IDR. The filing thread never holds two holding-list locks at once;
// it holds its own mutex (boost) for a whole tick, including while it pushes into the file
// buffer and calls the observer. Intake takes that mutex only to signal the first sample,
// before any holding-list lock, so the two sides cannot deadlock.
#pragma once

#include <atomic>
#include <boost/thread/condition_variable.hpp>
#include <boost/thread/mutex.hpp>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <thread>
#include <vector>

#include "src/CutRule.h"
#include "src/IFileBuffer.h"
#include "src/INalAnalyzer.h"
#include "src/INotifyObserver.h"
#include "src/IStreamBuffer.h"
#include "src/ITimeManager.h"
#include "src/ModuleSettings.h"
#include "src/VqStreamFileData.h"

namespace Orvane {

// Benchmark/test access to the private filing steps; defined only by bench and test code.
class StreamBufferProbe;

class StreamBuffer : public IStreamBuffer {
  public:
    // Stores the collaborators and settings; starts nothing. `observer` may be null and must
    // outlive the filing thread; the collaborators are shared.
    StreamBuffer(INotifyObserver* observer, std::shared_ptr<IFileBuffer> fileBuffer,
                 std::shared_ptr<ITimeManager> timeManager,
                 std::shared_ptr<INalAnalyzer> nalAnalyzer, ModuleSettings settings);
    // Joins a filing thread the owner forgot to Stop (quietly), then releases the lists.
    ~StreamBuffer() override;  // NOLINT(bugprone-exception-escape): see the definition

    StreamBuffer(const StreamBuffer&) = delete;
    StreamBuffer& operator=(const StreamBuffer&) = delete;

    // Starts the filing thread; it waits for the first sample. Does not reset the holding
    // lists, the recording origin or the filed time. A Start while the thread runs is ignored.
    void Start() override;
    // Sets the stop flag, wakes and joins the filing thread. Held samples stay unfiled.
    void Stop() override;
    void ReceiveVideo(std::shared_ptr<StreamData> sample) override;
    void ReceiveAudio(std::shared_ptr<StreamData> sample) override;
    void ReceiveMeta(std::shared_ptr<StreamData> sample) override;
    // Keeps meta within 180000 rtpTime units of the newest; does not release the filing thread.
    void ReceiveMetaBeforeStart(std::shared_ptr<StreamData> sample) override;
    // Under the filing mutex, so never in the middle of a tick (StreamBufferDrain.cpp).
    void CutRemaining() override;
    uint64_t HeldSpanMs() override { return heldSpan(); }
    void SetTickHook(std::function<void()> hook) override { tickHook_ = std::move(hook); }

  private:
    friend class StreamBufferProbe;
    using GOP = std::vector<std::shared_ptr<StreamData>>;  // one IDR, then its non-IDR samples
    using SampleList = std::vector<std::shared_ptr<StreamData>>;

    // --- intake (StreamBuffer.cpp) ---
    // Sets the data-received flag and wakes the data wait, once. Takes the filing mutex only
    // the first time; never called with a holding-list lock held.
    void signalFirstSample();
    // A sample at or past the next file's boundary arrived: wakes the filing thread for an
    // early tick, once per boundary and medium, so that a file is cut when its data is there
    // rather than at the next 500 ms tick. Takes no lock.
    void nudgeFiling(std::atomic<bool>& nudged);
    // Filing thread, after each tick: the boundary the intake compares against, and the
    // nudges armed again.
    void publishBoundary();
    // Removes from `list` the samples older than `timestamp`; caller holds the list's lock.
    static void dropOlderThan(SampleList& list, uint64_t timestamp);

    // --- filing thread (StreamFiling.cpp) ---
    void createStreamFile();
    // Internal buffer length = now - start tick - filed time (32-bit), negative -> 0.
    void calculateInternalBufferSize(uint32_t now, uint32_t startTick);
    // The tick's decision: newest video and audio at or past the boundary, or filing behind
    // wall time by the buffer length limit.
    bool isFilingDue();
    // After a first filing: more files while both video and audio lie beyond the boundary.
    void catchUp();
    // One attempt with the overload checks; true if a non-empty file was pushed.
    bool filing();
    // Stream time the held samples span; 0 when nothing is held.
    uint64_t heldSpan();
    void clearMediaData();
    // recording origin + filed time + interval length (widened with its sign), 64-bit.
    uint64_t fileBoundary() const;

    // --- assembly (StreamFileAssembly.cpp) ---
    // Cuts the next file by the cut rule (CutRule.h) into `file` (passed empty); leaves it
    // empty when no cut is due.
    void createStreamFileData(VqStreamFileData& file);
    // Moves every held sample below `cut` into `file` and sets its duration (the last file of
    // a stream that ends).
    void takeSamplesBelow(VqStreamFileData& file, uint64_t cut);
    // Copies the held timestamps into a CutInput (one list lock at a time), decides under the
    // GOP lock (IsIDR runs there) with `fixedCut` or, if none, by the rule, moves the video in
    // the same holding and then the audio and meta. Without `fixedCut` and with no cut due it
    // returns at once: `file` stays empty and nothing is logged.
    void assemble(VqStreamFileData& file, std::optional<uint64_t> fixedCut);
    // Moves the planned video from the front GOPs into `file`; caller holds the GOP lock.
    void takeVideo(VqStreamFileData& file, const CutPlan& plan);
    // Moves `count` samples from the front of `list` to `out`, one lock per sample, so the
    // receive operation waits at most one move.
    void takeListFront(std::mutex& lock, SampleList& list, std::vector<StreamData>& out,
                       size_t count);
    void dumpStreamFile(const VqStreamFileData& file);
    // Newest held timestamp over the three lists; false when nothing is held.
    bool newestHeld(uint64_t& newest);

    // Collaborators, fixed at construction.
    INotifyObserver* const observer_;  // not owned, may be null
    const std::shared_ptr<IFileBuffer> fileBuffer_;
    std::function<void()> tickHook_;  // run after every tick (SetTickHook, before Start)
    const std::shared_ptr<ITimeManager> timeManager_;
    const std::shared_ptr<INalAnalyzer> nalAnalyzer_;
    const ModuleSettings settings_;

    // Holding lists, oldest first, each under its own lock.
    std::mutex gopMutex_;
    std::vector<GOP> gops_;  // the last GOP is the one being filled
    std::mutex audioMutex_;
    SampleList audio_;
    std::mutex metaMutex_;
    SampleList meta_;

    std::atomic<bool> stop_{false};
    std::atomic<bool> dataReceived_{false};    // a sample arrived since Start
    std::atomic<bool> firstIdrPending_{true};  // no IDR yet since Start (written under GOP lock)
    std::atomic<uint64_t> recordingOrigin_;    // ms; startIgnoreTime until the first IDR
    // The next file's boundary (ms) as of the last tick; none until filing starts. Relaxed: a
    // stale value only makes a nudge early or late by one tick.
    std::atomic<uint64_t> nextBoundary_{UINT64_MAX};
    std::atomic<bool> videoNudged_{false};  // this boundary's video nudge was given
    std::atomic<bool> audioNudged_{false};  // this boundary's audio nudge was given

    // Filing state, filing thread only.
    int32_t intervalLength_ = 0;        // ms, uploadInterval x 1000 (32-bit)
    int32_t bufferLengthLimit_ = 0;     // ms, interval x bufferFullSize (32-bit)
    int32_t internalBufferLength_ = 0;  // ms of wall time filing is behind, >= 0
    uint64_t filedTime_ = 0;            // ms, sum of the durations of all files cut so far

    // A GOP split across files, for the "FRAGMENT GOP" line only (filing thread, GOP lock).
    struct Fragment {
        bool open = false;
        uint64_t firstRtpTime = 0;     // rtpTime of the first video sample of the splitting file
        uint64_t total = 0;            // video samples filed from that GOP so far
        std::vector<uint64_t> counts;  // per file
    } fragment_;

    // Filing thread and its waits. The data wait ends at the first sample or Stop, the tick
    // wait at its deadline or Stop. Flags are set under filingMutex_ so no wake-up is lost.
    boost::mutex filingMutex_;
    boost::condition_variable dataWait_;
    boost::condition_variable tickWait_;
    std::thread filingThread_;
    std::mutex lifecycleMutex_;       // serialises Start and Stop (and the join)
    bool filingStarted_ = false;      // guarded by filingMutex_: the thread left its data wait
    std::atomic<bool> nudge_{false};  // tick early (nudgeFiling)
};

}  // namespace Orvane
