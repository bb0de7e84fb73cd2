// IStreamBuffer: gathers the samples into GOPs and cuts them into stream files on a filing
// thread of its own.
//
// Start/Stop: the connecting/disconnecting thread (Stop also from notifyModuleError on the
// upload thread). Receive*: one media worker each, concurrently.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>

#include "platform/framework/StreamData.h"

namespace Orvane {

class IStreamBuffer {
  public:
    virtual void Start() = 0;
    // Ends and joins the filing thread; safe to call again and from two threads at once.
    virtual void Stop() = 0;
    virtual void ReceiveVideo(std::shared_ptr<StreamData> sample) = 0;
    virtual void ReceiveAudio(std::shared_ptr<StreamData> sample) = 0;
    virtual void ReceiveMeta(std::shared_ptr<StreamData> sample) = 0;
    // Meta before filing starts: kept in a sliding window, does not start the filing thread.
    virtual void ReceiveMetaBeforeStart(std::shared_ptr<StreamData> sample) = 0;
    virtual ~IStreamBuffer() = default;
    // End of stream (any thread but the filing thread): cuts everything held into stream
    // files and pushes them; the last one runs to the newest held sample, inclusive, and is
    // pushed however short. Nothing is cut after Stop or before the first IDR.
    virtual void CutRemaining() = 0;
    // Milliseconds of stream time the held samples span (0 when nothing is held). Any thread;
    // takes the holding lists' locks one at a time.
    virtual uint64_t HeldSpanMs() = 0;
    // `hook` runs on the filing thread after every tick, with none of the buffer's locks held
    // (the held span may have shrunk). Set before Start.
    virtual void SetTickHook(std::function<void()> hook) = 0;
};

}  // namespace Orvane
