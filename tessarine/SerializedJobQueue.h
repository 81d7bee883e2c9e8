// The store's one background worker and the queue of jobs in front of it.
//
// Jobs run one at a time, in the order in which they were posted, on a
// single thread made through the application's ThreadCreator. A job reports
// failure by throwing; it is then run again after a pause from the back-off
// record (every job starts its pauses afresh) until it succeeds or the queue
// is stopped, and only then does the next job start. A single failure is not
// logged here: the work in a job logs its own. An exception that does not derive from
// std::exception is outside a job's contract; it is logged at priority 6 and
// then treated like any other failure, so the job is retried and the worker
// lives on.
//
// A job that keeps failing is watched by a JobRetryMonitor: the metrics can
// tell that the worker is retrying, since when and why, and a job failing
// for longer than the stall threshold (kStallThreshold unless given) is
// logged once, and its recovery once more. The retries themselves do not
// change.
//
// Stopping is final: once stopProcessingJobs has been called no attempt
// starts (the call returns when an attempt in progress has ended), a worker
// pausing between attempts wakes at once and abandons its job, and jobs
// still queued, or posted later, never run. Jobs are not persisted.
//
// Threads: any thread may post jobs, a running job included (a follow-up job
// runs after it). stopProcessingJobs waits until a running attempt has
// finished. A job must not call stopProcessingJobs or destroy its queue: the
// first waits for the attempt that makes the call, the second would join the
// worker from the worker itself.
//
// Locks: the queue's own mutex guards the items and is never held while a
// job runs; jobMutex is held for each attempt and by stopProcessingJobs to
// wait for one; sleepMutex pairs the worker's pause with the wake-up of a
// stop; the retry monitor's mutex guards its state. No two of them are ever
// held together.
#pragma once

#include <atomic>
#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <thread>

#include "concurrency/SharedQueue.h"
#include "platform/ThreadAnnotations.h"
#include "tessarine/ExponentialBackoff.h"
#include "tessarine/JobRetryMonitor.h"
#include "tessarine/ThreadCreator.h"

namespace lumivale {
namespace tessarine {

class SerializedJobQueue {
public:
    // A unit of work; running it calls run. Returning is success, throwing
    // (an exception derived from std::exception) is failure.
    struct Job {
        std::function<void()> run;
    };

    // How long a job may keep failing before the store logs that it is
    // stalled: long enough that a short outage (a busy database, a
    // collection being created) stays quiet.
    static constexpr std::chrono::milliseconds kStallThreshold{5000};

    // Starts the worker through threadCreator. Throws std::runtime_error when
    // threadCreator is empty, backoff is not valid (negative start, start
    // above maxDelay, multiplier below 1) or createThread returns a thread
    // that is not joinable; an exception from createThread passes through.
    // In every such case no worker runs and nothing is left to clean up.
    SerializedJobQueue(std::shared_ptr<ThreadCreator> threadCreator,
                       ExponentialBackoff<std::chrono::milliseconds> backoff,
                       std::chrono::milliseconds stallThreshold = kStallThreshold);
    // Stops, wakes and joins the worker; queued jobs are dropped unrun.
    virtual ~SerializedJobQueue();
    SerializedJobQueue(const SerializedJobQueue&) = delete;
    SerializedJobQueue& operator=(const SerializedJobQueue&) = delete;

    // Stops all processing and returns once an attempt in progress has ended.
    // Later calls change nothing.
    virtual void stopProcessingJobs() TS_EXCLUDES(jobMutex, sleepMutex);

    // Appends a copy of job; also after a stop, when it will never run.
    // Throws std::runtime_error for a job with an empty function (it could
    // never succeed), and whatever copying the job or growing the queue
    // throws.
    virtual void addJob(Job job);

    // Jobs posted and not yet finished, the one running or being retried
    // included. Any thread; takes the queue's mutex briefly.
    std::size_t getWaitingJobCount();
    // Whether the current job is being retried, since when and why. Any thread.
    JobRetryMonitor::State getRetryState() const;

private:
    void mainLoop();
    void consumeQueue();
    void retryUntilSucceeds(const Job& job);
    // Runs one attempt; the error message of a failure, empty on success.
    std::optional<std::string> attempt(const Job& job) TS_REQUIRES(jobMutex);
    void interruptableSleep(std::chrono::milliseconds delay) TS_EXCLUDES(sleepMutex);

    concurrency::SharedQueue<Job, concurrency::defaultCost> jobs;
    std::shared_ptr<ThreadCreator> threadCreator;
    CondVar sleepCondition;
    std::thread worker;
    ExponentialBackoff<std::chrono::milliseconds> backoff;  // worker only
    // Cleared by stopProcessingJobs under sleepMutex; read anywhere.
    std::atomic<bool> running{true};
    Mutex jobMutex;  // held by the worker for each attempt
    Mutex sleepMutex;
    JobRetryMonitor retryMonitor;
};

}  // namespace tessarine
}  // namespace lumivale
