// The store's stop switch: a registry of stop callbacks and one operation,
// stop(), that runs them all.
//
// Ids start at 1 and are never reused; once INT_MAX ids have been handed out,
// addStopCallback throws std::runtime_error. stop() runs every registered callback
// in registration order, each time it is called; the callbacks stay
// registered. A callback that throws ends stop() at once and the exception
// leaves it; an empty callback makes stop() throw std::bad_function_call.
//
// Threads: any thread may call every operation. stop() holds the registry
// lock while the callbacks run, so a callback must not add, remove or stop
// on the same Lifecycle; a registration from another thread during stop()
// waits until the callbacks have run. Lock order: the README's ("How a
// change flows through the store"); idMutex is a leaf.
#pragma once

#include <functional>
#include <utility>
#include <vector>

#include "platform/ThreadAnnotations.h"

namespace lumivale {
namespace tessarine {

class Lifecycle {
public:
    virtual ~Lifecycle();
    virtual void stop();
    virtual int addStopCallback(std::function<void()> callback);
    virtual void removeStopCallback(int id);

private:
    Mutex callbacksMutex;
    Mutex idMutex TS_ACQUIRED_AFTER(callbacksMutex);
    std::vector<std::pair<int, std::function<void()>>> stopCallbacks TS_GUARDED_BY(callbacksMutex);
    int lastCallbackId TS_GUARDED_BY(idMutex) = 0;
};

}  // namespace tessarine
}  // namespace lumivale
