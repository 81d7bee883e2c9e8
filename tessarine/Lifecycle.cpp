#include "tessarine/Lifecycle.h"

#include <algorithm>
#include <climits>
#include <stdexcept>

namespace lumivale {
namespace tessarine {

Lifecycle::~Lifecycle() = default;

void Lifecycle::stop() {
    MutexLock lock(callbacksMutex);
    for (const auto& entry : stopCallbacks) entry.second();
}

int Lifecycle::addStopCallback(std::function<void()> callback) {
    MutexLock lock(callbacksMutex);
    int id;
    {
        MutexLock idLock(idMutex);
        if (lastCallbackId == INT_MAX) throw std::runtime_error("Lifecycle has no stop callback ids left");
        id = ++lastCallbackId;
    }
    stopCallbacks.emplace_back(id, std::move(callback));
    return id;
}

void Lifecycle::removeStopCallback(int id) {
    MutexLock lock(callbacksMutex);
    stopCallbacks.erase(std::remove_if(stopCallbacks.begin(), stopCallbacks.end(),
                                       [id](const auto& entry) { return entry.first == id; }),
                        stopCallbacks.end());
}

}  // namespace tessarine
}  // namespace lumivale
