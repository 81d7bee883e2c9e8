// Hands this store's committed local changes to the transport: each once,
// in the order in which they were committed, and on every new connection the
// whole queue again, oldest first, before anything committed later. Each
// collection's changes therefore reach the transport in version-id order
// from any number of writing threads, also while a resend is running.
//
// A change is handed over only after the transaction that queued it has
// committed (addCommitted is called after the commit), so a write that
// failed never reached the transport.
//
// One thread at a time hands changes over, outside every lock: whoever calls
// sendWaiting while nobody is sending becomes the sender and keeps going
// until nothing waits, also sending what other threads added meanwhile; a
// call while another thread, or a caller further up this thread's stack, is
// sending returns at once. So a transport may write through the store from
// inside sendDelta: that write is sent after the change being sent now.
//
// A connection's resend is the exception: it goes out on the thread that
// reports the connection, before resendOnConnection returns, after waiting
// for the change another thread is handing over (if any). Transports hold
// back what other threads send while they report a connection and publish
// it afterwards; a change taken before the connection and handed over
// during its report is held so, and reaches the server after the resend
// instead of ahead of older changes of the same object that the last
// connection lost. So sendDelta must not wait for the thread that reports
// connections.
//
// A sendDelta that throws means the transport did not take the change. It
// is logged (priority 5; priority 6 during a resend) and nothing more is
// handed over until the next connection, whose resend carries every queued
// change in order: sending later changes first would let the server see a
// newer change of an object before an older one.
//
// Threads: every operation may be called from any thread. Locks: mutex is
// the last in the store's lock order (README, "How a change flows through
// the store"), held only to look at or change the waiting work, never while
// the transport or the storage is called; resendOnConnection waits on it
// until the sending thread has stopped.
#pragma once

#include <cstdint>
#include <deque>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/ThreadAnnotations.h"
#include "tessarine/DeltaQueueStorage.h"
#include "tessarine/SyncProtocol.h"

namespace lumivale {
namespace tessarine {

class DeltaSender {
public:
    // The queued deltas a resend reads at a time, so that its memory stays
    // flat however long the queue is.
    static constexpr int kResendChunkSize = 256;

    DeltaSender(std::shared_ptr<SyncProtocol> syncProtocol, std::shared_ptr<DeltaQueueStorage> deltaQueueStorage,
                std::string clientId);
    DeltaSender(const DeltaSender&) = delete;
    DeltaSender& operator=(const DeltaSender&) = delete;

    // A change whose queue row (queueId) has just committed. Callers add in
    // commit order: the local write lock orders them. Never throws: a change
    // that cannot wait here stays queued for the next connection.
    void addCommitted(int64_t queueId, SyncProtocol::Delta delta) noexcept TS_EXCLUDES(mutex);

    // A new connection: every change committed so far goes out again, oldest
    // first, before anything committed later; a resend under way starts
    // over. Sending resumes if a failure had stopped it. Call it on the
    // thread that reports the connection: it hands the resend and what waits
    // over on that thread (above), unless a caller further up its stack is
    // sending, which then carries on with the resend, or a report on another
    // thread comes meanwhile, which then takes over. A resend that completes
    // logs how many deltas it handed over (priority 3). Throws what reading
    // the queue throws; then nothing is handed over until the next request.
    void resendOnConnection() TS_EXCLUDES(mutex);

    // Hands over what waits, on the calling thread, unless somebody is
    // already doing so. Never throws.
    void sendWaiting() noexcept TS_EXCLUDES(mutex);

private:
    // What a resend has read and not sent yet; the sending thread's own,
    // reused from chunk to chunk.
    struct Chunk {
        std::vector<DeltaQueueStorage::QueuedDelta> rows;
        size_t next = 0;
        uint64_t generation = 0;
    };

    // The latest resend, read and changed under mutex. Every id up to upToId
    // is its to send, whether it is still running or not.
    struct Resend {
        bool active = false;
        uint64_t generation = 0;  // counts requests; a newer one restarts
        int64_t upToId = 0;       // the last id committed when requested
        int64_t sentUpToId = 0;   // how far it has got
        unsigned sentCount = 0;
    };
    // One step of the sending thread, taken under mutex: a resent delta is
    // sent from the chunk in place, a live one taken out of the queue.
    struct Next {
        enum class Kind { NOTHING, READ_CHUNK, RESEND, LIVE } kind = Kind::NOTHING;
        uint64_t generation = 0;
        const DeltaQueueStorage::QueuedDelta* resent = nullptr;
        SyncProtocol::Delta live;
    };

    // Sends until nothing waits or a connection's report wants to take over;
    // mutex is held and nobody else is sending.
    void sendAsSender() TS_REQUIRES(mutex);
    // Chooses the next step; mutex is held. Stops sending when there is
    // nothing left, so that a change added later finds nobody sending, or
    // when a connection's report waits to take over.
    Next takeNext(Chunk& chunk) TS_REQUIRES(mutex);
    void stopSending() TS_REQUIRES(mutex);
    // Starts a resend of everything up to the greater of storedUpToId and
    // the last committed id; mutex is held.
    void startResend(int64_t storedUpToId) TS_REQUIRES(mutex);
    void readChunk(Chunk& chunk, uint64_t generation) TS_EXCLUDES(mutex);
    void send(const Next& next) TS_EXCLUDES(mutex);
    // Stops handing over until the next resend; mutex is held.
    void suspend() TS_REQUIRES(mutex);

    std::shared_ptr<SyncProtocol> syncProtocol;
    std::shared_ptr<DeltaQueueStorage> deltaQueueStorage;
    std::string clientId;

    Mutex mutex;
    std::deque<DeltaQueueStorage::QueuedDelta> live TS_GUARDED_BY(mutex);  // committed, not yet handed over
    Resend resend TS_GUARDED_BY(mutex);
    int64_t lastCommittedId TS_GUARDED_BY(mutex) = 0;
    bool sending TS_GUARDED_BY(mutex) = false;    // a thread is handing over
    std::thread::id sender TS_GUARDED_BY(mutex);  // which one
    int waitingReports TS_GUARDED_BY(mutex) = 0;  // connection reports waiting to take over
    CondVar senderStopped;
    bool suspended TS_GUARDED_BY(mutex) = false;  // a send failed; wait for the next connection
};

}  // namespace tessarine
}  // namespace lumivale
