// The receiving thread beside the caller's thread on one shared connection.
#include <atomic>

#include <gtest/gtest.h>

#include "integration/core/peer.h"

using namespace Bluetooth;
using namespace btbus_test;

namespace {

std::atomic<unsigned> gTicks{ 0 };
void onTick(RemoteObject*, const char*) { ++gTicks; }

using TheReceivingThreadBesideCalls = PeerWithLoopTest;

TEST_F(TheReceivingThreadBesideCalls, LetsEveryBlockingCallHaveItsReplyWhileSignalsPourIn) {
    ASSERT_EQ(peer->setSignalHandlerString("Tick", &onTick), 0);
    gTicks = 0;
    callPeer(*peer, "StartTicking", 1u);
    for (int i = 0; i < 20000; ++i) {
        std::string word = "call " + std::to_string(i);
        ASSERT_EQ(peer->newMessage("Echo"), 0);
        ASSERT_EQ(peer->append(word.c_str()), 0);
        // A reply taken by the other thread shows as libdbus's 25 s time-out.
        ASSERT_EQ(peer->sendMessage(true, -1), 0) << "call " << i << ": " << peer->getErrorMessage();
        std::string echoed;
        ASSERT_EQ(peer->getReplyValue(echoed), 0);
        ASSERT_EQ(echoed, word);
    }
    callPeer(*peer, "StopTicking");
    std::string emitted;
    ASSERT_EQ(peer->getReplyValue(emitted), 0);
    EXPECT_GT(std::stoul(emitted), 100u) << "the peer hardly ticked: the test proves little";
    EXPECT_TRUE(waitUntil([&] { return gTicks == std::stoul(emitted); }))
        << gTicks << " of " << emitted << " signals reached the handler";
}

TEST_F(TheReceivingThreadBesideCalls, AnswersACallBackThatABlockingCallWaitsFor) {
    ServedPath served(*peer);
    // The peer calls this process back before it answers: the answer can only
    // be written while the blocking call waits, by the receiving thread.
    buildCall(*peer, "CallBack", peer->getConnectionName(), ObjectPath(ServedPath::kPath));
    ASSERT_EQ(peer->sendMessage(true, 5000), 0) << peer->getErrorMessage();
    std::string answer;
    EXPECT_EQ(peer->getReplyValue(answer), 0);
    EXPECT_EQ(answer, "called back: pong: ping");
    EXPECT_EQ(served.state.calls.load(), 1);
    EXPECT_NE(served.state.thread.load(), std::this_thread::get_id());
}

TEST_F(TheReceivingThreadBesideCalls, TimesOutABlockingCallThatGetsNoReply) {
    buildCall(*peer, "Sleep", 1000u);
    EXPECT_EQ(peer->sendMessage(true, 200), -1);
    EXPECT_EQ(peer->getErrorNumber(), 11);
    EXPECT_NE(peer->getErrorMessage().find("reply"), std::string::npos) << peer->getErrorMessage();
    callPeer(*peer, "Echo", "after");  // the late reply is dropped
    std::string answer;
    EXPECT_EQ(peer->getReplyValue(answer), 0);
    EXPECT_EQ(answer, "after");
}

// Stopping is final for the whole process, so it runs in a child of its own.
TEST(StoppingTheLoop, EndsEveryReceivingThreadAndThoseStartedLater) {
    if (btbus_test::childRole() != "stop") {
        EXPECT_EQ(btbus_test::runInChild("StoppingTheLoop.*", "stop"), 0);
        return;
    }
    Peer::ensureStarted();
    auto first = peerObject();
    auto second = peerObject(kOtherPath);
    ASSERT_EQ(first->startLoop(), 0);
    ASSERT_EQ(second->startLoop(), 0);
    first->stopLoop();
    EXPECT_EQ(first->waitLoop(), 0);
    EXPECT_EQ(second->waitLoop(), 0);
    auto later = peerObject();
    EXPECT_EQ(later->startLoop(), 0);
    EXPECT_EQ(later->waitLoop(), 0);
    // A wait for a thread that is not there fails instead of crashing.
    EXPECT_NE(later->waitLoop(), 0);
}

}  // namespace
