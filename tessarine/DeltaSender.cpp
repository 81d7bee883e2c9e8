#include "tessarine/DeltaSender.h"

#include <algorithm>
#include <exception>
#include <optional>
#include <thread>
#include <utility>
#include <vector>

#include "platform/Log.h"
#include "tessarine/StoreLog.h"

namespace lumivale {
namespace tessarine {

namespace {

const char* const kResendError = "Error in DeltaQueue::onConnectionEstablished: %s";
const char* const kLiveSendError = "Transport did not take a change, kept queued for the next connection: %s";

// Hands one delta to the transport; false when the transport threw.
bool hand(SyncProtocol& syncProtocol, const SyncProtocol::Delta& delta, bool resent) noexcept {
    const int priority = resent ? 6 : 5;
    const char* format = resent ? kResendError : kLiveSendError;
    try {
        syncProtocol.sendDelta(delta);
        return true;
    } catch (const std::exception& e) {
        lv_printLog(priority, kStoreLogTag, format, e.what());
    } catch (...) {
        lv_printLog(priority, kStoreLogTag, format, "an exception of unknown type");
    }
    return false;
}

}  // namespace

DeltaSender::DeltaSender(std::shared_ptr<SyncProtocol> theSyncProtocol,
                         std::shared_ptr<DeltaQueueStorage> theDeltaQueueStorage, std::string theClientId)
    : syncProtocol(std::move(theSyncProtocol)),
      deltaQueueStorage(std::move(theDeltaQueueStorage)),
      clientId(std::move(theClientId)) {}

void DeltaSender::addCommitted(int64_t queueId, SyncProtocol::Delta delta) noexcept {
    MutexLock lock(mutex);
    if (queueId > lastCommittedId) lastCommittedId = queueId;
    // A change the latest resend covers goes out with it, in its place.
    if (suspended || queueId <= resend.upToId) return;
    try {
        delta.clientId = clientId;
        live.push_back({queueId, std::move(delta)});
    } catch (const std::exception&) {
        suspend();
    }
}

void DeltaSender::resendOnConnection() {
    // Read outside the lock: the queue may hold rows that were committed
    // before this sender was made, and a change committed after this read
    // has a greater id, so it is added as live and sent after the resend.
    int64_t storedUpToId = 0;
    try {
        storedUpToId = deltaQueueStorage->getLastId();
    } catch (const std::exception&) {
        // Without a resend, nothing newer may go out before what is queued.
        MutexLock lock(mutex);
        suspend();
        throw;
    }
    MutexLock lock(mutex);
    if (sending && sender == std::this_thread::get_id()) {
        startResend(storedUpToId);  // the sending loop up this thread's stack carries it
        return;
    }
    ++waitingReports;
    while (sending) senderStopped.wait(mutex);
    --waitingReports;
    startResend(storedUpToId);
    sendAsSender();
}

void DeltaSender::startResend(int64_t storedUpToId) {
    ++resend.generation;
    resend.active = true;
    resend.upToId = std::max(storedUpToId, lastCommittedId);
    resend.sentUpToId = 0;
    resend.sentCount = 0;
    suspended = false;
    live.clear();
}

void DeltaSender::sendWaiting() noexcept {
    MutexLock lock(mutex);
    if (sending) return;
    sendAsSender();
}

void DeltaSender::sendAsSender() {
    sending = true;
    sender = std::this_thread::get_id();
    Chunk chunk;
    for (;;) {
        Next next = takeNext(chunk);
        if (next.kind == Next::Kind::NOTHING) return;
        mutex.unlock();
        if (next.kind == Next::Kind::READ_CHUNK) {
            readChunk(chunk, next.generation);
        } else {
            send(next);
        }
        mutex.lock();
    }
}

DeltaSender::Next DeltaSender::takeNext(Chunk& chunk) {
    Next next;
    next.generation = resend.generation;
    if (waitingReports > 0) {
        stopSending();  // the reporting thread goes on from here
    } else if (resend.active) {
        if (chunk.generation != resend.generation || chunk.next == chunk.rows.size()) {
            next.kind = Next::Kind::READ_CHUNK;
        } else {
            next.kind = Next::Kind::RESEND;
            next.resent = &chunk.rows[chunk.next++];
        }
    } else if (!live.empty()) {
        next.kind = Next::Kind::LIVE;
        next.live = std::move(live.front().delta);
        live.pop_front();
    } else {
        stopSending();
    }
    return next;
}

void DeltaSender::stopSending() {
    sending = false;
    sender = std::thread::id();
    senderStopped.notifyAll();
}

void DeltaSender::readChunk(Chunk& chunk, uint64_t generation) {
    int64_t afterId = 0;
    int64_t upToId = 0;
    {
        MutexLock lock(mutex);
        if (resend.generation != generation) return;
        afterId = resend.sentUpToId;
        upToId = resend.upToId;
    }
    // Read into the chunk itself: its strings and blobs are reused.
    chunk.generation = 0;
    bool failed = false;
    try {
        deltaQueueStorage->readDeltasInIdRange(afterId, upToId, kResendChunkSize, chunk.rows);
        for (auto& row : chunk.rows) row.delta.clientId = clientId;
    } catch (const std::exception& e) {
        lv_printLog(LogPriority::kError, kStoreLogTag, kResendError, e.what());
        failed = true;
    }
    std::optional<unsigned> completedCount;
    {
        MutexLock lock(mutex);
        if (resend.generation != generation) return;  // a newer resend starts over
        if (failed) {
            suspend();
        } else if (chunk.rows.empty()) {
            resend.active = false;
            completedCount = resend.sentCount;
        } else {
            chunk.next = 0;
            chunk.generation = generation;
        }
    }
    if (completedCount) {
        lv_printLog(LogPriority::kDebug, kStoreLogTag, "DeltaQueue::onConnectionEstablished: sending %u delta(s)",
                    *completedCount);
    }
}

void DeltaSender::send(const Next& next) {
    const bool resent = next.kind == Next::Kind::RESEND;
    const bool taken = hand(*syncProtocol, resent ? next.resent->delta : next.live, resent);
    MutexLock lock(mutex);
    // After a newer request, what this send did no longer matters: the new
    // resend carries everything from the start.
    if (resend.generation != next.generation) return;
    if (!taken) {
        suspend();
    } else if (resent) {
        resend.sentUpToId = next.resent->id;
        ++resend.sentCount;
    }
}

void DeltaSender::suspend() {
    suspended = true;
    resend.active = false;
    live.clear();
}

}  // namespace tessarine
}  // namespace lumivale
