// Method calls against a real dbus-daemon and a dbusmock peer: replies of every
// shape, one-way calls, errors, and the pending call that keeps dispatching.
#include <csignal>
#include <thread>

#include <gtest/gtest.h>
#include <unistd.h>

#include "core/loop_flags.h"
#include "integration/core/peer.h"

using namespace Bluetooth;
using namespace btbus_test;

namespace {

class PeerTest : public ::testing::Test {
protected:
    void SetUp() override {
        Peer::ensureStarted();
        peer = peerObject();
    }

    // Calls a reply-returning method of the peer, then reads the reply into out.
    template <typename T>
    int read(const char* method, T& out) {
        callPeer(*peer, method);
        return peer->getReplyValue(out);
    }

    std::unique_ptr<RemoteObject> peer;
};

using ARemoteObject = PeerTest;

TEST_F(ARemoteObject, ReadsScalarRepliesOnceEach) {
    std::string text;
    EXPECT_EQ(read("String", text), 0);
    EXPECT_EQ(text, "hello");
    EXPECT_EQ(peer->getReplyValue(text), -1);
    EXPECT_EQ(peer->getErrorNumber(), 2);
    EXPECT_EQ(peer->getErrorMessage(), "Reply message is null");

    bool truth = false;
    EXPECT_EQ(read("Bool", truth), 0);
    EXPECT_TRUE(truth);

    ObjectPath path;
    EXPECT_EQ(read("Path", path), 0);
    EXPECT_STREQ(path, "/org/btbus/Thing");
}

TEST_F(ARemoteObject, ConsumesAReplyOfTheWrongType) {
    bool truth = false;
    EXPECT_EQ(read("String", truth), -1);
    EXPECT_EQ(peer->getErrorNumber(), 4);
    EXPECT_EQ(peer->getErrorMessage(), "Invalid reply value");
    EXPECT_EQ(peer->getReplyValue(truth), -1);
    EXPECT_EQ(peer->getErrorNumber(), 2);

    std::string text = "untouched";
    EXPECT_EQ(read("Bool", text), -1);
    EXPECT_EQ(peer->getErrorNumber(), 4);
    EXPECT_EQ(text, "untouched");
}

TEST_F(ARemoteObject, ReadsAStringWhereAPathWasExpectedAsThePeersErrorText) {
    ObjectPath path;
    EXPECT_EQ(read("PathAsString", path), -2);
    EXPECT_STREQ(path, "peer error text");
    EXPECT_EQ(peer->getErrorNumber(), 11);
    EXPECT_EQ(peer->getErrorMessage(), "peer error text");

    // Any other type: error 11 with the text left as it was.
    EXPECT_EQ(read("Int", path), -1);
    EXPECT_EQ(peer->getErrorNumber(), 11);
    EXPECT_EQ(peer->getErrorMessage(), "peer error text");
}

TEST_F(ARemoteObject, ReportsThePeersOwnErrorText) {
    ASSERT_EQ(peer->newMessage("Fail"), 0);
    EXPECT_EQ(peer->sendMessage(true, -1), -1);
    EXPECT_EQ(peer->getErrorNumber(), 11);
    EXPECT_EQ(peer->getErrorMessage(), "peer says no");

    ASSERT_EQ(peer->newMessage("NoSuchMethod"), 0);
    EXPECT_EQ(peer->sendMessage(true, -1), -1);
    EXPECT_EQ(peer->getErrorNumber(), 11);
    EXPECT_NE(peer->getErrorMessage().find("NoSuchMethod"), std::string::npos) << peer->getErrorMessage();
}

TEST_F(ARemoteObject, KeepsTheOutgoingCallWhenNewMessageIsGivenNull) {
    ASSERT_EQ(peer->newMessage("Echo"), 0);
    ASSERT_EQ(peer->append("kept"), 0);
    EXPECT_EQ(peer->newMessage(nullptr), -1);
    EXPECT_EQ(peer->getErrorMessage(), "Parameter is null");
    ASSERT_EQ(peer->sendMessage(true, -1), 0);
    std::string text;
    EXPECT_EQ(peer->getReplyValue(text), 0);
    EXPECT_EQ(text, "kept");
}

TEST_F(ARemoteObject, ReadsStringAndPathArrays) {
    std::vector<std::string> texts{ "stale" };
    EXPECT_EQ(read("Strings", texts), 0);
    EXPECT_EQ(texts, (std::vector<std::string>{ "a", "b", "c" }));
    EXPECT_EQ(read("EmptyStrings", texts), 0);
    EXPECT_TRUE(texts.empty());

    std::vector<ObjectPath> paths{ ObjectPath("/stale") };
    EXPECT_EQ(read("Paths", paths), 0);
    ASSERT_EQ(paths.size(), 2u);
    EXPECT_STREQ(paths[1], "/b/c");
    EXPECT_EQ(read("EmptyPaths", paths), 0);
    EXPECT_TRUE(paths.empty());

    EXPECT_EQ(read("HugeStrings", texts), 0);
    EXPECT_EQ(texts.size(), 100000u);
}

TEST_F(ARemoteObject, RejectsArraysThatDoNotHoldTexts) {
    std::vector<std::string> texts;
    EXPECT_EQ(read("String", texts), -1);
    EXPECT_EQ(peer->getErrorNumber(), 4);
    EXPECT_EQ(read("Ints", texts), -1);
    EXPECT_EQ(peer->getErrorNumber(), 4);
}

TEST_F(ARemoteObject, DecodesEveryAlternativeOfAPropertyDictionaryInArrivalOrder) {
    Dict dict;
    ASSERT_EQ(read("Properties", dict), 0) << peer->getErrorMessage();
    std::vector<std::pair<std::string, int>> expected = { { "Address", 3 }, { "Class", 0 },  { "Paired", 2 },
                                                          { "UUIDs", 4 },   { "RSSI", 5 },   { "Vendor", 1 },
                                                          { "Adapter", 3 }, { "Devices", 4 }, { "Empty", 4 } };
    ASSERT_EQ(dict.size(), expected.size());
    for (size_t i = 0; i < expected.size(); ++i) {
        EXPECT_EQ(dict[i].first, expected[i].first);
        EXPECT_EQ(dict[i].second.which(), expected[i].second) << dict[i].first;
    }
    EXPECT_EQ(boost::get<std::string>(dict[0].second), "00:11:22:33:44:55");
    EXPECT_EQ(boost::get<unsigned int>(dict[1].second), 7936u);
    EXPECT_FALSE(boost::get<bool>(dict[2].second));
    EXPECT_EQ(boost::get<std::vector<std::string>>(dict[3].second).size(), 2u);
    EXPECT_EQ(boost::get<int>(dict[4].second), -60);
    EXPECT_EQ(boost::get<unsigned short>(dict[5].second), 65535);
    EXPECT_EQ(boost::get<std::string>(dict[6].second), "/org/bluez/1/hci0");
    EXPECT_EQ(boost::get<std::vector<std::string>>(dict[7].second), (std::vector<std::string>{ "/d/1", "/d/2" }));
    EXPECT_TRUE(boost::get<std::vector<std::string>>(dict[8].second).empty());
}

TEST_F(ARemoteObject, StopsAtAValueItCannotHoldKeepingTheEntriesBefore) {
    for (const char* method : { "PropertiesWithDouble", "PropertiesWithInt32", "PropertiesWithNesting",
                                "PropertiesWithIntArray", "PropertiesWithStruct", "PropertiesWithByteKeys" }) {
        Dict dict;
        EXPECT_EQ(read(method, dict), -1) << method;
        EXPECT_EQ(peer->getErrorNumber(), 4) << method;
        EXPECT_TRUE(dict.empty()) << method;
    }
    Dict dict;
    EXPECT_EQ(read("PropertiesWithByte", dict), -1);
    EXPECT_EQ(peer->getErrorNumber(), 4);
    ASSERT_EQ(dict.size(), 1u);
    EXPECT_EQ(dict[0].first, "Name");
}

TEST_F(ARemoteObject, ReadsOtherDictionaryShapes) {
    Dict dict;
    EXPECT_EQ(read("PropertiesWithEmptyName", dict), 0);
    ASSERT_EQ(dict.size(), 2u);
    EXPECT_EQ(dict[1].first, "B");

    EXPECT_EQ(read("PropertiesWithUintKeys", dict), 0);
    ASSERT_EQ(dict.size(), 2u);
    EXPECT_EQ(dict[0].first, "1");
    EXPECT_EQ(dict[1].first, "2");

    EXPECT_EQ(read("Services", dict), 0);
    ASSERT_EQ(dict.size(), 2u);
    EXPECT_EQ(dict[0].first, "65537");
    EXPECT_EQ(boost::get<std::string>(dict[1].second), "<record id=\"2\"/>");

    EXPECT_EQ(read("StringPairs", dict), 0);
    ASSERT_EQ(dict.size(), 2u);
    EXPECT_EQ(boost::get<std::string>(dict[1].second), "2");

    EXPECT_EQ(read("Huge", dict), 0);
    EXPECT_EQ(dict.size(), 100000u);
}

TEST_F(ARemoteObject, RejectsRepliesThatAreNotDictionaries) {
    Dict dict{ Entry("stale", Variant(1u)) };
    EXPECT_EQ(read("String", dict), -1);
    EXPECT_EQ(peer->getErrorNumber(), 5);
    EXPECT_EQ(peer->getErrorMessage(), "Invalid reply format");
    EXPECT_EQ(read("Strings", dict), -1);
    EXPECT_EQ(peer->getErrorNumber(), 5);
    EXPECT_EQ(dict.size(), 1u);  // untouched before the format is known
}

TEST_F(ARemoteObject, DeliversOneWayCallsWithEveryArgumentType) {
    callPeer(*peer, "ClearRecorded");
    ASSERT_EQ(peer->newMessage("RecordScalars"), 0);
    ASSERT_EQ(peer->append(true), 0);
    ASSERT_EQ(peer->append("text"), 0);
    ASSERT_EQ(peer->append(ObjectPath("/a/b")), 0);
    ASSERT_EQ(peer->append(4294967295u), 0);
    ASSERT_EQ(peer->append(static_cast<unsigned short>(65535)), 0);
    EXPECT_EQ(peer->sendMessage(false, -1), 0);

    const Variant values[] = { Variant(7u), Variant(static_cast<unsigned short>(5)), Variant(true),
                               Variant(std::string("x")) };
    for (const Variant& value : values) {
        ASSERT_EQ(peer->newMessage("RecordVariant"), 0);
        ASSERT_EQ(peer->append(value), 0);
        EXPECT_EQ(peer->sendMessage(false, -1), 0);
    }
    ASSERT_EQ(peer->newMessage("RecordProperty"), 0);
    ASSERT_EQ(peer->append("Powered"), 0);
    ASSERT_EQ(peer->append(Variant(false)), 0);
    EXPECT_EQ(peer->sendMessage(false, -1), 0);

    EXPECT_EQ(recorded(), (std::vector<std::string>{ "RecordScalars(b:true, s:text, o:/a/b, u:4294967295, q:65535)",
                                                     "RecordVariant(v(u:7))", "RecordVariant(v(q:5))",
                                                     "RecordVariant(v(b:true))", "RecordVariant(v(s:x))",
                                                     "RecordProperty(s:Powered, v(b:false))" }));
}

TEST_F(ARemoteObject, SendsNothingWhenAnArgumentCannotBeWritten) {
    callPeer(*peer, "ClearRecorded");
    ASSERT_EQ(peer->newMessage("RecordVariant"), 0);
    EXPECT_EQ(peer->append(Variant(std::vector<std::string>{ "a" })), -1);
    EXPECT_EQ(peer->getErrorNumber(), 9);
    EXPECT_EQ(peer->getErrorMessage(), "Failed to open container");
    // The call frame stops at the first failure; nothing half-built was queued.
    EXPECT_TRUE(recorded().empty());
}

// ---- pending calls ----

using APendingCall = PeerTest;

TEST_F(APendingCall, ServesObjectPathsOnTheWaitingThreadUntilTheReplyArrives) {
    ServedPath served(*peer);
    ASSERT_EQ(peer->newMessage("CallBack"), 0);
    ASSERT_EQ(peer->append(peer->getConnectionName()), 0);
    ASSERT_EQ(peer->append(ObjectPath(ServedPath::kPath)), 0);
    EXPECT_EQ(peer->sendMessagePending(), 0);
    EXPECT_EQ(served.state.calls, 1);
    EXPECT_EQ(served.state.thread, std::this_thread::get_id());
    std::string text;
    EXPECT_EQ(peer->getReplyValue(text), 0) << peer->getErrorMessage();
    EXPECT_EQ(text, "called back: pong: ping");
}

TEST_F(APendingCall, StoresAnErrorReplyForTheCallerToRead) {
    ASSERT_EQ(peer->newMessage("Fail"), 0);
    EXPECT_EQ(peer->sendMessagePending(), 0);
    ObjectPath path;
    EXPECT_EQ(peer->getReplyValue(path), -2);
    EXPECT_EQ(peer->getErrorNumber(), 11);
    EXPECT_EQ(peer->getErrorMessage(), "peer says no");
}

TEST_F(APendingCall, ReturnsWithoutAReplyWhenInterrupted) {
    ASSERT_EQ(peer->newMessage("Sleep"), 0);
    ASSERT_EQ(peer->append(1500u), 0);
    std::thread interrupter([] {
        std::this_thread::sleep_for(200ms);
        kill(getpid(), SIGINT);
    });
    EXPECT_EQ(peer->sendMessagePending(), 0);
    interrupter.join();
    EXPECT_FALSE(Bluetooth::internal::interruptedFlag());
    EXPECT_FALSE(Bluetooth::internal::replyArrivedFlag());
    std::string text;
    EXPECT_EQ(peer->getReplyValue(text), -1);
    EXPECT_EQ(peer->getErrorNumber(), 2);

    // The late reply is dropped; the object is usable again.
    callPeer(*peer, "Echo", "again");
    EXPECT_EQ(peer->getReplyValue(text), 0);
    EXPECT_EQ(text, "again");
}

}  // namespace
