#include "modulebase/Module.h"

#include "platform/framework/StreamData.h"
#include "platform/logger/Logger.h"

Module::Module() = default;

Module::~Module() = default;

void Module::PushVideo(std::shared_ptr<StreamData> sample) {
    push(kVideo, std::move(sample));
}

void Module::PushAudio(std::shared_ptr<StreamData> sample) {
    push(kAudio, std::move(sample));
}

void Module::PushMeta(std::shared_ptr<StreamData> sample) {
    push(kMeta, std::move(sample));
}

void Module::push(Media media, std::shared_ptr<StreamData> sample) {
    static const char* const kOverflowLines[kMediaCount] = {
        "queue overflow (video)", "queue overflow (audio)", "queue overflow (meta)"};
    Lane& lane = lanes_[media];
    lane.received.fetch_add(1, std::memory_order_relaxed);
    if (lane.queue.Push(std::move(sample), nullptr, !burstOpen_.load(std::memory_order_relaxed)))
        return;
    lane.overflows.fetch_add(1, std::memory_order_relaxed);
    Logger::Put(5, nullptr, nullptr, 0, "%s", kOverflowLines[media]);
}

Module::QueueCounts Module::Counts() const {
    QueueCounts counts;
    for (int media = kVideo; media < kMediaCount; ++media) {
        counts.received[media] = lanes_[media].received.load(std::memory_order_relaxed);
        counts.overflows[media] = lanes_[media].overflows.load(std::memory_order_relaxed);
    }
    return counts;
}

void Module::Restart() {
    StopThreads();
    StartThreads();
}

void Module::FlushQueues() {
    std::unique_lock<std::mutex> lock(markerMutex_);
    auto marker = std::make_shared<StreamData>();
    for (Lane& lane : lanes_) {
        // Even into a full queue: a file input fills the queues to the brim, and a flush that
        // skipped a full one would return before its samples were handled.
        uint64_t ticket = 0;
        lane.queue.PushAlways(marker, &ticket);
        // Tickets grow with every push and the worker handles items in ticket order, so a
        // handled marker at or past ours means ours was handled (or cleared away).
        lane.markerHandled.wait(
            lock, [&] { return lane.markerTicket >= ticket || !lane.running.load(); });
    }
}

void Module::BeginBurst() {
    burstOpen_.store(true, std::memory_order_relaxed);
}

void Module::EndBurst() {
    burstOpen_.store(false, std::memory_order_relaxed);
    for (Lane& lane : lanes_) lane.queue.Wake();
}

void Module::ClearQueues() {
    for (Lane& lane : lanes_) lane.queue.Clear();
}

bool Module::WaitForRoom(size_t video, size_t audio, size_t meta,
                         std::chrono::steady_clock::time_point deadline) {
    const size_t wanted[kMediaCount] = {video, audio, meta};
    for (int media = kVideo; media < kMediaCount; ++media) {
        if (wanted[media] != 0 && !lanes_[media].queue.WaitForRoom(wanted[media], deadline))
            return false;
    }
    return true;
}

bool Module::Initialize(std::shared_ptr<void> parameter) {
    auto keepMarkers = [](const std::shared_ptr<StreamData>& item) {
        return !item || item->payloadSize != 0;
    };
    for (Lane& lane : lanes_) lane.queue = keepMarkers;
    return OnInitialize(std::move(parameter));
}

void Module::StartThreads() {
    for (int media = kVideo; media < kMediaCount; ++media) {
        lanes_[media].running = true;
        lanes_[media].worker =
            std::make_shared<std::thread>(&Module::workerLoop, this, static_cast<Media>(media));
        lanes_[media].queue.AllowWaits();
    }
}

void Module::StopThreads() {
    for (Lane& lane : lanes_) {
        lane.running = false;
        lane.queue.EndWaits();
    }
    auto marker = std::make_shared<StreamData>();
    for (Lane& lane : lanes_) {
        lane.queue.Clear();
        lane.queue.Push(marker);
    }
    {
        // Wake a FlushQueues that waits for a worker which is ending now.
        std::lock_guard<std::mutex> lock(markerMutex_);
    }
    for (Lane& lane : lanes_) lane.markerHandled.notify_all();
    for (Lane& lane : lanes_) {
        if (lane.worker && lane.worker->joinable()) {
            lane.worker->join();
            lane.worker.reset();
        }
    }
}

void Module::process(Media media, std::shared_ptr<StreamData> sample) {
    switch (media) {
        case kVideo:
            ProcessVideo(std::move(sample));
            break;
        case kAudio:
            ProcessAudio(std::move(sample));
            break;
        default:
            ProcessMeta(std::move(sample));
            break;
    }
}

void Module::workerLoop(Media media) {
    Lane& lane = lanes_[media];
    std::deque<Queue::Entry> taken;  // one PopAll's items; its storage is reused
    while (true) {
        lane.queue.PopAll(taken);
        for (Queue::Entry& entry : taken) {
            if (entry.item && entry.item->payloadSize > 0) {
                process(media, std::move(entry.item));
            } else {
                std::lock_guard<std::mutex> lock(markerMutex_);
                lane.markerTicket = entry.ticket;
                lane.markerHandled.notify_all();
            }
            if (!lane.running.load()) return;  // what is left was queued before the stop
        }
        taken.clear();
    }
}
