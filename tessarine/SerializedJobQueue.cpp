#include "tessarine/SerializedJobQueue.h"

#include <exception>
#include <optional>
#include <string>
#include <stdexcept>
#include <utility>

#include "platform/Log.h"
#include "tessarine/StoreLog.h"

namespace lumivale {
namespace tessarine {

namespace {

// How long the idle worker waits for work before it looks at the stop flag
// again (2^32 - 1 ms, about 49.7 days); a stop also wakes it through the
// no-op job that the destructor posts.
constexpr std::chrono::milliseconds kIdleWait(4294967295LL);

}  // namespace

SerializedJobQueue::SerializedJobQueue(std::shared_ptr<ThreadCreator> theThreadCreator,
                                       ExponentialBackoff<std::chrono::milliseconds> theBackoff,
                                       std::chrono::milliseconds stallThreshold)
    : jobs(-1), threadCreator(std::move(theThreadCreator)), backoff(theBackoff), retryMonitor(stallThreshold) {
    if (!this->threadCreator) throw std::runtime_error("SerializedJobQueue needs a ThreadCreator");
    if (!this->backoff.isValid()) throw std::runtime_error("SerializedJobQueue: invalid back-off");
    std::thread thread = this->threadCreator->createThread([this] { mainLoop(); });
    if (!thread.joinable()) {
        throw std::runtime_error("ThreadCreator::createThread returned a thread that is not joinable");
    }
    worker = std::move(thread);
}

SerializedJobQueue::~SerializedJobQueue() {
    stopProcessingJobs();
    // Wakes a worker that waits for work; stopProcessingJobs has already woken
    // one that pauses between attempts.
    jobs.queue(Job{[] {}}, false);
    if (worker.joinable()) worker.join();
}

void SerializedJobQueue::stopProcessingJobs() {
    {
        // Under sleepMutex, so that a worker about to pause either sees the
        // flag already cleared or is already waiting when the notice comes.
        MutexLock sleepLock(sleepMutex);
        running = false;
    }
    sleepCondition.notifyAll();
    // The worker checks the flag under jobMutex before every attempt, so
    // once the flag is clear no attempt starts; taking the mutex waits for
    // the one that may be running.
    MutexLock jobLock(jobMutex);
}

void SerializedJobQueue::addJob(Job job) {
    if (!job.run) throw std::runtime_error("SerializedJobQueue: a job needs a function");
    jobs.queue(job, false);
}

std::size_t SerializedJobQueue::getWaitingJobCount() {
    MutexLock lock(jobs.mutex());
    return jobs.sizeNoLock();
}

JobRetryMonitor::State SerializedJobQueue::getRetryState() const { return retryMonitor.state(); }

void SerializedJobQueue::mainLoop() {
    while (running) {
        {
            MutexLock lock(jobs.mutex());
            jobs.waitUntilNotEmpty(std::chrono::system_clock::now() + kIdleWait);
        }
        consumeQueue();
    }
}

void SerializedJobQueue::consumeQueue() {
    while (running) {
        Job job;
        {
            MutexLock lock(jobs.mutex());
            if (!jobs.isNotEmptyNoLock()) return;
            // The job stays at the front while it runs.
            job = jobs.frontNoLock();
        }
        retryUntilSucceeds(job);
        MutexLock lock(jobs.mutex());
        if (jobs.isNotEmptyNoLock()) jobs.popFrontNoLock();
    }
}

void SerializedJobQueue::retryUntilSucceeds(const Job& job) {
    backoff.reset();
    while (true) {
        std::optional<std::string> failure;
        {
            MutexLock jobLock(jobMutex);
            if (!running) break;  // the job is abandoned
            failure = attempt(job);
        }
        // Reported outside jobMutex: the monitor may log, and the log may be
        // routed to the application.
        if (!failure) {
            retryMonitor.jobEnded(true);
            return;
        }
        retryMonitor.attemptFailed(*failure);
        interruptableSleep(backoff.nextPause());
    }
    retryMonitor.jobEnded(false);
}

std::optional<std::string> SerializedJobQueue::attempt(const Job& job) {
    try {
        job.run();
        return std::nullopt;
    } catch (const std::exception& e) {
        return std::string(e.what());  // the job has logged what went wrong
    } catch (...) {
        lv_printLog(LogPriority::kError, kStoreLogTag,
                    "Job failed with an exception not derived from std::exception; retrying");
        return std::string("an exception not derived from std::exception");
    }
}

void SerializedJobQueue::interruptableSleep(std::chrono::milliseconds delay) {
    auto deadline = std::chrono::system_clock::now() + delay;
    MutexLock lock(sleepMutex);
    while (running) {
        if (!sleepCondition.waitUntil(sleepMutex, deadline)) return;
    }
}

}  // namespace tessarine
}  // namespace lumivale
