#include <gtest/gtest.h>

#include "PipelineFixture.h"

namespace {

using testsupport::LogCapture;

class SubscriptionManagerTest : public testsupport::PipelineFixture {
protected:
    void SetUp() override { build(); }
};

TEST_F(SubscriptionManagerTest, ConnectionResubscribesEverythingBeforeQueueResends) {
    LogCapture log;
    subscriptionManager->subscribeCollection("a:b");
    subscriptionManager->subscribeCollection("c:d");
    subscriptionManager->updateSequenceNumber("c:d", 5);
    subscriptionManager->subscribeCollection("c:d");  // again: with the stored number
    EXPECT_EQ(5u, transport->sentSubscriptions().back().sequenceNumber);
    EXPECT_EQ(5u, subscriptionManager->getSequenceNumber("c:d"));
    localSave("a:b", "k");
    transport->clearSent();
    transport->onConnectionEstablished();
    auto events = transport->sentEvents();
    ASSERT_EQ(3u, events.size());
    EXPECT_EQ("delta a:b/1", events[2]);
    std::map<std::string, uint64_t> numbers;
    for (const auto& request : transport->sentSubscriptions()) {
        numbers[request.collectionName] = request.sequenceNumber;
        EXPECT_EQ(clientId, request.clientId);
        EXPECT_EQ(std::string(1, '\x01'), request.version);
    }
    EXPECT_EQ((std::map<std::string, uint64_t>{{"a:b", 0}, {"c:d", 5}}), numbers);
    EXPECT_EQ(1u, log.linesStartingWith("SubscriptionManager::onConnectionEstablished is called back").size());
}

TEST_F(SubscriptionManagerTest, FailingResubscriptionStopsQuietlyAndQueueStillResends) {
    subscriptionManager->subscribeCollection("a:b");
    subscriptionManager->subscribeCollection("c:d");
    localSave("a:b", "k");
    transport->clearSent();
    transport->setFailSubscriptions(true);
    LogCapture log;
    transport->onConnectionEstablished();
    EXPECT_EQ(std::vector<std::string>{"delta a:b/1"}, transport->sentEvents());
    EXPECT_TRUE(log.linesStartingWith("Error").empty());
}

}  // namespace
