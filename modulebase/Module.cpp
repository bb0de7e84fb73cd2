#include "modulebase/Module.h"

#include "platform/framework/StreamData.h"
#include "platform/logger/Logger.h"

Module::Module() = default;

Module::~Module() = default;

void Module::PushVideo(std::shared_ptr<StreamData> sample) {
    if (!videoQueue_.Push(std::move(sample)))
        Logger::Put(5, nullptr, nullptr, 0, "queue overflow (video)");
}

void Module::PushAudio(std::shared_ptr<StreamData> sample) {
    if (!audioQueue_.Push(std::move(sample)))
        Logger::Put(5, nullptr, nullptr, 0, "queue overflow (audio)");
}

void Module::PushMeta(std::shared_ptr<StreamData> sample) {
    if (!metaQueue_.Push(std::move(sample)))
        Logger::Put(5, nullptr, nullptr, 0, "queue overflow (meta)");
}

void Module::Restart() {
    StopThreads();
    StartThreads();
}

void Module::FlushQueues() {
    std::unique_lock<std::mutex> lock(markerMutex_);
    auto marker = std::make_shared<StreamData>();
    struct Step {
        Queue& queue;
        std::condition_variable& condition;
        bool& seen;
        const StreamData*& lastMarker;
        std::atomic<bool>& running;
    };
    Step steps[] = {
        {videoQueue_, videoMarkerCondition_, videoMarkerSeen_, videoLastMarker_, videoRunning_},
        {audioQueue_, audioMarkerCondition_, audioMarkerSeen_, audioLastMarker_, audioRunning_},
        {metaQueue_, metaMarkerCondition_, metaMarkerSeen_, metaLastMarker_, metaRunning_},
    };
    for (Step& step : steps) {
        step.seen = false;
        if (!step.queue.Push(marker)) continue;  // full: the worker is far behind anyway
        step.condition.wait(
            lock, [&] { return step.lastMarker == marker.get() || !step.running.load(); });
    }
}

void Module::ClearQueues() {
    videoQueue_.Clear();
    audioQueue_.Clear();
    metaQueue_.Clear();
}

bool Module::Initialize(std::shared_ptr<void> parameter) {
    auto keepMarkers = [](std::shared_ptr<StreamData> item) {
        return !item || item->payloadSize != 0;
    };
    videoQueue_ = keepMarkers;
    audioQueue_ = keepMarkers;
    metaQueue_ = keepMarkers;
    return OnInitialize(std::move(parameter));
}

void Module::StartThreads() {
    videoRunning_ = true;
    videoWorker_ = std::make_shared<std::thread>(&Module::workerLoop, this, Media::Video);
    audioRunning_ = true;
    audioWorker_ = std::make_shared<std::thread>(&Module::workerLoop, this, Media::Audio);
    metaRunning_ = true;
    metaWorker_ = std::make_shared<std::thread>(&Module::workerLoop, this, Media::Meta);
}

void Module::StopThreads() {
    videoRunning_ = false;
    audioRunning_ = false;
    metaRunning_ = false;
    auto marker = std::make_shared<StreamData>();
    for (Queue* queue : {&videoQueue_, &audioQueue_, &metaQueue_}) {
        queue->Clear();
        queue->Push(marker);
    }
    {
        // Wake a FlushQueues that waits for a worker which is ending now.
        std::lock_guard<std::mutex> lock(markerMutex_);
    }
    videoMarkerCondition_.notify_all();
    audioMarkerCondition_.notify_all();
    metaMarkerCondition_.notify_all();
    for (auto* worker : {&videoWorker_, &audioWorker_, &metaWorker_}) {
        if (*worker && (*worker)->joinable()) {
            (*worker)->join();
            worker->reset();
        }
    }
}

void Module::workerLoop(Media media) {
    Queue& queue = media == Media::Video   ? videoQueue_
                   : media == Media::Audio ? audioQueue_
                                           : metaQueue_;
    std::atomic<bool>& running = media == Media::Video   ? videoRunning_
                                 : media == Media::Audio ? audioRunning_
                                                         : metaRunning_;
    while (true) {
        std::shared_ptr<StreamData> item = queue.Pop();
        if (item && item->payloadSize > 0) {
            switch (media) {
                case Media::Video:
                    ProcessVideo(item);
                    break;
                case Media::Audio:
                    ProcessAudio(item);
                    break;
                case Media::Meta:
                    ProcessMeta(item);
                    break;
            }
        } else {
            std::lock_guard<std::mutex> lock(markerMutex_);
            switch (media) {
                case Media::Video:
                    videoMarkerSeen_ = true;
                    videoLastMarker_ = item.get();
                    videoMarkerCondition_.notify_one();
                    break;
                case Media::Audio:
                    audioMarkerSeen_ = true;
                    audioLastMarker_ = item.get();
                    audioMarkerCondition_.notify_one();
                    break;
                case Media::Meta:
                    metaMarkerSeen_ = true;
                    metaLastMarker_ = item.get();
                    metaMarkerCondition_.notify_one();
                    break;
            }
        }
        if (!running.load()) break;
    }
}
