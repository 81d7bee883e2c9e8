// The thread factory an application hands to the store.
//
// The store never starts a thread itself: it asks the application's
// ThreadCreator for its one worker thread, so that the application decides
// how threads are made (attached to a runtime, named, given a stack size).
//
// createThread must return a joinable std::thread that runs body and ends
// when body returns; it may throw instead, but then it must not have started
// body. The store joins the thread; it never detaches it. createThread is
// called once per store, from the thread that opens the store.
//
// StdThreadCreator is the ready-made creator for applications that need
// nothing special: it starts a plain std::thread.
#pragma once

#include <functional>
#include <thread>

class ThreadCreator {
public:
    virtual ~ThreadCreator();
    virtual std::thread createThread(std::function<void()> body) = 0;
};

class StdThreadCreator : public ThreadCreator {
public:
    std::thread createThread(std::function<void()> body) override;
};
