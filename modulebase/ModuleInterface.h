// ModuleInterface: what a host-side driver (ProcessControl) and the module's own workers see
// of a media module: three sample inputs, queue control, and the lifecycle and processing
// hooks a concrete module implements.
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>

class StreamData;

class ModuleInterface {
  public:
    // Enqueue one sample (producer threads). A full queue drops the sample.
    virtual void PushVideo(std::shared_ptr<StreamData> sample) = 0;
    virtual void PushAudio(std::shared_ptr<StreamData> sample) = 0;
    virtual void PushMeta(std::shared_ptr<StreamData> sample) = 0;
    // A producer handing over several samples at once brackets them so the workers wake once
    // per burst rather than once per sample.
    virtual void BeginBurst() = 0;
    virtual void EndBurst() = 0;
    virtual ~ModuleInterface() = default;
    virtual void Restart() = 0;
    // Waits until every worker has handled everything queued before the call.
    virtual void FlushQueues() = 0;
    virtual void ClearQueues() = 0;
    // Flow control for a producer that can wait: blocks until the queues can take that many
    // more samples of each medium without dropping one; false at the deadline or on stop.
    virtual bool WaitForRoom(size_t video, size_t audio, size_t meta,
                             std::chrono::steady_clock::time_point deadline) = 0;
    virtual bool OnInitialize(std::shared_ptr<void> parameter) = 0;
    virtual void OnStop() = 0;
    virtual void OnStart() = 0;
    // Called on the media's worker thread, one sample at a time in arrival order.
    virtual void ProcessVideo(std::shared_ptr<StreamData> sample) = 0;
    virtual void ProcessAudio(std::shared_ptr<StreamData> sample) = 0;
    virtual void ProcessMeta(std::shared_ptr<StreamData> sample) = 0;
};
