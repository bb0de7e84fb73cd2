#include "platform/transfer/ObjectEvents.h"

#include <exception>
#include <mutex>
#include <shared_mutex>
#include <utility>
#include <vector>

#include "platform/logger/Logger.h"

namespace {

// The list. Publishers share the lock while they call, so the end of a subscription (which
// takes it alone) waits for calls in progress.
struct Registry {
    std::shared_mutex mutex;
    uint64_t lastId = 0;
    std::vector<std::pair<uint64_t, ObjectEvents::Subscriber>> subscribers;
};

Registry& registry() {
    static Registry* const instance = new Registry;  // never destroyed: used until exit
    return *instance;
}

}  // namespace

ObjectEvents::Subscription ObjectEvents::Subscribe(Subscriber subscriber) {
    Registry& r = registry();
    std::unique_lock<std::shared_mutex> lock(r.mutex);
    r.subscribers.emplace_back(++r.lastId, std::move(subscriber));
    return Subscription(r.lastId);
}

void ObjectEvents::Subscription::Reset() {
    if (id_ == 0) return;
    Registry& r = registry();
    std::unique_lock<std::shared_mutex> lock(r.mutex);
    for (auto it = r.subscribers.begin(); it != r.subscribers.end(); ++it) {
        if (it->first != id_) continue;
        r.subscribers.erase(it);
        break;
    }
    id_ = 0;
}

void ObjectEvents::Publish(const StoredObject& object) {
    Registry& r = registry();
    std::shared_lock<std::shared_mutex> lock(r.mutex);
    for (const auto& entry : r.subscribers) {
        try {
            entry.second(object);
        } catch (const std::exception& e) {
            Logger::Put(4, "platform/transfer/ObjectEvents", "ObjectEvents::Publish", __LINE__,
                        "an object event subscriber threw: %s", e.what());
        } catch (...) {
            Logger::Put(4, "platform/transfer/ObjectEvents", "ObjectEvents::Publish", __LINE__,
                        "an object event subscriber threw");
        }
    }
}
