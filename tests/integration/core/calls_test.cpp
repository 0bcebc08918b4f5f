// Method calls against a real dbus-daemon and a dbusmock peer: replies of every
// shape, one-way calls, errors, and the pending call that keeps dispatching.
#include <csignal>
#include <thread>

#include <gtest/gtest.h>
#include <unistd.h>

#include <bluetooth/util.h>

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

    // Calls a reply-returning method of the peer and reads the reply into out,
    // expecting result and, for a failure, the error number.
    template <typename T>
    void read(const char* method, T& out, int result, int number = 0) {
        callPeer(*peer, method);
        EXPECT_EQ(peer->getReplyValue(out), result) << method;
        if (result != 0) EXPECT_EQ(peer->getErrorNumber(), number) << method;
    }

    std::unique_ptr<RemoteObject> peer;
};

// Each entry as name=alternative:text, the alternative being Variant's index.
std::string describe(const Dict& dict) {
    std::string text;
    for (const Entry& entry : dict)
        text += entry.first + "=" + std::to_string(entry.second.which()) + ":" + variantToString(entry.second) + ";";
    return text;
}

using ARemoteObject = PeerTest;

TEST_F(ARemoteObject, ReadsEachScalarReplyOnceAndConsumesOneOfTheWrongType) {
    std::string text = "untouched";
    bool truth = false;
    ObjectPath path;
    read("Bool", text, -1, 4);
    EXPECT_EQ(text, "untouched");
    read("String", truth, -1, 4);
    EXPECT_EQ(peer->getErrorMessage(), "Invalid reply value");
    EXPECT_EQ(peer->getReplyValue(truth), -1);
    EXPECT_EQ(peer->getErrorNumber(), 2);

    read("String", text, 0);
    EXPECT_EQ(text, "hello");
    EXPECT_EQ(peer->getReplyValue(text), -1);
    EXPECT_EQ(peer->getErrorNumber(), 2);
    EXPECT_EQ(peer->getErrorMessage(), "Reply message is null");
    read("Bool", truth, 0);
    EXPECT_TRUE(truth);
    read("Path", path, 0);
    EXPECT_STREQ(path, "/org/btbus/Thing");

    // A string where a path was expected is the peer's error text; any other
    // type is error 11 with the text left as it was.
    read("PathAsString", path, -2, 11);
    EXPECT_STREQ(path, "peer error text");
    EXPECT_EQ(peer->getErrorMessage(), "peer error text");
    read("Int", path, -1, 11);
    EXPECT_EQ(peer->getErrorMessage(), "peer error text");
}

TEST_F(ARemoteObject, ReportsThePeersOwnErrorNameAndText) {
    ASSERT_EQ(peer->newMessage("Fail"), 0);
    EXPECT_EQ(peer->sendMessage(true, -1), -1);
    EXPECT_EQ(peer->getErrorNumber(), 11);
    EXPECT_EQ(peer->getErrorMessage(), "peer says no");
    EXPECT_EQ(peer->getErrorName(), "org.btbus.Error.Failed");
    peer->resetError();
    EXPECT_EQ(peer->getErrorName(), "");

    ASSERT_EQ(peer->newMessage("NoSuchMethod"), 0);
    EXPECT_EQ(peer->sendMessage(true, -1), -1);
    EXPECT_EQ(peer->getErrorNumber(), 11);
    EXPECT_NE(peer->getErrorMessage().find("NoSuchMethod"), std::string::npos) << peer->getErrorMessage();
}

TEST_F(ARemoteObject, KeepsTheOutgoingCallWhenNewMessageIsGivenNull) {
    buildCall(*peer, "Echo", "kept");
    EXPECT_EQ(peer->newMessage(nullptr), -1);
    EXPECT_EQ(peer->getErrorMessage(), "Parameter is null");
    ASSERT_EQ(peer->sendMessage(true, -1), 0);
    std::string text;
    EXPECT_EQ(peer->getReplyValue(text), 0);
    EXPECT_EQ(text, "kept");
}

TEST_F(ARemoteObject, ReadsStringAndPathArraysOnly) {
    std::vector<std::string> texts{ "stale" };
    read("Strings", texts, 0);
    EXPECT_EQ(texts, (std::vector<std::string>{ "a", "b", "c" }));
    read("EmptyStrings", texts, 0);
    EXPECT_TRUE(texts.empty());
    read("HugeStrings", texts, 0);
    EXPECT_EQ(texts.size(), 100000u);
    read("String", texts, -1, 4);
    read("Ints", texts, -1, 4);

    std::vector<ObjectPath> paths{ ObjectPath("/stale") };
    read("Paths", paths, 0);
    ASSERT_EQ(paths.size(), 2u);
    EXPECT_STREQ(paths[1], "/b/c");
    read("EmptyPaths", paths, 0);
    EXPECT_TRUE(paths.empty());
}

TEST_F(ARemoteObject, DecodesDictionariesInArrivalOrderUpToAValueItCannotHold) {
    const struct {
        const char* method;
        int result, number;
        const char* entries;  // read into a dictionary that held one stale entry
    } kCases[] = {
        { "Properties", 0, 0,
          "Address=3:00:11:22:33:44:55;Class=0:7936;Paired=2:0;UUIDs=4:[0000110b-0000-1000-8000-00805f9b34fb, x];"
          "RSSI=5:-60;Vendor=1:65535;Adapter=3:/org/bluez/1/hci0;Devices=4:[/d/1, /d/2];Empty=4:[];" },
        { "PropertiesWithEmptyName", 0, 0, "A=0:1;B=0:2;" },
        { "PropertiesWithUintKeys", 0, 0, "1=3:one;2=0:2;" },
        { "Services", 0, 0, "65537=3:<record/>;65538=3:<record id=\"2\"/>;" },
        { "StringPairs", 0, 0, "a=3:1;b=3:2;" },
        { "PropertiesWithByte", -1, 4, "Name=3:before;" },  // the entries before are kept
        { "PropertiesWithDouble", -1, 4, "" },
        { "PropertiesWithInt32", -1, 4, "" },
        { "PropertiesWithNesting", -1, 4, "" },
        { "PropertiesWithIntArray", -1, 4, "" },
        { "PropertiesWithStruct", -1, 4, "" },
        { "PropertiesWithByteKeys", -1, 4, "" },
        { "String", -1, 5, "stale=0:1;" },  // untouched before the format is known
        { "Strings", -1, 5, "stale=0:1;" },
    };
    for (const auto& row : kCases) {
        Dict dict{ Entry("stale", Variant(1u)) };
        read(row.method, dict, row.result, row.number);
        EXPECT_EQ(describe(dict), row.entries) << row.method;
    }
    EXPECT_EQ(peer->getErrorMessage(), "Invalid reply format");
    Dict dict;
    read("Huge", dict, 0);
    EXPECT_EQ(dict.size(), 100000u);
}

TEST_F(ARemoteObject, DeliversOneWayCallsWithEveryArgumentType) {
    callPeer(*peer, "ClearRecorded");
    auto oneWay = [&](const char* method, const auto&... args) {
        buildCall(*peer, method, args...);
        EXPECT_EQ(peer->sendMessage(false, -1), 0) << method;
    };
    oneWay("RecordScalars", true, "text", ObjectPath("/a/b"), 4294967295u, static_cast<unsigned short>(65535));
    for (const Variant& value : { Variant(7u), Variant(static_cast<unsigned short>(5)), Variant(true),
                                  Variant(std::string("x")) })
        oneWay("RecordVariant", value);
    oneWay("RecordProperty", "Powered", Variant(false));

    EXPECT_EQ(recorded(), (std::vector<std::string>{ "RecordScalars(b:true, s:text, o:/a/b, u:4294967295, q:65535)",
                                                     "RecordVariant(v(u:7))", "RecordVariant(v(q:5))",
                                                     "RecordVariant(v(b:true))", "RecordVariant(v(s:x))",
                                                     "RecordProperty(s:Powered, v(b:false))" }));
}

// ---- pending calls ----

using APendingCall = PeerTest;

TEST_F(APendingCall, ServesObjectPathsOnTheWaitingThreadUntilTheReplyArrives) {
    ServedPath served(*peer);
    buildCall(*peer, "CallBack", peer->getConnectionName(), ObjectPath(ServedPath::kPath));
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
    buildCall(*peer, "Sleep", 1500u);
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
